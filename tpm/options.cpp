// The build's connection options, alone in their object file: a test program
// that defines BuildOptions itself never pulls this member in.
#include "keymgr_build_config.h"
#include "tpm/connection.h"

namespace keymgr::tpm {

Options BuildOptions() {
  return {KEYMGR_TCTI, KEYMGR_TPM_TIMEOUT_MS, KEYMGR_SEAL_PCR};
}

}  // namespace keymgr::tpm
