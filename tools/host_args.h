// The kmm-host command line, read without side effects.
#pragma once

namespace keymgr::tools {

struct HostArgs {
  enum class Action { kUsage, kManage, kDmsetup, kSrk, kKeys };
  Action action = Action::kUsage;
  int option = 0;   // KeyManage's option
  int logFlag = 0;  // KeyManage's log flag, 0 when absent
};

// ParseHostArgs reads "dmsetup", "srk" or "keys" alone, or OPTION [LOG_FLAG] as
// whole decimal ints; anything else is a usage error.
HostArgs ParseHostArgs(int argc, const char* const* argv);

}  // namespace keymgr::tools
