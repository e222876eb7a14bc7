#include "support/tpm_settings.h"

#include "tpm/pcp.h"

namespace keymgr::test {

void UseTransport(const std::string& tcti, int deadlineMs) {
  pcp_set_transport_for_testing(tcti.c_str(), deadlineMs);
}

void UseBuildTransport() {
  pcp_set_transport_for_testing(nullptr, 0);
}

void UseSealPcr(int pcr) {
  pcp_set_seal_pcr_for_testing(pcr);
}

}  // namespace keymgr::test
