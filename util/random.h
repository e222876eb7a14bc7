// Random bytes from the kernel, waiting for its pool or not.
#pragma once

#include <cstddef>
#include <cstdint>

namespace keymgr {

enum class KernelWait { kNo, kYes };

// KernelRandom fills |size| bytes at |dst| from getrandom(2). With
// KernelWait::kNo it fails at once while the kernel's pool is not yet
// initialised (early in boot), instead of waiting for it. Returns false on
// any failure; |dst| may then hold part of a draw.
[[nodiscard]] bool KernelRandom(std::uint8_t* dst, std::size_t size, KernelWait wait);

}  // namespace keymgr
