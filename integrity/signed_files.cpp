// The check of keymgr.sig in a signed build (one with KEYMGR_DIGEST_PUBKEY).
#include <cstring>
#include <optional>

#include "crypto/hash.h"
#include "integrity/internal.h"
#include "integrity/signature.h"
#include "keymgr_digest_key.h"
#include "util/debug_print.h"
#include "util/hex.h"
#include "util/io.h"

namespace keymgr::integrity {

namespace {

// The files are read whole, and one larger than this fails the check: a
// manifest of ten thousand entries and its digest file are far smaller.
constexpr std::size_t kMaxSignedFile = std::size_t{16} << 20;

constexpr std::optional<PublicKey> kParsedKey = HexBytes<32>(KEYMGR_DIGEST_PUBKEY_HEX);
static_assert(kParsedKey.has_value(), "KEYMGR_DIGEST_PUBKEY_HEX must be 64 hex digits");
constexpr PublicKey kDigestKey = *kParsedKey;

// Over opens a stream that reads the |size| bytes at |bytes|.
File Over(std::uint8_t* bytes, std::size_t size) {
  return File(::fmemopen(bytes, size, "r"));
}

}  // namespace

bool SignedFiles::Check(File& digests, File& manifest, bool verbose, BootCheck* check) {
  // The files first, then the signature file: what is checked is what was
  // read, whatever the files hold by the time the signature is.
  std::size_t digestsSize = 0;
  std::size_t manifestSize = 0;
  bool ok = ReadWhole(digests.get(), kMaxSignedFile, digests_, &digestsSize) &&
            ReadWhole(manifest.get(), kMaxSignedFile, manifest_, &manifestSize);
  std::uint8_t signature[kSignatureFileSize + 1] = {};  // one more, to see a longer file
  std::uint64_t counter = 0;
  if (const File file = OpenFile(kSignaturePath, "r"); ok && file) {
    const std::size_t size = std::fread(signature, 1, sizeof(signature), file.get());
    ok = CheckSignatureFile({signature, size}, kDigestKey, {manifest_.get(), manifestSize},
                            {digests_.get(), digestsSize}, &counter)
             .ok();
  } else {
    ok = false;
  }
  // An older release than one that booted good is refused as a bad signature
  // would be: its fixed faults stay fixed.
  if (ok && check->floor && counter < *check->floor) {
    DebugPrint("release counter: %llu is below the release that booted, %llu!!!\n",
               static_cast<unsigned long long>(counter),
               static_cast<unsigned long long>(*check->floor));
    ok = false;
  }
  if (!ok) {
    DebugPrint("%s signature error!!!\n", kSignaturePath);
    return false;
  }
  if (verbose) {
    DebugPrint("release counter: %llu\n", static_cast<unsigned long long>(counter));
  }
  check->release = counter;
  check->manifestSha256 = crypto::Sha256Of({manifest_.get(), manifestSize});
  check->digestsSha256 = crypto::Sha256Of({digests_.get(), digestsSize});
  digests = Over(digests_.get(), digestsSize);
  manifest = Over(manifest_.get(), manifestSize);
  return digests && manifest;
}

}  // namespace keymgr::integrity
