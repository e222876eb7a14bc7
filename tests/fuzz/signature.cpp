// The signature file's decoder and check over any bytes: what the decoder
// accepts is a whole file with the magic, whose fields encode back to those
// bytes, and the check accepts nothing that the key did not sign.
#include <array>
#include <cstdint>
#include <cstring>

#include "integrity/signature.h"
#include "support/files.h"
#include "util/hex.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace integrity = keymgr::integrity;
  using keymgr::test::Require;
  integrity::SignatureFile file;
  if (integrity::DecodeSignatureFile({data, size}, &file).ok()) {
    std::array<std::uint8_t, integrity::kSignatureFileSize> again{};
    integrity::EncodeSignatureFile(file, again);
    Require(size == again.size() && std::memcmp(again.data(), data, size) == 0);
  }
  // The key of tests/cli/data/digest_key.pem, whose seed file signs nothing
  // that anyone could make of these bytes.
  constexpr integrity::PublicKey kKey =
      *keymgr::HexBytes<32>("bf693fabaf26f011ded9d401aef699160c4ae4b3846476ca45bd199ae86ca058");
  std::uint64_t counter = 0;
  Require(!integrity::CheckSignatureFile({data, size}, kKey, {}, {}, &counter).ok());
  return 0;
}
