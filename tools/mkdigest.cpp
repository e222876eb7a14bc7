// keymgr-mkdigest: the digest file of an image's root, made on the build host
// byte for byte as keymgr hash would make it on the device, and signed.
//   keymgr-mkdigest --root DIR [--manifest FILE] [--output FILE]
//                   [--key KEY.pem --counter N]
// The manifest is read with the device's own reader, and signed only when
// the device will check it as it is hashed here: at least one entry, each an
// absolute path in normal form. Each entry, and FILE below DIR, is resolved
// inside DIR as the device resolves a path at its root: an absolute symbolic
// link points into DIR, and ".." never leaves it. What cannot be signed or
// hashed is named, nothing is written and the exit status is 1. No root, no
// clock: the same tree gives the same bytes on every host.
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
#include "tools/mkdigest_manifest.h"
#include "util/atomic_file.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"

namespace {

struct Args {
  std::string root;              // without a trailing slash: "" is the host's root
  std::string manifest, output;  // as given, below the root; "" for the defaults
  std::string key;
  std::uint64_t counter = 0;
};

int Usage() {
  (void)std::fprintf(stderr,
                     "usage: keymgr-mkdigest --root DIR [--manifest FILE] [--output FILE] "
                     "[--key KEY.pem --counter N]\n");
  return 2;
}

int Fail(const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-mkdigest: %s\n", what.c_str());
  return 1;
}

// InImage is the path below the root of |given|, a path on this host that
// starts with the root, or of the device's |fixed| path when none is given;
// "" when |given| is not below the root. The device's fixed paths carry no
// KEYMGR_ROOT in a device build; a test build's carry its sandbox, which the
// defaults leave out.
std::string InImage(const std::string& root, const std::string& given, const char* fixed) {
  if (given.empty()) {
    return fixed + std::strlen(KEYMGR_ROOT);
  }
  return given.starts_with(root + "/") ? given.substr(root.size()) : "";
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
  while (args.root.ends_with('/')) {
    args.root.pop_back();
  }
  return true;
}

// Under is the path on this host of |at|, components below |root|.
std::string Under(const std::string& root, const std::vector<std::string>& at) {
  std::string path = root;
  for (const std::string& component : at) {
    path.append("/").append(component);
  }
  return path.empty() ? "/" : path;
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
// absolute one from the root again), ".." stopping at the root. Returns the
// path of the file on this host, made of no link, or "" with errno set.
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

// HashEntries appends the digest of each of |entries|, resolved inside
// |root|, to |digests|, as the digest file holds them; it names the first
// that cannot be hashed and returns 1.
int HashEntries(const std::string& root, const std::vector<std::string>& entries,
                std::vector<std::uint8_t>& digests) {
  for (const std::string& entry : entries) {
    const std::string path = InRoot(root, entry);
    std::array<std::uint8_t, keymgr::crypto::kSha256Size> digest{};
    const keymgr::HashResult hashed = path.empty()
                                          ? keymgr::HashResult{keymgr::HashResult::kStat, {}}
                                          : keymgr::ComputeFileDigest(path.c_str(), digest);
    if (!hashed.ok()) {
      return Fail(entry + ": cannot be hashed (" +
                  (hashed.failure == keymgr::HashResult::kStat ? "status" : "open") + " error)");
    }
    digests.insert(digests.end(), digest.begin(), digest.end());
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  Args args;
  if (!ParseArgs(argc, argv, args)) {
    return Usage();
  }
  // The device's release floor starts at 1 and never holds 0.
  if (!args.key.empty() && args.counter == 0) {
    (void)Fail("signing needs --counter N, from 1: no device holds release 0");
    return 2;
  }
  const std::string manifestPath = InImage(args.root, args.manifest, keymgr::kManifestPath);
  const std::string outputPath = InImage(args.root, args.output, keymgr::kDigestFilePath);
  const std::size_t slash = outputPath.rfind('/');
  const std::string name = outputPath.substr(slash + 1);
  if (manifestPath.empty() || outputPath.empty()) {
    return Fail((manifestPath.empty() ? args.manifest : args.output) + ": not below the root " +
                args.root + "/");
  }
  if (name.empty() || name == "." || name == "..") {
    return Fail(args.output + ": names no file");
  }
  // The manifest is read once: the entries hashed are those of the bytes
  // whose digest is signed.
  const std::string manifestFile = InRoot(args.root, manifestPath);
  const keymgr::File file =
      manifestFile.empty() ? keymgr::File() : keymgr::OpenFile(manifestFile.c_str(), "rb");
  keymgr::HeapBytes bytes;
  std::size_t size = 0;
  if (!file || !keymgr::ReadWhole(file.get(), SIZE_MAX, bytes, &size)) {
    return Fail(args.root + manifestPath + ": " + std::strerror(errno));
  }
  const std::span<const std::uint8_t> manifest(bytes.get(), size);
  std::vector<std::string> entries;
  if (const std::string why = keymgr::tools::ReadSignableManifest(manifest, entries);
      !why.empty()) {
    return Fail(args.root + manifestPath + ": " + why);
  }
  std::vector<std::uint8_t> digests;
  if (HashEntries(args.root, entries, digests) != 0) {
    return 1;
  }
  // Everything is made before anything is written. Both files are put in the
  // output's folder, resolved inside the root; whatever sits at their names
  // is replaced, never followed.
  std::array<std::uint8_t, keymgr::integrity::kSignatureFileSize> signature{};
  if (!args.key.empty() && Sign(args, manifest, digests, signature) != 0) {
    return 1;
  }
  const std::string folder = InRoot(args.root, outputPath.substr(0, slash));
  if (folder.empty()) {
    return Fail(args.root + outputPath + ": " + std::strerror(errno));
  }
  if (Write(folder + "/" + name, digests.data(), digests.size()) != 0) {
    return 1;
  }
  return args.key.empty() ? 0 : Write(folder + "/keymgr.sig", signature.data(), signature.size());
}
