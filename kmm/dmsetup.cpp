// The digest check of the disk-mapper tool: its SHA-256 against the digest
// built into the crypto services, compared byte by byte through protected
// key records so that neither digest is handled as a plain array.
#include <kmm/dtc.h>
#include <kmm/kmm.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>

#include "util/file_digest.h"
#include "util/paths.h"
#include "util/secure.h"

int CheckDmsetupDigest(void) {
  constexpr std::uint32_t kCompareLength = 32;

  ProtectedKey* expected = nullptr;
  std::uint32_t expectedLength = 0;
  VKT_DTC_GetConstant(DTC_CONST_DMSETUP_DIGEST, &expected, &expectedLength);

  keymgr::Secret<keymgr::kFileDigestSize> digest;
  switch (keymgr::ComputeFileDigest(keymgr::kDmsetupPath, digest.bytes)) {
    case keymgr::FileDigestResult::kStatusFailure:
      std::printf("file[%s] status error : %d\n", keymgr::kDmsetupPath, errno);
      return -1;
    case keymgr::FileDigestResult::kOpenFailure:
      std::printf("file[%s] open error : %d\n", keymgr::kDmsetupPath, errno);
      return -1;
    case keymgr::FileDigestResult::kOk:
      break;
  }

  ProtectedKey computed{};
  ProtectedKey_Attach(&computed, 0, digest.data());
  ProtectedKey_SetLength(&computed, kCompareLength);

  int difference = 0;
  for (std::uint32_t i = 0; i < kCompareLength; ++i) {
    difference = static_cast<int>(ProtectedKey_ByteAt(&computed, i)) -
                 static_cast<int>(ProtectedKey_ByteAt(expected, i));
    if (difference != 0) {
      break;
    }
  }
  return difference != 0 ? -1 : 0;
}
