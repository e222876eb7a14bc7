// The build's connection options, alone in their object file: a test program
// that defines BuildOptions itself never pulls this member in.
#include <array>
#include <cstdint>
#include <optional>

#include "keymgr_build_config.h"
#include "tpm/connection.h"
#include "util/hex.h"

namespace keymgr::tpm {

namespace {

// The vendor key, read from its hex text when the program is compiled.
constexpr std::optional<std::array<std::uint8_t, 256>> kVendorKey =
    HexBytes<256>(KEYMGR_POLICY_MODULUS);

}  // namespace

Options BuildOptions() {
  Options options{KEYMGR_TCTI, KEYMGR_TPM_TIMEOUT_MS, KEYMGR_SEAL_PCR, {}};
  if (kVendorKey) {
    options.vendorKey = *kVendorKey;
  }
  return options;
}

}  // namespace keymgr::tpm
