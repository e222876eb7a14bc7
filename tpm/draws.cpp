// Random draws from the TPM's generator.
#include <algorithm>
#include <cstring>

#include "tpm/commands.h"
#include "tpm/keys.h"

namespace keymgr::tpm {

namespace {

// TPM2_GetRandom gives at most the size of the TPM's largest digest.
constexpr uint32_t kMaxEntropy = sizeof(TPMU_HA);

}  // namespace

Status DrawRandom(Connection& tpm, uint32_t count, uint8_t* dst) {
  // The draws become keys and passwords: the response is encrypted.
  if (Status status = UseSaltedSession(tpm, TPMA_SESSION_ENCRYPT); !status.ok()) {
    return status;
  }
  uint32_t filled = 0;
  while (filled < count) {
    const auto want = static_cast<uint16_t>(std::min(count - filled, kMaxEntropy));
    SecretOutput<TPM2B_DIGEST> part;
    if (Status status = GetRandom(tpm, tpm.session.get().tr, want, &part); !status.ok()) {
      return status;
    }
    const uint32_t take = std::min<uint32_t>({part.get()->size, want, sizeof(part.get()->buffer)});
    if (take == 0) {
      return Refused("Esys_GetRandom");
    }
    std::memcpy(dst + filled, part.get()->buffer, take);
    filled += take;
  }
  return Status();
}

Status DrawEntropy(Connection& tpm, uint32_t count, uint8_t* dst, uint32_t* drawn) {
  if (dst == nullptr || drawn == nullptr) {
    return Refused("pcp_getEntropyBytes");
  }
  SecretOutput<TPM2B_DIGEST> part;
  const auto want = static_cast<uint16_t>(std::min(count, kMaxEntropy));
  if (Status status = GetRandom(tpm, ESYS_TR_NONE, want, &part); !status.ok()) {
    return status;
  }
  *drawn = std::min<uint32_t>({part.get()->size, want, sizeof(part.get()->buffer)});
  std::memcpy(dst, part.get()->buffer, *drawn);
  return Status();
}

}  // namespace keymgr::tpm
