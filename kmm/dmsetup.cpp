// The digest check of the disk-mapper tool: its SHA-256 against the digest
// built into the crypto services, compared byte by byte through protected
// key records so that neither digest is handled as a plain array.
#include <kmm/kmm.h>

#include <cstdint>
#include <cstdio>

#include "crypto/file_digest.h"
#include "kmm/internal.h"
#include "util/paths.h"
#include "util/secure.h"

using namespace keymgr::kmm;

int CheckDmsetupDigest(void) {
  constexpr std::uint32_t kCompareLength = 32;

  ProtectedKey* expected = nullptr;
  std::uint32_t expectedLength = 0;
  FetchConstant(DTC_CONST_DMSETUP_DIGEST, &expected, &expectedLength);

  keymgr::Secret<keymgr::crypto::kSha256Size> digest;
  if (const keymgr::HashResult hashed =
          keymgr::ComputeFileDigest(keymgr::kDmsetupPath, digest.bytes);
      !hashed.ok()) {
    // The messages carry errno, which the failure keeps as its code.
    std::printf(hashed.failure == keymgr::HashResult::kStat ? "file[%s] status error : %d\n"
                                                            : "file[%s] open error : %d\n",
                keymgr::kDmsetupPath, static_cast<int>(hashed.status.code()));
    return -1;
  }

  ProtectedKey computed{};
  Bind(&computed, digest.data(), kCompareLength);

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
