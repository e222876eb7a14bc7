// The module and the platform key manager against the suite's swtpm, seen
// from the bus through a proxy: what each flow costs the TPM on either
// transport, what crosses in clear, what the key manager refuses, and a TPM
// that fails each command in turn.
#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <functional>

#include "crypto/hash.h"
#include "eeprom/eeprom_map.h"
#include "keymgr_build_config.h"
#include "kmm/internal.h"
#include "support/sandbox.h"
#include "support/tpm_proxy.h"
#include "tpm/pcp.h"
#include "util/bytes.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

const std::string kProxy = KEYMGR_ROOT "/run/proxy.sock";
const std::string kSwtpm = std::string(KEYMGR_TCTI).substr(std::strlen("swtpm:path="));
constexpr int kDeadlineMs = 1500;

// A TPM proxy in front of the suite's swtpm, and the key manager on it.
struct OnProxy {
  explicit OnProxy(const std::string& tcti = "swtpm:path=" + kProxy) {
    // tpm2-tss's own transport also opens the simulator's control socket.
    std::filesystem::remove(kProxy + ".ctrl");
    std::filesystem::create_symlink(kSwtpm + ".ctrl", kProxy + ".ctrl");
    pcp_set_transport_for_testing(tcti.c_str(), kDeadlineMs);
  }
  ~OnProxy() { pcp_set_transport_for_testing(nullptr, 0); }
  TpmProxy proxy{kProxy, kSwtpm};
};

// What a flow costs a discrete TPM: its commands, and the asymmetric
// operations among them (key generation, ECDH for a salted session, RSA).
struct Cost {
  int commands = 0, asymmetric = 0, primaries = 0, rsaKeys = 0, rsaEncrypts = 0;
};
Cost CostOf(const std::vector<TpmProxy::Command>& sent) {
  Cost cost;
  for (const auto& [code, handle] : sent) {
    const bool primary = code == 0x131, key = code == 0x153 || code == 0x191;
    const bool salted = code == 0x176 && handle != 0x40000007;  // TPM2_StartAuthSession
    ++cost.commands;
    cost.asymmetric += primary || key || salted || code == 0x159 || code == 0x174;
    cost.primaries += primary;
    cost.rsaKeys += key;
    cost.rsaEncrypts += code == 0x174;
  }
  return cost;
}

// OneOffKey is the one-off key that a boot unsealed into |context|.
std::string OneOffKey(const KeyContext* context) {
  std::string ook;
  for (std::uint32_t i = 0; i < 32; ++i) {
    ook += static_cast<char>(ProtectedKey_ByteAt(context->oneOffKeyRef, i));
  }
  return ook;
}

// Each flow on the key manager's own transport and on tpm2-tss's through
// its loader, without and with a persistent SRK: few commands, one
// asymmetric operation at boot, and no secret in clear on the bus.
TEST(Tpm, FlowsCostLittleAndKeepSecretsOffTheBus) {
  auto keep = PersistentHandles();
  keep.erase("0x81000001");
  for (const std::string& transport :
       {"swtpm:path=" + kProxy, "libtss2-tcti-swtpm.so.0:path=" + kProxy}) {
    for (bool srk : {false, true}) {
      SCOPED_TRACE(transport + (srk ? ", persistent SRK" : ""));
      ResetDevice(0x42, 4);
      EvictAllBut(keep);
      OnProxy bus(transport);
      ASSERT_TRUE(!srk || KmmPersistSrk() == 0);
      ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);  // a key to replace
      const auto before = PersistentHandles();
      bus.proxy.Arm(TpmProxy::Fault::kNone, 0);
      std::string out = Output([] {
        EXPECT_GE(KmmSeedRandom(), 0);  // as a host does before regenerating
        EXPECT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
      });
      EXPECT_NE(out.find("Successed to delete ID/PWD in TPM."), std::string::npos) << out;
      const Cost regeneration = CostOf(bus.proxy.Sent());
      EXPECT_LE(regeneration.commands, 16);
      EXPECT_EQ(regeneration.primaries, srk ? 0 : 1);
      EXPECT_EQ(regeneration.rsaKeys, 1);
      EXPECT_EQ(regeneration.rsaEncrypts, 0);
      std::string traffic = bus.proxy.Traffic();
      bus.proxy.Arm(TpmProxy::Fault::kNone, 0);
      const KeyContext* context = KeyManage(KMM_OPTION_NORMAL_BOOT, 1);
      ASSERT_NE(context, nullptr);
      const Cost boot = CostOf(bus.proxy.Sent());
      EXPECT_LE(boot.commands, 3);
      EXPECT_EQ(boot.asymmetric, 1);
      traffic += bus.proxy.Traffic();

      const std::string pwd = *ReadFile(kKeyPwdPath), sealed = *ReadFile(kStoredOokPath);
      // The ciphertext crosses as it is, so the search works.
      EXPECT_NE(traffic.find(sealed.substr(12, 256)), std::string::npos);
      for (const std::string& secret : {OneOffKey(context), pwd, KeyAuth(pwd)}) {
        EXPECT_EQ(traffic.find(secret), std::string::npos);
      }

      EXPECT_EQ(PersistentHandles().size(), before.size()) << "a regeneration replaces its key";
    }
  }
  EvictAllBut(keep);
}

// The key manager's refusals, each quiet on standard error and leaving the
// key usable; and only keys it made are ever evicted: an object of other
// software at the handle of a name stays, asked for by name or swept.
TEST(Tpm, KeyManagerRefusesQuietlyAndEvictsOnlyItsOwn) {
  const auto keep = PersistentHandles();
  struct Identity {
    std::uint8_t raw[20] = {}, digest[16] = {};
    char hex[41] = {};
    Identity() {
      EXPECT_EQ(pcp_getRandomBytes(sizeof(raw), raw), 0);
      EXPECT_EQ(BytesToHex(raw, sizeof(raw), hex, sizeof(hex)), 0);
      (void)Md5OfString(hex, digest);
    }
  } name, pass, other, stale;
  std::uint8_t ook[32] = {}, plain[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  std::vector<std::uint8_t> sealed(PCP_FRAGMENT_SIZE);
  std::uint32_t size = PCP_FRAGMENT_SIZE;
  ASSERT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, ook, 32, sealed.data(), &size), 0);

  testing::internal::CaptureStderr();
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0) << "handle taken";
  const auto open = [&](const char* n, const char* p, std::uint32_t length = PCP_FRAGMENT_SIZE,
                        std::uint32_t capacity = 32, std::uint8_t flip = 0) {
    auto fragment = sealed;
    fragment[100] ^= flip;  // inside the ciphertext
    std::uint32_t got = capacity;
    const int rc = pcp_decryptDataFragment(n, p, fragment.data(), length, plain, &got);
    return rc == 0 ? std::string(reinterpret_cast<char*>(plain), got) : "refused";
  };
  EXPECT_EQ(open(name.hex, other.hex), "refused") << "wrong password";
  EXPECT_EQ(open(other.hex, pass.hex), "refused") << "unknown identity";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE - 1), "refused") << "truncated";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 31), "refused") << "small output";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 32, 1), "refused") << "damaged";
  EXPECT_EQ(open(name.hex, pass.hex), std::string(reinterpret_cast<char*>(ook), 32));

  // Another's object at the handle of |other| (its first three digest bytes).
  const std::string context = InRoot("/run/foreign.ctx"), handle = "0x81021234";
  ASSERT_EQ(Tpm2({"tpm2_createprimary", "-C", "o", "-G", "rsa2048", "-c", context}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_evictcontrol", "-C", "o", "-c", context, handle}).status, 0);
  const std::uint8_t foreign[16] = {0x00, 0x12, 0x34};
  ASSERT_EQ(pcp_create_key(stale.digest, stale.digest, 2048, 0), 0);
  EXPECT_NE(pcp_delete_key(foreign, 0), 0);
  EXPECT_EQ(pcp_evict_stale_keys(name.digest), 0);
  EXPECT_NE(pcp_delete_key(stale.digest, 0), 0) << "swept already";
  EXPECT_EQ(pcp_delete_key(name.digest, 0), 0);
  EXPECT_NE(pcp_delete_key(name.digest, 0), 0) << "no key left to delete";
  auto left = keep;
  left.insert(handle);
  EXPECT_EQ(PersistentHandles(), left);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  EvictAllBut(keep);
}

// A TPM that leaves a command unanswered, answers it with an error code, or
// hangs up on it, at every command of a regeneration and of a boot: each run
// ends within one deadline of the TPM's last answer with the module's lines,
// and a clean regeneration afterwards leaves exactly one key of this system.
// With no TPM at all every call fails at once and quietly; what another
// process left in the TPM is flushed. A TPM whose every random draw fails
// never gets a store key sealed under a constant.
TEST(Tpm, EveryCommandFailedEndsInTimeAndLeavesOneKey) {
  const auto keep = PersistentHandles();
  ResetDevice(0x42, 4);
  const auto manage = [](int option, std::string* out) {
    const auto start = std::chrono::steady_clock::now();
    KeyContext* context = nullptr;
    *out = Output([&] { context = KeyManage(option, 1); });
    EXPECT_LT(std::chrono::steady_clock::now() - start,
              std::chrono::milliseconds(2 * kDeadlineMs + 1000))
        << *out;
    return context;
  };
  std::string out;
  pcp_set_transport_for_testing("swtpm:path=" KEYMGR_ROOT "/run/nobody.sock", kDeadlineMs);
  testing::internal::CaptureStderr();
  EXPECT_EQ(manage(KMM_OPTION_REGENERATE, &out), nullptr);
  EXPECT_NE(out.find("Failed to create OOK.\n"), std::string::npos) << out;
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");

  // What a killed process leaves in a TPM with no resource manager (three
  // objects fill it, and a session) does not stop the regeneration.
  for (const char* object : {"/run/left1", "/run/left2", "/run/left3"}) {
    ASSERT_EQ(Tpm2({"tpm2_createprimary", "-C", "o", "-c", InRoot(object)}).status, 0);
  }
  ASSERT_EQ(Tpm2({"tpm2_startauthsession", "-S", InRoot("/run/left.session")}).status, 0);
  OnProxy bus;
  ASSERT_GE(KmmSeedRandom(), 0);  // seeded once, so each flow sends the same commands
  ASSERT_NE(manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
  EXPECT_EQ(Tpm2({"tpm2_getcap", "handles-saved-session"}).out, "");
  using Fault = TpmProxy::Fault;
  for (Fault fault : {Fault::kWithhold, Fault::kError, Fault::kHangUp}) {
    for (int option : {KMM_OPTION_REGENERATE, KMM_OPTION_NORMAL_BOOT}) {
      for (int nth = 1;; ++nth) {
        SCOPED_TRACE(testing::Message() << "fault " << static_cast<int>(fault) << ", option "
                                        << option << ", command " << nth);
        bus.proxy.Arm(fault, nth);
        const KeyContext* context = manage(option, &out);
        const bool reached = static_cast<int>(bus.proxy.Sent().size()) >= nth;
        bus.proxy.Arm(Fault::kNone, 0);
        EXPECT_EQ(context == nullptr,
                  out.ends_with(option == KMM_OPTION_REGENERATE ? "Regenerate Key Error!!\n"
                                                                : "DT=FAIL\nNormal Boot Error!!\n"))
            << out;
        if (option == KMM_OPTION_REGENERATE) {
          ASSERT_NE(manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
          auto own = PersistentHandles();
          std::erase_if(own, [&](const std::string& h) { return keep.count(h) != 0; });
          EXPECT_EQ(own.size(), 1u);
        }
        if (!reached) {
          EXPECT_NE(context, nullptr) << out;
          break;
        }
      }
    }
  }
  bus.proxy.Arm(Fault::kError, 0, 0x17B);  // every TPM2_GetRandom
  ASSERT_NE(manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
  bus.proxy.Arm(Fault::kNone, 0);
  ASSERT_NE(manage(KMM_OPTION_NORMAL_BOOT, &out), nullptr) << out;
  const auto& initial = kmm::kInitialOneOffKey;
  EXPECT_EQ(out.find(Hex({reinterpret_cast<const char*>(initial.data()), 8})), std::string::npos)
      << out;
  // What the withheld answers left (their sessions) stays out of the next test's way.
  for (const char* kind : {"-t", "-l", "-s"}) {
    Tpm2({"tpm2_flushcontext", kind});
  }
  EvictAllBut(keep);
}

// The PCR value of a PCR reset to zeros and extended with |verdict|'s event.
std::string PcrAfter(const std::string& verdict) {
  std::string pcr = Hex(Sha256(std::string(32, '\0') + Sha256("keymgr boot verdict: " + verdict)));
  std::erase(pcr, ' ');
  return verdict.empty() ? std::string(64, '0') : pcr;
}

// After a power cycle (PCRs reset, keys kept) keymgr-measured extends PCR 14
// with one event, whose digest is its verdict's alone, and writes an event
// log that replays to the PCR; a run without a TPM keeps its BN line and
// status and leaves the log empty. A key sealed to the verdict opens only
// after a good boot, in at most 6 TPM commands, one of them asymmetric, its
// answer encrypted on the bus; a regeneration and a new digest file need no
// sealing again. A verifier follows the README's recipe: an attestation key
// quotes the PCR with its nonce, tpm2_checkquote checks the quote,
// keymgr-eventlog replays the log to the quoted value; an edited log and a
// stale nonce are refused.
TEST(Tpm, TheVerdictIsMeasuredAttestedAndRequiredByASealedKey) {
  const std::string M = KEYMGR_TEST_MEASURED_BIN, K = KEYMGR_TEST_KEYMGR_BIN;
  const std::string events = kEventLogPath, a = InRoot("/d/a"), b = InRoot("/d/b");
  // PCR 14 as tpm2-tools print it (upper case), and as a quote gives it.
  const auto pcr = [&] {
    const std::string out = Tpm2({"tpm2_pcrread", "sha256:14"}).out;
    return out.substr(out.find("0x") + 2, 64);
  };
  const auto in = [](const char* name) { return InRoot(std::string("/run/") + name); };
  // quote quotes PCR 14 with |nonce| and checks the quote with |check|.
  const auto quote = [&](const std::string& nonce, const std::string& check) {
    const std::string out =
        Tpm2({"tpm2_quote", "-c", "0x81010002", "-l", "sha256:14", "-q", nonce, "-m",
              in("quote.msg"), "-s", in("quote.sig"), "-o", in("quote.pcrs"), "-g", "sha256"})
            .out;
    const bool checked =
        test::Run({"tpm2_checkquote", "-u", in("ak.pub"), "-m", in("quote.msg"), "-s",
                   in("quote.sig"), "-f", in("quote.pcrs"), "-g", "sha256", "-q", check})
            .status == 0;
    const std::size_t at = out.find("14: 0x");
    return checked && at != std::string::npos ? out.substr(at + 6, 64) : "refused";
  };
  const auto replays = [&](const std::string& value) {
    return test::Run({KEYMGR_TEST_EVENTLOG_BIN, events, "--expect", value}).status == 0;
  };
  // The endorsement and attestation keys, persistent: the simulator has no
  // resource manager to keep its few slots clear.
  const auto keep = PersistentHandles();
  ASSERT_EQ(Tpm2({"tpm2_createek", "-c", "0x81010001", "-G", "rsa", "-u", in("ek.pub")}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_createak", "-C", "0x81010001", "-c", in("ak.ctx"), "-G", "rsa", "-g",
                  "sha256", "-s", "rsassa", "-u", in("ak.pub"), "-f", "pem"})
                .status,
            0);
  ASSERT_EQ(Tpm2({"tpm2_evictcontrol", "-c", in("ak.ctx"), "0x81010002"}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_flushcontext", "-t"}).status, 0);
  OnProxy bus;
  pcp_set_seal_pcr_for_testing(14);
  const std::string image = KEYMGR_EEPROM_PATH;
  const struct {
    const char* name;
    std::function<void()> change;
    std::string away;  // a file moved aside for the run
    int status;
    std::string line, verdict;  // a line of the output; "" for no event
  } rows[] = {
      // clang-format off
      {"a good boot", [] {}, "", 0, "BN=OK\n", "BN=OK"},
      {"a file altered", [&] { WriteFile(b, "x"); }, "", 0, "BN=FAIL\n", "BN=FAIL"},
      {"no digest file", [] { std::filesystem::remove(kDigestFilePath); }, "", 1, "BN=FAIL\n", "BN=FAIL"},
      {"the gate closed", [&] { WriteFile(image, ReadFile(image)->replace(eeprom::kControlByteOffset, 1, 1, '\0')); }, "", 0, "SFE_003 - [0]\n", "none"},
      {"no EEPROM", [] {}, image, 0, "Read Error [-2]", "none"},
      {"no TPM", [] {}, kSwtpm, 0, "BN=OK\n", ""},
      // clang-format on
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    ResetDevice(0x42, 0);
    WriteFile(a, "");
    WriteFile(b, "b");
    WriteFile(kManifestPath, a + " " + b);
    test::Run({K, "hash"});
    ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
    PowerCycleTpm();
    row.change();
    if (!row.away.empty()) {
      std::filesystem::rename(row.away, row.away + ".away");
    }
    const RunResult run = test::Run({M});
    if (!row.away.empty()) {
      std::filesystem::rename(row.away + ".away", row.away);
    }
    EXPECT_EQ(run.status, row.status);
    EXPECT_NE(run.out.find(row.line), std::string::npos) << run.out;
    EXPECT_EQ(pcr(), PcrAfter(row.verdict));
    EXPECT_EQ(replays(pcr()), !row.verdict.empty());
    EXPECT_EQ(ReadFile(events)->find("\"verdict\":\"" + row.verdict + "\"") != std::string::npos,
              !row.verdict.empty());
    bus.proxy.Arm(TpmProxy::Fault::kNone, 0);
    const KeyContext* context = nullptr;
    Output([&] { context = KeyManage(KMM_OPTION_NORMAL_BOOT, 0); });
    EXPECT_EQ(context != nullptr, row.verdict == "BN=OK");
    if (context != nullptr) {
      const Cost cost = CostOf(bus.proxy.Sent());
      EXPECT_LE(cost.commands, 6);
      EXPECT_EQ(cost.asymmetric, 1);
      EXPECT_EQ(bus.proxy.Traffic().find(OneOffKey(context)), std::string::npos) << "in clear";
    }
    if (row.verdict.starts_with("BN=")) {  // a verifier's view of the boot
      EXPECT_EQ(quote("feed01", "feed01"), PcrAfter(row.verdict));
      EXPECT_EQ(quote("feed02", "feed01"), "refused");
      EXPECT_TRUE(replays(quote("feed03", "feed03")));
      std::string edited = *ReadFile(events);
      edited.replace(edited.find(row.verdict), row.verdict.size(),
                     row.verdict == "BN=OK" ? "BN=FAIL" : "BN=OK");
      WriteFile(events, edited);
      EXPECT_FALSE(replays(pcr()));
    }
  }
  // After a good boot: a regeneration, and a new digest file.
  ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
  WriteFile(kManifestPath, a);
  ASSERT_EQ(test::Run({K, "hash"}).status, 0);
  PowerCycleTpm();
  test::Run({M});
  const KeyContext* context = nullptr;
  Output([&] { context = KeyManage(KMM_OPTION_NORMAL_BOOT, 0); });
  EXPECT_NE(context, nullptr);
  pcp_set_seal_pcr_for_testing(-1);
  EvictAllBut(keep);
}

}  // namespace
}  // namespace keymgr::test
