// keymgr-mkdigest's reading of a manifest, apart so that it can be fuzzed
// against the device's.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace keymgr::tools {

// ReadSignableManifest reads the entries of |manifest| with the device's
// reader into |entries|, and returns "" when they are what a signature may
// cover: at least one, each one the device reads exactly as the build host
// does. Otherwise it returns why not, naming the entry.
std::string ReadSignableManifest(std::span<const std::uint8_t> manifest,
                                 std::vector<std::string>& entries);

}  // namespace keymgr::tools
