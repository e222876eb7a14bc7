// The verdict measured into PCR 14 on the suite's swtpm. The chain of trust
// of a sealed build, as an attacker with the disk, the TPM bus and root after
// boot tries it: keymgr-sealed (signed, measuring into PCR 14) and the module
// with its key sealed under the test vendor key, each boot's boot chain
// standing in as PCR 4 extended with the digest of the image the firmware
// started. And keymgr-measured, which measures without signed files.
#include <gtest/gtest.h>
#include <kmm/kmm.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <map>

#include "eeprom/eeprom_map.h"
#include "keymgr_build_config.h"
#include "policy/file.h"
#include "support/sandbox.h"
#include "support/tpm_bus.h"
#include "support/tpm_settings.h"
#include "tpm/chain.h"
#include "util/endian.h"
#include "util/hex.h"
#include "util/paths.h"
#include "verdict/verdict.h"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;

const std::string S = KEYMGR_TEST_SEALED_BIN, G = KEYMGR_TEST_SIGNED_BIN;
const std::string kSource = KEYMGR_TEST_SOURCE_DIR;
const std::string kA = InRoot("/d/a"), kEvents = kEventLogPath;
constexpr auto kVendor = *HexBytes<256>(KEYMGR_TEST_VENDOR_MODULUS);
constexpr std::uint32_t kStartAuthSession = 0x176, kRsaDecrypt = 0x159, kRhNull = 0x40000007;

std::string Text(const verdict::PcrValue& value) {
  return {reinterpret_cast<const char*>(value.data()), value.size()};
}

// PowerOn power-cycles the TPM, and the firmware extends PCR 4 with the
// digest of the boot image it starts.
void PowerOn(const std::string& image) {
  PowerCycleTpm();
  ASSERT_EQ(Tpm2({"tpm2_pcrextend", "4:sha256=" + LowerHex(Sha256(image))}).status, 0);
}

// Release lays out release |n| for the boot image |image|: a listed file,
// the signed digest file, and the vendor's policy for that image's PCR 4.
// It gives back the files, to put an old release back.
using Files = std::map<std::string, std::string>;
Files Release(std::uint64_t n, const std::string& image) {
  WriteFile(kA, "release " + std::to_string(n));
  WriteFile(kManifestPath, kA);
  EXPECT_EQ(Run({KEYMGR_TEST_MKDIGEST_BIN, "--root", "/", "--manifest", kManifestPath, "--output",
                 kDigestFilePath, "--key", kSource + "/tests/cli/data/digest_key.pem", "--counter",
                 std::to_string(n)})
                .status,
            0);
  const std::string pcr4 = LowerHex(Sha256(std::string(32, '\0') + Sha256(image)));
  EXPECT_EQ(Run({KEYMGR_TEST_MKPOLICY_BIN, "--key", kSource + "/tests/policy/data/vendor_key.pem",
                 "--release", std::to_string(n), "--verdict-pcr", "14", "--pcr", "4=" + pcr4,
                 "--output", kPolicyPath})
                .status,
            0);
  Files files;
  for (const std::string& path : {kA, std::string(kManifestPath), std::string(kDigestFilePath),
                                  std::string(kSignaturePath), std::string(kPolicyPath)}) {
    files[path] = *ReadFile(path);
  }
  return files;
}

// Floor is the release counter at |handle| (by default sealed builds'), 0
// while it was never moved.
std::uint64_t Floor(const std::string& handle = "0x01800B0F") {
  const RunResult read = Tpm2({"tpm2_nvread", handle, "-s", "8"});
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(read.out.data());
  return read.status == 0 && read.out.size() == 8 ? LoadBig64(bytes) : 0;
}

// Away makes the suite's swtpm unreachable while it lives.
struct Away {
  Away() { fs::rename(kSwtpm, kSwtpm + ".away"); }
  ~Away() { fs::rename(kSwtpm + ".away", kSwtpm); }
};

// Interposer puts a proxy on the bus of every process, tpm2-tools included:
// it takes the swtpm's socket path while it lives.
struct Interposer {
  Interposer() : moved(), proxy(kSwtpm, kSwtpm + ".away") {}
  ~Interposer() { fs::remove(kSwtpm); }
  Away moved;
  TpmProxy proxy;
};

// Proved runs the module's boot proof and gives its one-off key, or "" when
// the proof failed.
std::string Proved() {
  const KeyContext* context = nullptr;
  Output([&] { context = KeyManage(KMM_OPTION_NORMAL_BOOT, 1); });
  return context != nullptr ? OneOffKey(context) : "";
}

// Each row starts from a device provisioned with release |base_| of image
// "A": its key made under the vendor's policies, the storage key pinned.
// Releases start above where earlier tests left the counter.
class Chain : public testing::Test {
 public:
  void SetUp() override {
    UseSealPcr(14, kVendor);
    ResetDevice(0x42, 4);
    base_ = Floor() + 10;
    first_ = Release(base_, "A");
    ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
  }
  void TearDown() override { UseSealPcr(-1); }

  // Boot powers on with |image| and runs keymgr's boot run.
  static RunResult Boot(const std::string& image) {
    PowerOn(image);
    return test::Run({S});
  }

  const TpmClean clean_;
  std::uint64_t base_ = 0;
  Files first_;
};

struct Row {
  const char* name;
  void (*attack)(Chain& chain);
};
class ChainRows : public Chain, public testing::WithParamInterface<Row> {};
TEST_P(ChainRows, HoldsAgainstTheAttack) {
  GetParam().attack(*this);
}

// Each row with the device it leaves: a good boot of the provisioned release
// proves the key after any of them.
void GenuineBootOnARecordedBus(Chain& /*chain*/) {
  Interposer bus;
  const RunResult run = Chain::Boot("A");
  EXPECT_EQ(run.status, 0) << run.out;
  bus.proxy.Arm(TpmProxy::Fault::kNone, 0);
  const std::string ook = Proved();
  ASSERT_FALSE(ook.empty());
  // The decryption's session was salted: with the disk and the bus, the
  // session key is still not to be had. The key never crosses in clear.
  std::uint32_t salt = 0;
  for (const auto& [code, handle] : bus.proxy.Sent()) {
    if (code == kStartAuthSession) {
      salt = handle;
    } else if (code == kRsaDecrypt) {
      break;
    }
  }
  EXPECT_NE(salt, 0u);
  EXPECT_NE(salt, kRhNull);
  EXPECT_EQ(bus.proxy.Traffic().find(ook), std::string::npos);
}

void FailRewrittenToGoodOnTheBus(Chain& /*chain*/) {
  WriteFile(kA, "altered");
  Interposer bus;
  bus.proxy.Rewrite(Text(verdict::VerdictDigest(verdict::Verdict::kFail)),
                    Text(verdict::VerdictDigest(verdict::Verdict::kOk)));
  const RunResult run = Chain::Boot("A");
  EXPECT_EQ(run.status, 1) << "the changed extend was refused: " << run.out;
  EXPECT_NE(run.out.find("BN=FAIL"), std::string::npos);
  bus.proxy.Rewrite("", "");
  EXPECT_EQ(Proved(), "");
}

void KeymgrSkippedAndTheGoodValueExtendedByHand(Chain& /*chain*/) {
  PowerOn("A without keymgr");
  Tpm2({"tpm2_pcrextend",
        "14:sha256=" + LowerHex(Text(verdict::VerdictDigest(verdict::Verdict::kOk)))});
  EXPECT_EQ(Proved(), "");
}

void ASecondProofInTheSameBoot(Chain& /*chain*/) {
  ASSERT_EQ(Chain::Boot("A").status, 0);
  EXPECT_NE(Proved(), "");
  EXPECT_EQ(Proved(), "") << "a host keeps the context it got";
  // The log records the verdict, then the proof's separator.
  const std::string events = *ReadFile(kEvents);
  EXPECT_NE(events.find("\"recnum\":1,\"pcr\":14"), std::string::npos) << events;
  EXPECT_NE(events.find("\"separator\""), std::string::npos) << events;
}

void ATpmResumedAfterAProof(Chain& /*chain*/) {
  ASSERT_EQ(Chain::Boot("A").status, 0);
  EXPECT_NE(Proved(), "");
  // TPM2_Shutdown(STATE), then the TPM's init and TPM2_Startup(STATE): a
  // resume keeps the PCRs as they were.
  ASSERT_EQ(Tpm2({"tpm2_shutdown"}).status, 0);
  ASSERT_EQ(Run({"swtpm_ioctl", "--unix", kSwtpm + ".ctrl", "-i"}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_startup"}).status, 0);
  EXPECT_EQ(Proved(), "");
}

void TheTpmUnreachableAtTheBootRun(Chain& /*chain*/) {
  PowerOn("A");
  {
    const Away tpm;
    const RunResult run = Run({S});
    EXPECT_EQ(run.status, 1) << run.out;
    EXPECT_EQ(ReadFile(kEvents), "") << "no event is claimed";
  }
  EXPECT_EQ(Proved(), "") << "the TPM came back, the verdict did not";
}

// BootsRelease lays out release |n| of |image|, boots it and proves the key,
// which moves the counter to |n|.
void BootsRelease(std::uint64_t n, const std::string& image) {
  Release(n, image);
  ASSERT_EQ(Chain::Boot(image).status, 0);
  EXPECT_NE(Proved(), "");
  EXPECT_EQ(Floor(), n);
}

// Release 5 good, 6 good, 5 again refused, 7 good; release 6, with a boot
// image of its own and the vendor's policy for it, proves the key made
// under release 5's without a reseal.
void AnOlderReleasePutBack(Chain& chain) {
  ASSERT_EQ(Chain::Boot("A").status, 0);
  EXPECT_EQ(Floor(), chain.base_);
  BootsRelease(chain.base_ + 1, "B");
  for (const auto& [path, bytes] : chain.first_) {
    WriteFile(path, bytes);
  }
  const RunResult old = Chain::Boot("A");
  EXPECT_EQ(old.status, 1);
  EXPECT_NE(old.out.find("release counter: " + std::to_string(chain.base_) +
                         " is below the release that booted, " + std::to_string(chain.base_ + 1) +
                         "!!!\n" + kSignaturePath + " signature error!!!\n"),
            std::string::npos)
      << old.out;
  EXPECT_EQ(Proved(), "");
  BootsRelease(chain.base_ + 2, "A");
}

// A boot of the next release cut short at each command (the bus hung up
// there, then the power cycled), the counter's move among them, then a good
// boot: the move is completed.
void APowerCutInTheCountersMove(Chain& chain) {
  ASSERT_EQ(Chain::Boot("A").status, 0);
  for (int cut = 1;; ++cut) {
    SCOPED_TRACE("cut at command " + std::to_string(cut));
    Release(chain.base_ + cut, "A");
    bool reached = false;
    {
      Interposer bus;
      PowerOn("A");
      bus.proxy.Arm(TpmProxy::Fault::kHangUp, cut);
      Run({S});
      reached = static_cast<int>(bus.proxy.Sent().size()) >= cut;
    }
    ASSERT_EQ(Chain::Boot("A").status, 0);
    EXPECT_EQ(Floor(), chain.base_ + cut);
    EXPECT_NE(Proved(), "");
    if (!reached) {
      break;
    }
  }
}

void TheCounterMovedWithoutAGoodVerdict(Chain& chain) {
  ASSERT_EQ(Chain::Boot("A").status, 0);
  WriteFile(kA, "altered");
  ASSERT_EQ(Chain::Boot("A").status, 0);  // BN=FAIL, measured
  tpm::Connection tpm;
  ASSERT_TRUE(tpm::Connect(tpm, tpm::BuildOptions()).ok());
  policy::PolicyFile file;
  ASSERT_TRUE(policy::ReadPolicyFile(&file).ok());
  EXPECT_FALSE(tpm::RaiseReleaseFloor(tpm, kVendor, 14, chain.base_ + 5, &file).ok());
  EXPECT_EQ(Floor(), chain.base_);
}

void NoTpmTheSignedBuildSaysSo(Chain& /*chain*/) {
  const Away tpm;
  const RunResult run = Run({S});
  EXPECT_EQ(run.out, "SFE_003 - [4]\nrelease counter: no TPM to hold it against!!!\nBN=OK\n");
  EXPECT_EQ(run.status, 1) << "nothing was measured";
}

void TheGateClosedWithAFileAltered(Chain& /*chain*/) {
  MakeEeprom(0, 0);
  WriteFile(kA, "altered");
  const RunResult run = Chain::Boot("A");
  EXPECT_EQ(run.out, "SFE_003 - [0]\nBN=FAIL\n");
  EXPECT_EQ(Proved(), "");
}

// The event log names what the check read, read once, and is a file of the
// running user's, whatever another account planted at its path.
void TheEventLogSaysWhatWasChecked(Chain& chain) {
  WriteFile(kEvents, "planted");
  ASSERT_EQ(::chown(kEvents.c_str(), 65534, 65534), 0);
  struct stat before {};
  ASSERT_EQ(::stat(kEvents.c_str(), &before), 0);
  PowerOn("A");
  const std::string trace = "/tmp/keymgr-chain-" + std::to_string(::getpid());
  ASSERT_EQ(Run(Traced({"-o", trace, "-e", "trace=openat"}, {S})).status, 0);
  const std::string opens = ReadFile(trace).value_or("");
  fs::remove(trace);
  for (const std::string path : {kManifestPath, kDigestFilePath, kSignaturePath}) {
    const std::size_t first = opens.find('"' + path + '"');
    EXPECT_TRUE(first != std::string::npos &&
                opens.find('"' + path + '"', first + 1) == std::string::npos)
        << path;
  }
  struct stat after {};
  ASSERT_EQ(::stat(kEvents.c_str(), &after), 0);
  EXPECT_EQ(after.st_uid, 0u);
  EXPECT_NE(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mode & 07777, 0644u);
  const std::string events = *ReadFile(kEvents);
  for (const std::string& file : {chain.first_[kManifestPath], chain.first_[kDigestFilePath]}) {
    EXPECT_NE(events.find(LowerHex(Sha256(file))), std::string::npos) << events;
  }
  EXPECT_NE(events.find("\"release\":" + std::to_string(chain.base_) + "}"), std::string::npos);
}

// A signed build without sealed keys closes the PCR itself, after the move:
// a process after the boot run cannot move the counter.
void TheSignedBuildClosesThePcrItself(Chain& /*chain*/) {
  // The suite's other signed boots run release 42 on this build's counter.
  Release(42, "A");
  PowerCycleTpm();
  ASSERT_EQ(Run({G}).status, 0);
  EXPECT_EQ(Floor("0x01800B0E"), 42u);
  tpm::Connection tpm;
  ASSERT_TRUE(tpm::Connect(tpm, tpm::BuildOptions()).ok());
  std::uint64_t floor = 0;
  ASSERT_TRUE(tpm::ReadReleaseFloor(tpm, {}, 14, &floor).ok());
  EXPECT_FALSE(tpm::RaiseReleaseFloor(tpm, {}, 14, floor + 1, nullptr).ok());
  const std::string events = *ReadFile(kEvents);
  EXPECT_NE(events.find("\"separator\""), std::string::npos) << events;
}

const Row kRows[] = {
    {"a genuine boot on a recorded bus", GenuineBootOnARecordedBus},
    {"the FAIL extend rewritten to the good one on the bus", FailRewrittenToGoodOnTheBus},
    {"keymgr skipped and the good value extended by hand",
     KeymgrSkippedAndTheGoodValueExtendedByHand},
    {"a second proof in the same boot", ASecondProofInTheSameBoot},
    {"a TPM resumed after a proof", ATpmResumedAfterAProof},
    {"the TPM unreachable at the boot run", TheTpmUnreachableAtTheBootRun},
    {"an older release put back", AnOlderReleasePutBack},
    {"a power cut in the counter's move", APowerCutInTheCountersMove},
    {"the counter moved without a good verdict", TheCounterMovedWithoutAGoodVerdict},
    {"no TPM, the signed build says so", NoTpmTheSignedBuildSaysSo},
    {"the gate closed with a file altered", TheGateClosedWithAFileAltered},
    {"the event log says what was checked", TheEventLogSaysWhatWasChecked},
    {"the signed build closes the PCR itself", TheSignedBuildClosesThePcrItself},
};
INSTANTIATE_TEST_SUITE_P(Rows, ChainRows, testing::ValuesIn(kRows), RowName());

// keymgr-measured, a build that measures without signed files.

const std::string M = KEYMGR_TEST_MEASURED_BIN, K = KEYMGR_TEST_KEYMGR_BIN;
const std::string kB = InRoot("/d/b");
const std::string kImage = KEYMGR_EEPROM_PATH;

// The PCR value of a PCR reset to zeros and extended with |verdict|'s event;
// PCR 14 as the TPM gives it.
std::string PcrAfter(const std::string& verdict) {
  const std::string zeros(32, '\0');
  return verdict.empty() ? zeros : Sha256(zeros + Sha256("keymgr boot verdict: " + verdict));
}
std::string Pcr() {
  const std::string out = Tpm2({"tpm2_pcrread", "sha256:14"}).out;
  return FromHex(out.substr(out.find("0x") + 2, 64));
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
// that could not measure goes no further.
struct MeasuredRow {
  const char* name;
  void (*change)();
  const std::string* away;  // a file moved aside for the run
  int status;
  std::string line, verdict;  // a line of the output; "" for no event
};
class MeasuredRows : public Measured, public testing::WithParamInterface<MeasuredRow> {};
TEST_P(MeasuredRows, VerdictIsMeasuredAndReplays) {
  const MeasuredRow& row = GetParam();
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
  EXPECT_EQ(
      test::Run({KEYMGR_TEST_EVENTLOG_BIN, kEvents, "--pcr", "14", "--expect", LowerHex(Pcr())})
              .status == 0,
      !row.verdict.empty());
  EXPECT_EQ(ReadFile(kEvents)->find("\"verdict\":\"" + row.verdict + "\"") != std::string::npos,
            !row.verdict.empty());
}
const MeasuredRow kMeasuredRows[] = {
    // clang-format off
    {"a good boot", [] {}, nullptr, 0, "BN=OK\n", "BN=OK"},
    {"a file altered", [] { WriteFile(kB, "x"); }, nullptr, 0, "BN=FAIL\n", "BN=FAIL"},
    {"no digest file", [] { std::filesystem::remove(kDigestFilePath); }, nullptr, 1, "BN=FAIL\n", "BN=FAIL"},
    {"the gate closed", [] { WriteFile(kImage, ReadFile(kImage)->replace(eeprom::kControlByteOffset, 1, 1, '\0')); }, nullptr, 0, "SFE_003 - [0]\n", "none"},
    {"no EEPROM", [] {}, &kImage, 0, "Read Error [-2]", "none"},
    {"no TPM", [] {}, &kSwtpm, 1, "BN=OK\n", ""},
    // clang-format on
};
INSTANTIATE_TEST_SUITE_P(Rows, MeasuredRows, testing::ValuesIn(kMeasuredRows), RowName());

}  // namespace
}  // namespace keymgr::test
