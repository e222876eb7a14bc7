// The boot verdict measured into PCR 14 by keymgr-measured (a build that
// measures without signed files), and its event log replayed, on the
// suite's swtpm.
#include <gtest/gtest.h>

#include <filesystem>
#include <functional>

#include "eeprom/eeprom_map.h"
#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "support/tpm_bus.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

const std::string M = KEYMGR_TEST_MEASURED_BIN, K = KEYMGR_TEST_KEYMGR_BIN;
const std::string kEvents = kEventLogPath, kA = InRoot("/d/a"), kB = InRoot("/d/b");
const std::string kImage = KEYMGR_EEPROM_PATH;

// The PCR value of a PCR reset to zeros and extended with |verdict|'s event.
std::string PcrAfter(const std::string& verdict) {
  std::string pcr = Hex(Sha256(std::string(32, '\0') + Sha256("keymgr boot verdict: " + verdict)));
  std::erase(pcr, ' ');
  return verdict.empty() ? std::string(64, '0') : pcr;
}

// PCR 14 as tpm2-tools print it (upper case).
std::string Pcr() {
  const std::string out = Tpm2({"tpm2_pcrread", "sha256:14"}).out;
  return out.substr(out.find("0x") + 2, 64);
}

bool Replays(const std::string& value) {
  return test::Run({KEYMGR_TEST_EVENTLOG_BIN, kEvents, "--pcr", "14", "--expect", value}).status ==
         0;
}

// Each test starts from a device with its digest file made, the TPM
// power-cycled (PCRs reset) as a reboot does.
class Measured : public testing::Test {
 protected:
  void SetUp() override {
    ResetDevice(0x42, 0);
    WriteFile(kA, "");
    WriteFile(kB, "b");
    WriteFile(kManifestPath, kA + " " + kB);
    test::Run({K, "hash"});
    PowerCycleTpm();
  }
  const TpmClean clean_;
};

// keymgr-measured extends PCR 14 with one event, whose digest is its
// verdict's alone, and writes an event log that replays to the PCR, and
// once edited no longer does; a run without a TPM keeps its BN line, fails,
// and leaves the log empty: a boot that could not measure goes no further.
struct Row {
  const char* name;
  void (*change)();
  const std::string* away;  // a file moved aside for the run
  int status;
  std::string line, verdict;  // a line of the output; "" for no event
};
class MeasuredRows : public Measured, public testing::WithParamInterface<Row> {};
TEST_P(MeasuredRows, VerdictIsMeasuredAndReplays) {
  const Row& row = GetParam();
  row.change();
  if (row.away != nullptr) {
    std::filesystem::rename(*row.away, *row.away + ".away");
  }
  const RunResult run = test::Run({M});
  if (row.away != nullptr) {
    std::filesystem::rename(*row.away + ".away", *row.away);
  }
  EXPECT_EQ(run.status, row.status);
  EXPECT_NE(run.out.find(row.line), std::string::npos) << run.out;
  EXPECT_EQ(Pcr(), PcrAfter(row.verdict));
  EXPECT_EQ(Replays(Pcr()), !row.verdict.empty());
  EXPECT_EQ(ReadFile(kEvents)->find("\"verdict\":\"" + row.verdict + "\"") != std::string::npos,
            !row.verdict.empty());
  std::string edited = *ReadFile(kEvents);
  edited.replace(edited.find(row.verdict), row.verdict.size(),
                 row.verdict == "BN=OK" ? "BN=FAIL" : "BN=OK");
  WriteFile(kEvents, edited);
  EXPECT_FALSE(Replays(Pcr()));
}
const Row kRows[] = {
    // clang-format off
    {"a good boot", [] {}, nullptr, 0, "BN=OK\n", "BN=OK"},
    {"a file altered", [] { WriteFile(kB, "x"); }, nullptr, 0, "BN=FAIL\n", "BN=FAIL"},
    {"no digest file", [] { std::filesystem::remove(kDigestFilePath); }, nullptr, 1, "BN=FAIL\n", "BN=FAIL"},
    {"the gate closed", [] { WriteFile(kImage, ReadFile(kImage)->replace(eeprom::kControlByteOffset, 1, 1, '\0')); }, nullptr, 0, "SFE_003 - [0]\n", "none"},
    {"no EEPROM", [] {}, &kImage, 0, "Read Error [-2]", "none"},
    {"no TPM", [] {}, &kSwtpm, 1, "BN=OK\n", ""},
    // clang-format on
};
INSTANTIATE_TEST_SUITE_P(Rows, MeasuredRows, testing::ValuesIn(kRows), RowName());

}  // namespace
}  // namespace keymgr::test
