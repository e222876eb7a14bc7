// The keymgr command line, read without side effects.
#pragma once

namespace keymgr::cli {

enum class Action { kVerify, kHash, kFile, kVersion };

struct Command {
  Action action = Action::kVerify;
  int verbose = 0;             // 1 for "log": print both digests of every file
  const char* path = nullptr;  // the path of "file"; null when none was given
};

// ParseCommand matches the first argument as a prefix against "hash", "log",
// "file" and "-v", in that order, so "hashes" is "hash" and "-version" is
// "-v"; anything else, or no argument, is the quiet boot verification.
// Arguments after the first (after the path for "file") are ignored.
Command ParseCommand(int argc, const char* const* argv);

}  // namespace keymgr::cli
