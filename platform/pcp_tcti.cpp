#include "platform/pcp_tcti.h"

#include "keymgr_build_config.h"

namespace keymgr {

const char kPcpTcti[] = KEYMGR_TCTI;

}  // namespace keymgr
