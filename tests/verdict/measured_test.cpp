// The boot verdict measured into PCR 14 by keymgr-measured (a build that
// measures without signed files) and attested, on the suite's swtpm.
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

std::string In(const char* name) {
  return InRoot(std::string("/run/") + name);
}

// Quote quotes PCR 14 with |nonce| and checks the quote with |check|: the
// PCR as the quote gives it, or "refused".
std::string Quote(const std::string& nonce, const std::string& check) {
  const std::string out =
      Tpm2({"tpm2_quote", "-c", "0x81010002", "-l", "sha256:14", "-q", nonce, "-m", In("quote.msg"),
            "-s", In("quote.sig"), "-o", In("quote.pcrs"), "-g", "sha256"})
          .out;
  const bool checked =
      test::Run({"tpm2_checkquote", "-u", In("ak.pub"), "-m", In("quote.msg"), "-s",
                 In("quote.sig"), "-f", In("quote.pcrs"), "-g", "sha256", "-q", check})
          .status == 0;
  const std::size_t at = out.find("14: 0x");
  return checked && at != std::string::npos ? out.substr(at + 6, 64) : "refused";
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
// verdict's alone, and writes an event log that replays to the PCR; a run
// without a TPM keeps its BN line, fails, and leaves the log empty: a boot
// that could not measure goes no further. A verifier follows the recipe:
// an attestation key quotes the PCR with its nonce, tpm2_checkquote checks
// the quote, keymgr-eventlog replays the log to the quoted value; an edited
// log and a stale nonce are refused.
struct Row {
  const char* name;
  void (*change)();
  const std::string* away;  // a file moved aside for the run
  int status;
  std::string line, verdict;  // a line of the output; "" for no event
};
class MeasuredRows : public Measured, public testing::WithParamInterface<Row> {};
TEST_P(MeasuredRows, VerdictIsMeasuredAndAttested) {
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
  if (!row.verdict.starts_with("BN=")) {
    return;
  }
  // A verifier's view of the boot: the endorsement and attestation keys,
  // persistent, as the simulator has no resource manager to keep its slots.
  ASSERT_EQ(Tpm2({"tpm2_createek", "-c", "0x81010001", "-G", "rsa", "-u", In("ek.pub")}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_createak", "-C", "0x81010001", "-c", In("ak.ctx"), "-G", "rsa", "-g",
                  "sha256", "-s", "rsassa", "-u", In("ak.pub"), "-f", "pem"})
                .status,
            0);
  ASSERT_EQ(Tpm2({"tpm2_evictcontrol", "-c", In("ak.ctx"), "0x81010002"}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_flushcontext", "-t"}).status, 0);
  EXPECT_EQ(Quote("feed01", "feed01"), PcrAfter(row.verdict));
  EXPECT_EQ(Quote("feed02", "feed01"), "refused");
  EXPECT_TRUE(Replays(Quote("feed03", "feed03")));
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
