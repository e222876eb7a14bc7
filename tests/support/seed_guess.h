// The attack on a seed key built from a badly seeded random(): try every
// seed key such a generator gives around a known time.
#pragma once

#include <ctime>
#include <string>
#include <string_view>

namespace keymgr::test {

// GuessSeedKey looks for a seed key whose SC digest (the SHA-256 of the
// SHA-256 of the 44-byte seed key) is |scDigest|, among those built from
// random() left unseeded, seeded with a time, or seeded with a process id,
// with the clock within a day around |when| (within seconds of it for the
// process ids). Returns how it was found, or "" when it was not.
std::string GuessSeedKey(std::string_view scDigest, std::time_t when);

}  // namespace keymgr::test
