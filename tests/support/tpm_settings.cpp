#include "support/tpm_settings.h"

#include <vector>

#include "keymgr_build_config.h"
#include "tpm/connection.h"

namespace {

std::string g_transport = KEYMGR_TCTI;
keymgr::tpm::Options g_options = {nullptr, KEYMGR_TPM_TIMEOUT_MS, KEYMGR_SEAL_PCR, {}};
std::vector<std::uint8_t> g_vendorKey;

}  // namespace

namespace keymgr::tpm {

Options BuildOptions() {
  Options options = g_options;
  options.transport = g_transport.c_str();
  return options;
}

}  // namespace keymgr::tpm

namespace keymgr::test {

void UseTransport(const std::string& tcti, int deadlineMs) {
  g_transport = tcti;
  g_options.deadlineMs = deadlineMs;
}

void UseBuildTransport() {
  UseTransport(KEYMGR_TCTI, KEYMGR_TPM_TIMEOUT_MS);
}

void UseSealPcr(int pcr, std::span<const std::uint8_t> vendorKey) {
  g_options.sealPcr = pcr;
  g_vendorKey.assign(vendorKey.begin(), vendorKey.end());
  g_options.vendorKey = g_vendorKey;
}

}  // namespace keymgr::test
