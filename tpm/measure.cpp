// Extending a PCR: the boot verdict's measurement. Apart from the key
// manager's entry points, so that keymgr links no more of the TPM stack than
// this.
#include <cstring>

#include "tpm/commands.h"
#include "tpm/pcp.h"

using namespace keymgr::tpm;

int pcp_extend_pcr(uint32_t pcr, const uint8_t* digest) {
  if (pcr > 23 || digest == nullptr) {
    return 1;
  }
  SigpipeBlock sigpipe;
  Connection tpm;
  if (!Connect(tpm, BuildOptions()).ok()) {
    return 1;
  }
  TPML_DIGEST_VALUES values{};
  values.count = 1;
  values.digests[0].hashAlg = TPM2_ALG_SHA256;
  std::memcpy(values.digests[0].digest.sha256, digest, TPM2_SHA256_DIGEST_SIZE);
  return PcrExtend(tpm, pcr, ESYS_TR_PASSWORD, values).ok() ? 0 : 1;
}
