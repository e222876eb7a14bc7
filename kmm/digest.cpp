// The SC digest: the module's proof that the secret key is the one stored.
#include <array>
#include <cstdint>

#include "eeprom/eeprom.h"
#include "kmm/internal.h"
#include "util/debug_print.h"

using namespace keymgr::kmm;

int HashRecord(const ProtectedKey* in, std::uint32_t inLength, ProtectedKey* out,
               std::uint32_t* outLength) {
  std::uint32_t result = 0;
  Container container(VKT_DTC_CreateCryptoContainer());
  if (!container) {
    // Creation reports no code; the line shows the result so far, 0.
    DebugPrint("VKT_DTC_CreateCryptoContainer Failed. nRes=0x%08x\n", result);
    return 1;
  }
  result = VKT_DTC_GetHash(container.get(), DTC_HASH_SELECTOR, in, inLength, out, outLength);
  if (result != 0 || *outLength != kScDigestSize) {
    DebugPrint("VKT_DTC_GetHash Failed. nRes=0x%08x\n", result);
    return 1;
  }
  return 0;
}

int GenerateMessageDigest(std::int32_t /*length*/, ProtectedKey secretKey, int store,
                          std::uint8_t* digest) {
  std::uint32_t digestLength = kScDigestSize;
  std::array<std::uint8_t, kScDigestSize> digestArea{};
  ProtectedKey digestKey;
  Bind(&digestKey, digestArea.data(), kScDigestSize);
  // The input is always the 32-byte secret key, whatever length was passed.
  if (HashRecord(&secretKey, kScDigestSize, &digestKey, &digestLength) != 0) {
    return 1;
  }
  for (std::uint32_t i = 0; i < kScDigestSize; ++i) {
    digest[i] = ProtectedKey_ByteAt(&digestKey, i);
  }

  if (store != 0) {
    if (WriteEEPROM_Bytes_Sema(keymgr::eeprom::kDevice, keymgr::eeprom::kScDigestOffset,
                               kScDigestSize, digest) < 0) {
      DebugPrint("Write error - Message Digest to EEPROM !!!\n");
      return 1;
    }
    // WriteDigestHDD returns 0 or 1, so this test never fires: a disk copy
    // that cannot be written is reported by WriteDigestHDD alone, and the
    // digest still counts as created. The boot check catches the stale copy.
    if (WriteDigestHDD(digest) < 0) {
      DebugPrint("Write error - Message Digest to HDD !!!\n");
      return 1;
    }
  }
  DebugPrint("SC Digest is created!!\n");
  return 0;
}
