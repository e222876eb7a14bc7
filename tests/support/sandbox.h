// Helpers shared by the tests: the sandbox root, EEPROM images, the TPM's
// persistent handles, captured output and running the built programs.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <regex>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "support/files.h"

namespace keymgr::test {

// Root is the build's KEYMGR_ROOT; InRoot(p) is Root() + p.
std::string Root();
std::string InRoot(std::string_view path);

// ResetSandbox removes everything under the root except "run" (the swtpm of
// the suite) and creates /quorvan/hidden and /quorvan/spool/log again.
void ResetSandbox();
// ResetDevice is ResetSandbox and a blank EEPROM made by MakeEeprom.
void ResetDevice(std::uint8_t control, std::uint32_t sfeConf);

// MakeEeprom writes a blank (0xFF) image at KEYMGR_EEPROM_PATH with the given
// control byte and SFE CONF word (least significant byte first).
void MakeEeprom(std::uint8_t control, std::uint32_t sfeConf);

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

// SyncTrace runs argv under strace and sums up, in order, how it replaced
// files: "F" an fsync of a file, "D" of a folder, "L" a link, "R:name" a
// rename onto |name|.
std::string SyncTrace(const std::vector<std::string>& argv);

// Output runs |call| and returns what it printed on standard output.
std::string Output(const std::function<void()>& call);

// PowerCycleTpm turns the suite's swtpm off and on again, as a reboot does:
// its PCRs are reset, its persistent objects kept, and it is started.
void PowerCycleTpm();

// Tpm2 runs the tpm2-tools program |argv|[0] on the suite's swtpm.
RunResult Tpm2(std::vector<std::string> argv);

// PersistentHandles lists the persistent handles of the suite's swtpm, as
// tpm2_getcap sees them. EvictAllBut evicts every one that is not in |keep|.
std::set<std::string> PersistentHandles();
void EvictAllBut(const std::set<std::string>& keep);

// TpmLeftovers lists the transient objects and the loaded and saved sessions
// that the suite's swtpm holds: "" when every flow flushed what it loaded
// (the simulator has no resource manager to do it). FlushTpm flushes them.
std::string TpmLeftovers();
void FlushTpm();

// TpmClean, a member of a TPM test's fixture, expects the test to leave no
// transient object or session behind, and then clears the TPM for the next
// test: flushes what was left and evicts the persistent handles it made.
struct TpmClean {
  const std::set<std::string> keep = PersistentHandles();
  ~TpmClean() {
    EXPECT_EQ(TpmLeftovers(), "");
    FlushTpm();
    EvictAllBut(keep);
  }
};

// RowName names each row of a parameterized suite after its |name| (letters
// and digits kept, any other run an underscore), so that ctest -R runs one:
// INSTANTIATE_TEST_SUITE_P(Rows, Suite, testing::ValuesIn(kRows), RowName()).
struct RowName {
  template <class Row>
  std::string operator()(const testing::TestParamInfo<Row>& info) const {
    return std::regex_replace(std::string(info.param.name), std::regex("[^A-Za-z0-9]+"), "_");
  }
};

}  // namespace keymgr::test
