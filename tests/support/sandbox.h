// Helpers shared by the tests: the sandbox root, files, EEPROM images and
// running the built programs.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace keymgr::test {

// Root is the build's KEYMGR_ROOT; InRoot(p) is Root() + p.
std::string Root();
std::string InRoot(std::string_view path);

// ResetSandbox removes everything under the root except "run" (the swtpm of
// the suite) and creates /quorvan/hidden and /quorvan/spool/log again.
void ResetSandbox();

void WriteFile(const std::string& path, std::string_view bytes);
std::optional<std::string> ReadFile(const std::string& path);
bool Exists(const std::string& path);

// MakeEeprom writes a blank (0xFF) image at KEYMGR_EEPROM_PATH with the given
// control byte and SFE CONF word (least significant byte first).
void MakeEeprom(std::uint8_t control, std::uint32_t sfeConf);
std::vector<std::uint8_t> ReadEepromBytes(std::uint32_t offset, std::uint32_t length);
void WriteEepromBytes(std::uint32_t offset, const std::vector<std::uint8_t>& bytes);

struct RunResult {
  int status = -1;  // exit status, or -1 when the program did not exit normally
  std::string out, err;
};

// Run starts argv[0] with the arguments, stdin on /dev/null, and waits.
RunResult Run(const std::vector<std::string>& argv);

// Traced puts argv under strace -f with |options|. A sanitizer build's leak
// check cannot run under ptrace, so it is turned off there.
std::vector<std::string> Traced(const std::vector<std::string>& options,
                                const std::vector<std::string>& argv);

// RunKilledAt runs argv, output discarded, and kills it with SIGKILL on entry
// to its |n|th call of the system call |call|, before that call runs. Returns
// true when it was killed there, false when it ended first.
bool RunKilledAt(const std::string& call, int n, const std::vector<std::string>& argv);

// SyncTrace runs argv under strace and sums up, in order, how it replaced
// files: "F" an fsync of a file, "D" of a folder, "L" a link, "R:name" a
// rename onto |name|.
std::string SyncTrace(const std::vector<std::string>& argv);

// Hex renders bytes as upper-case "%02X " groups, the way the programs print.
std::string Hex(std::string_view bytes);

}  // namespace keymgr::test
