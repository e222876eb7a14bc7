#include "tools/host_args.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

namespace keymgr::tools {

namespace {

// ParseInt accepts a whole decimal int, sign allowed, and nothing else.
bool ParseInt(const char* text, int* value) {
  if (text == nullptr || *text == '\0') {
    return false;
  }
  char* end = nullptr;
  errno = 0;
  const long parsed = std::strtol(text, &end, 10);
  if (errno != 0 || *end != '\0' || parsed < INT_MIN || parsed > INT_MAX) {
    return false;
  }
  *value = static_cast<int>(parsed);
  return true;
}

}  // namespace

HostArgs ParseHostArgs(int argc, const char* const* argv) {
  HostArgs args;
  static constexpr struct {
    const char* word;
    HostArgs::Action action;
  } kWords[] = {{"dmsetup", HostArgs::Action::kDmsetup},
                {"srk", HostArgs::Action::kSrk},
                {"keys", HostArgs::Action::kKeys}};
  for (const auto& [word, action] : kWords) {
    if (argc == 2 && std::strcmp(argv[1], word) == 0) {
      args.action = action;
      return args;
    }
  }
  if (argc < 2 || argc > 3 || !ParseInt(argv[1], &args.option) ||
      (argc == 3 && !ParseInt(argv[2], &args.logFlag))) {
    return HostArgs();
  }
  args.action = HostArgs::Action::kManage;
  return args;
}

}  // namespace keymgr::tools
