#include "keymgr_build_config.h"
#include "platform/pcp_tcti.h"

namespace keymgr {

const int kPcpDeadlineMs = KEYMGR_TPM_TIMEOUT_MS;

}  // namespace keymgr
