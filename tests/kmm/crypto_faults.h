// Faults of the crypto services, injected with -Wl,--wrap around the real
// library: each wrapper passes through unless a fault is armed for its call.
#pragma once

#include <array>
#include <cstdint>

namespace keymgr::test {

enum class CryptoCall { kCreate, kHash, kAesInit, kAesProcess, kCount };

// A fault hits the |at|-th call (1-based) of its function: a create returns
// no container; the others return |code| when it is non-zero, otherwise they
// run and then report |length| as the output length.
struct CryptoFault {
  int at = 0;
  std::uint32_t code = 0;
  std::uint32_t length = 0;
};

struct CryptoFaults {
  std::array<CryptoFault, static_cast<int>(CryptoCall::kCount)> faults{};
  std::array<int, static_cast<int>(CryptoCall::kCount)> calls{};
  int created = 0;  // containers handed out
  int destroyed = 0;
};

// The one set of faults and counters that the wrappers use.
CryptoFaults& Crypto();

}  // namespace keymgr::test
