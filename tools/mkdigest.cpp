// keymgr-mkdigest: the digest file of an image's root, made on the build host
// byte for byte as keymgr hash would make it on the device, and signed.
//   keymgr-mkdigest --root DIR [--manifest FILE] [--output FILE]
//                   [--key KEY.pem] [--counter N]
// Each manifest entry is read with the device's own reader and resolved
// inside DIR as the device resolves it at its root: an absolute symbolic link
// points into DIR, and ".." never leaves it. An entry that cannot be hashed
// is named, nothing is written and the exit status is 1. No root, no clock:
// the same tree gives the same bytes on every host.
#include <openssl/pem.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <span>
#include <string>
#include <vector>

#include "crypto/ed25519.h"
#include "crypto/file_digest.h"
#include "crypto/hash.h"
#include "crypto/openssl_handles.h"
#include "integrity/manifest.h"
#include "integrity/signature.h"
#include "util/atomic_file.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"

namespace {

using keymgr::integrity::EntryRead;

struct Args {
  std::string root, manifest, output, key;
  std::uint64_t counter = 0;
};

int Usage() {
  (void)std::fprintf(stderr,
                     "usage: keymgr-mkdigest --root DIR [--manifest FILE] [--output FILE] "
                     "[--key KEY.pem] [--counter N]\n");
  return 2;
}

int Fail(const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-mkdigest: %s\n", what.c_str());
  return 1;
}

// The device's fixed paths carry no KEYMGR_ROOT in a device build; a test
// build's carry its sandbox, which the tool's defaults leave out.
std::string InImage(const std::string& root, const char* fixed) {
  return root + (fixed + std::strlen(KEYMGR_ROOT));
}

bool ParseArgs(int argc, char** argv, Args& args) {
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    const std::string value = argv[i + 1];
    char* end = nullptr;
    errno = 0;
    if (option == "--root") {
      args.root = value;
    } else if (option == "--manifest") {
      args.manifest = value;
    } else if (option == "--output") {
      args.output = value;
    } else if (option == "--key") {
      args.key = value;
    } else if (option == "--counter" && !value.empty() && value[0] != '-' &&
               (args.counter = std::strtoull(value.c_str(), &end, 10), *end == '\0') &&
               errno == 0) {
    } else {
      return false;
    }
  }
  if (argc % 2 == 0 || args.root.empty()) {
    return false;
  }
  args.manifest = args.manifest.empty() ? InImage(args.root, keymgr::kManifestPath) : args.manifest;
  args.output = args.output.empty() ? InImage(args.root, keymgr::kDigestFilePath) : args.output;
  return true;
}

// Under is the path on this host of |at|, components below |root|.
std::string Under(const std::string& root, const std::vector<std::string>& at) {
  std::string path = root;
  for (const std::string& component : at) {
    path.append("/").append(component);
  }
  return path;
}

// Follow replaces the link at |path|, the last of |at|, by its target in
// front of |rest|; an absolute target starts again at the root. Fails with
// ELOOP after 40 links, as the kernel does.
bool Follow(const std::string& path, std::vector<std::string>& at, std::string& rest, int& links) {
  at.pop_back();
  std::array<char, 4096> target{};
  const ssize_t length = ::readlink(path.c_str(), target.data(), target.size() - 1);
  if (length < 0 || ++links > 40) {
    errno = length < 0 ? errno : ELOOP;
    return false;
  }
  if (target[0] == '/') {
    at.clear();
  }
  rest = std::string(target.data()).append(rest.empty() ? "" : "/").append(rest);
  return true;
}

// InRoot resolves |entry| inside |root| as the device resolves it at its own
// root: component by component, a symbolic link replaced by its target (an
// absolute one from the root again), ".." stopping at the root. A relative
// entry is taken from the root, where a boot script starts. Returns the path
// of the file on this host, or "" with errno set.
std::string InRoot(const std::string& root, const std::string& entry) {
  std::vector<std::string> at;  // the components resolved so far, below the root
  std::string rest = entry;
  for (int links = 0; !rest.empty();) {
    const std::size_t slash = rest.find('/');
    const std::string part = rest.substr(0, slash);
    rest = slash == std::string::npos ? "" : rest.substr(slash + 1);
    if (part == ".." && !at.empty()) {
      at.pop_back();
    }
    if (part.empty() || part == "." || part == "..") {
      continue;
    }
    at.push_back(part);
    const std::string path = Under(root, at);
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0) {
      return "";
    }
    if (S_ISLNK(st.st_mode) && !Follow(path, at, rest, links)) {
      return "";
    }
  }
  return Under(root, at);
}

// Sign lays out keymgr.sig for |manifest| and |digests| in |bytes|, signed
// with the private key in args.key.
int Sign(const Args& args, std::span<const std::uint8_t> manifest,
         std::span<const std::uint8_t> digests,
         std::span<std::uint8_t, keymgr::integrity::kSignatureFileSize> bytes) {
  const keymgr::File pem(std::fopen(args.key.c_str(), "r"));
  const keymgr::crypto::EvpPkey key(pem ? PEM_read_PrivateKey(pem.get(), nullptr, nullptr, nullptr)
                                        : nullptr);
  keymgr::integrity::SignatureFile file;
  file.counter = args.counter;
  file.listDigest = keymgr::crypto::Sha256Of(manifest);
  file.digestsDigest = keymgr::crypto::Sha256Of(digests);
  keymgr::integrity::PublicKey publicKey{};
  if (!keymgr::crypto::Ed25519PublicKey(key.get(), publicKey).ok()) {
    return Fail(args.key + ": not an Ed25519 private key in PEM");
  }
  file.keyId = keymgr::integrity::KeyIdOf(publicKey);
  keymgr::integrity::EncodeSignatureFile(file, bytes);
  if (!keymgr::crypto::Ed25519Sign(key.get(), bytes.first(keymgr::integrity::kSignedSize),
                                   file.signature)
           .ok()) {
    return Fail(args.key + ": cannot sign");
  }
  keymgr::integrity::EncodeSignatureFile(file, bytes);
  return 0;
}

// Write puts |size| bytes at |path|, whole or not at all.
int Write(const std::string& path, const void* bytes, std::size_t size) {
  return keymgr::ReplaceFile(path.c_str(), bytes, size, keymgr::kDigestFileMode).ok()
             ? 0
             : Fail(path + ": " + std::strerror(errno));
}

}  // namespace

int main(int argc, char** argv) {
  Args args;
  if (!ParseArgs(argc, argv, args)) {
    return Usage();
  }
  // The manifest is read once: the entries hashed are those of the bytes
  // whose digest is signed.
  const keymgr::File file(std::fopen(args.manifest.c_str(), "rb"));
  keymgr::HeapBytes bytes;
  std::size_t size = 0;
  if (!file || !keymgr::ReadWhole(file.get(), SIZE_MAX, bytes, &size)) {
    return Fail(args.manifest + ": " + std::strerror(errno));
  }
  const std::span<const std::uint8_t> manifest(bytes.get(), size);
  const keymgr::File entries(::fmemopen(bytes.get(), size, "r"));
  std::vector<std::uint8_t> digests;
  keymgr::integrity::EntryBuffer entry{};
  EntryRead read = EntryRead::kReadError;
  while (entries &&
         (read = keymgr::integrity::ReadEntry(entries.get(), entry)) == EntryRead::kEntry) {
    const std::string path = InRoot(args.root, entry.data());
    std::array<std::uint8_t, keymgr::crypto::kSha256Size> digest{};
    const keymgr::HashResult hashed = path.empty()
                                          ? keymgr::HashResult{keymgr::HashResult::kStat, {}}
                                          : keymgr::ComputeFileDigest(path.c_str(), digest);
    if (!hashed.ok()) {
      return Fail(std::string(entry.data()) + ": cannot be hashed (" +
                  (hashed.failure == keymgr::HashResult::kStat ? "status" : "open") + " error)");
    }
    digests.insert(digests.end(), digest.begin(), digest.end());
    entry.fill(0);
  }
  if (read != EntryRead::kEnd) {
    return Fail(args.manifest + ": an entry is too long, holds a NUL byte, or cannot be read");
  }
  // Everything is made before anything is written.
  std::array<std::uint8_t, keymgr::integrity::kSignatureFileSize> signature{};
  if (!args.key.empty() && Sign(args, manifest, digests, signature) != 0) {
    return 1;
  }
  const std::size_t slash = args.output.rfind('/');
  const std::string folder = slash == std::string::npos ? "" : args.output.substr(0, slash + 1);
  if (Write(args.output, digests.data(), digests.size()) != 0) {
    return 1;
  }
  return args.key.empty() ? 0 : Write(folder + "keymgr.sig", signature.data(), signature.size());
}
