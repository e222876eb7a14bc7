#include "util/random.h"

#include <sys/random.h>

#include "util/io.h"
#include "util/status.h"

namespace keymgr {

bool KernelRandom(std::uint8_t* dst, std::size_t size, KernelWait wait) {
  const unsigned flags = wait == KernelWait::kYes ? 0 : GRND_NONBLOCK;
  const auto draw = [&](std::size_t done, std::size_t left) {
    return ::getrandom(dst + done, left, flags);
  };
  if (!MoveAll(draw, size)) {
    LogErrno("getrandom");
    return false;
  }
  return true;
}

}  // namespace keymgr
