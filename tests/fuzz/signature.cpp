// The signature file's decoder and check over any bytes: what the decoder
// accepts is a whole file with the magic, whose fields encode back to those
// bytes, and the check accepts nothing that the key did not sign.
#include <array>
#include <cstdint>
#include <cstring>

#include "integrity/signature.h"
#include "support/files.h"

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
  constexpr integrity::PublicKey kKey = {0xbf, 0x69, 0x3f, 0xab, 0xaf, 0x26, 0xf0, 0x11,
                                         0xde, 0xd9, 0xd4, 0x01, 0xae, 0xf6, 0x99, 0x16,
                                         0x0c, 0x4a, 0xe4, 0xb3, 0x84, 0x64, 0x76, 0xca,
                                         0x45, 0xbd, 0x19, 0x9a, 0xe8, 0x6c, 0xa0, 0x58};
  std::uint64_t counter = 0;
  Require(!integrity::CheckSignatureFile({data, size}, kKey, {}, {}, &counter).ok());
  return 0;
}
