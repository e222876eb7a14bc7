#include "cli/command.h"

#include <cstring>

namespace keymgr::cli {

Command ParseCommand(int argc, const char* const* argv) {
  Command command;
  if (argc <= 1) {
    return command;
  }
  const char* word = argv[1];
  if (std::strncmp("hash", word, 4) == 0) {
    command.action = Action::kHash;
  } else if (std::strncmp("log", word, 3) == 0) {
    command.verbose = 1;
  } else if (std::strncmp("file", word, 4) == 0) {
    command.action = Action::kFile;
    command.path = argc > 2 ? argv[2] : nullptr;
  } else if (std::strncmp("-v", word, 2) == 0) {
    command.action = Action::kVersion;
  }
  return command;
}

}  // namespace keymgr::cli
