// End-to-end runs of the built keymgr in the sandbox root.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>

#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kLog = keymgr::kBootLogPath, kDigests = keymgr::kDigestFilePath,
                  kManifest = keymgr::kManifestPath;
const std::string kOn = "SFE_003 - [4]\n", kOff = "SFE_003 - [0]\n";
const std::string a = t::InRoot("/d/a"), b = t::InRoot("/d/b"), c = t::InRoot("/d/c");

std::string Block(const std::string& entry, const std::string& md, const std::string& rd) {
  return "md_sha: " + t::Hex(md) + "\nrd_sha: " + t::Hex(rd) + "\n[" + entry +
         (md == rd ? "] has integrity!!\n\n" : "] is corrupted!!\n\n");
}

// Put writes |bytes| at |path|, or removes it when none are given.
std::function<void()> Put(const std::string& path, std::optional<std::string> bytes = {}) {
  return [=] { bytes ? t::WriteFile(path, *bytes) : void(fs::remove(path)); };
}

// EioOn runs |program| with every read of |path| failing with EIO.
std::vector<std::string> EioOn(const std::string& path, const std::string& program) {
  return t::Traced(
      {"-o", "/dev/null", "-P", path, "-e", "trace=read", "-e", "inject=read:error=EIO"},
      {program});
}

// SwapAt runs |argv| (traced, holding its open of |held|) and meanwhile,
// once that open is under way, alters |file| to "x" and puts |digests|.x in
// the digest file's place.
std::vector<std::string> SwapAt(const std::string& held, const std::string& file,
                                const std::string& digests, const std::vector<std::string>& argv) {
  std::vector<std::string> args = {
      "sh",
      "-c",
      R"((until grep -q "$1" "$4" 2>/dev/null; do sleep 0.05; done; printf x >"$2"; cat "$3.x" >"$3") & shift 4; exec "$@")",
      "sh",
      held,
      file,
      digests,
      t::InRoot("/trace")};
  args.insert(args.end(), argv.begin(), argv.end());
  return args;
}

// Every run starts from a (empty), b, and c, a link to a file whose path has
// 99 characters (the most an entry may hold), listed with mixed white space,
// b twice; their records followed by bytes never read; a log left by an
// earlier boot; and an EEPROM whose control byte alone opens the gate. The
// signed build's runs (keymgr-signed, the test key built in) start from a
// digest file and keymgr.sig that keymgr-mkdigest made, with release 42.
TEST(KeymgrTest, CommandsGateOutcomeAndExitStatus) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN, S = KEYMGR_TEST_SIGNED_BIN, E = t::Sha256(""),
                    B = t::Sha256("b"), Z = t::Sha256("z"), X = t::Sha256("x");
  const std::string sig = keymgr::kSignaturePath, data = KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/";
  const auto sign = [&](const std::string& key) {
    t::Run({KEYMGR_TEST_MKDIGEST_BIN, "--root", "/", "--manifest", kManifest, "--output", kDigests,
            "--key", data + key, "--counter", "42"});
  };
  // Bytes |at| of keymgr.sig made |byte|, and the file signed again with
  // the test key.
  const auto resign = [&](std::size_t at, char byte) {
    std::string file = *t::ReadFile(sig);
    file[at] = byte;
    t::WriteFile(t::InRoot("/body"), file.substr(0, 88));
    t::Run({"openssl", "pkeyutl", "-sign", "-rawin", "-inkey", data + "digest_key.pem", "-in",
            t::InRoot("/body"), "-out", t::InRoot("/signature")});
    t::WriteFile(sig, file.substr(0, 88) + *t::ReadFile(t::InRoot("/signature")));
  };
  const std::string badSig = sig + " signature error!!!\n";
  const std::string l99 = t::InRoot("/" + std::string(98 - t::Root().size(), 'z'));
  const std::string pass = kOff + "BN=OK\n", fail = "BN=FAIL\n", records = E + B + B + Z;
  const std::string first3 = kOff + Block(a, E, E) + Block(b, B, B) + Block(b, B, B);
  const std::string tooLong = "file[" + l99.substr(0, 40) + "...] name too long!!\n";
  const std::string aOpen = kOff + "file[" + a + "] open error!!\n" + fail;
  struct Case {
    const char* name;
    std::vector<std::string> args;
    std::string out;
    std::function<void()> change = [] {};
    int status = 0;
    std::optional<std::string> digests = {};  // what hash leaves; others leave it alone
  } cases[] = {
      // clang-format off
      {"verbose verification by prefix", {K, "logall"}, first3 + Block(c, Z, Z) + "BN=OK\n"},
      {"a word shorter than file", {K, "fil"}, pass},
      {"a lone dash", {K, "-"}, pass},
      {"SFE_003 alone opens the gate", {K, "has"}, kOn + "BN=OK\n", [] { t::MakeEeprom(0x00, 4); }},
      {"mode 3 keeps the gate closed", {K}, kOff, [] { t::MakeEeprom(0x43, 0xFFFFFFFB); }},
      {"the enable bit missing", {K, "log"}, kOff, [] { t::MakeEeprom(0x02, 0); }},
      {"version by prefix", {K, "-vx"}, "Version: 2.3\n"},
      {"file without a path", {K, "file"}, ""},
      {"file by prefix", {K, "filecheck", b, "x"}, Block(b, B, B), Put(kDigests, E + B + t::Sha256("x"))},
      {"file by another spelling", {K, "file", "d/b"}, ""},
      {"file of a missing entry", {K, "file", b}, "file[" + b + "] status error!!\n", Put(b)},
      {"file without a digest file", {K, "file", b}, kDigests + " open error!!!\n", Put(kDigests)},
      {"hash by prefix", {K, "hashes"}, "", Put(kDigests), 0, records},
      {"hash stops at a missing entry", {K, "hash"}, "file[" + b + "] status error!!\n", Put(b), 0, E},
      {"hash without a manifest", {K, "hash"}, kManifest + " open error!!!\n", Put(kManifest), 0, ""},
      {"hash stops at an entry too long", {K, "hash"}, tooLong, Put(kManifest, l99 + " " + l99 + "z " + c), 0, Z},
      {"a corrupted entry", {K, "log"}, kOff + Block(a, E, E) + Block(b, t::Sha256("altered"), B) + fail, Put(b, "altered")},
      {"a missing entry", {K}, kOff + "file[" + b + "] status error!!\n" + fail, Put(b)},
      {"a short digest file", {K, "log"}, first3 + Block(c, Z, std::string(32, '\0')) + fail, Put(kDigests, E + B + B)},
      {"an empty manifest", {K}, pass, Put(kManifest, " \n\t")},
      {"an entry too long", {K}, kOff + tooLong + fail, Put(kManifest, l99 + "z")},
      {"a FIFO listed", {K}, aOpen, [] { fs::remove(a); mkfifo(a.c_str(), 0600); }},
      {"a file of 2 GiB", {K}, aOpen, [] { fs::resize_file(a, 1ULL << 31); }},
      {"a file of 4 GiB and a byte", {K}, aOpen, [] { fs::resize_file(a, (1ULL << 32) + 1); }},
      {"an entry with a NUL byte", {K}, kOff + "file[" + a + "] open error!!\n" + fail,
       Put(kManifest, a + std::string("\0x ", 3) + b)},
      {"a manifest that cannot be read", EioOn(kManifest, K), kOff + kManifest + " open error!!!\n" + fail, [] {}, 1},
      {"a digest file that cannot be read", EioOn(kDigests, K), kOff + kDigests + " open error!!!\n" + fail, [] {}, 1},
      {"signed and checked", {S, "log"}, kOff + "release counter: 42\n" + first3.substr(kOff.size()) + Block(c, Z, Z) + "BN=OK\n"},
      {"signed, a listed file altered", {S}, kOff + fail, Put(b, "x")},
      {"signed, the digest file rebuilt unsigned", {S}, kOff + badSig + fail, [&] { t::WriteFile(b, "x"); t::Run({K, "hash"}); }, 1},
      {"signed, no keymgr.sig", {S}, kOff + badSig + fail, Put(sig), 1},
      {"signed, keymgr.sig empty", {S}, kOff + badSig + fail, Put(sig, ""), 1},
      {"signed, keymgr.sig cut short", {S}, kOff + badSig + fail, [&] { fs::resize_file(sig, 151); }, 1},
      {"signed, a bit flipped", {S}, kOff + badSig + fail, [&] { std::string f = *t::ReadFile(sig); f[120] ^= 1; t::WriteFile(sig, f); }, 1},
      {"signed by another key", {S}, kOff + badSig + fail, [&] { sign("other_key.pem"); }, 1},
      {"signed, another format version", {S}, kOff + badSig + fail, [&] { resign(7, 2); }, 1},
      {"signed, the last entry dropped", {S}, kOff + badSig + fail, Put(kManifest, a + " " + b + " " + b), 1},
      {"signed, two entries swapped", {S}, kOff + badSig + fail, Put(kManifest, b + " " + a + " " + b + " " + c), 1},
      {"signed, an entry added", {S}, kOff + badSig + fail, Put(kManifest, a + " " + b + " " + b + " " + c + " " + a), 1},
      {"signed, hash refused", {S, "hash"}, "hash is done on the build host in a signed build!!!\n", [] {}, 1},
      {"signed, file checked", {S, "file", b}, Block(b, B, B)},
      {"signed, file against a bad keymgr.sig", {S, "file", b}, badSig, Put(sig, "")},
      // The files swapped while keymgr.sig is being opened: what is hashed
      // against is what was checked.
      {"signed, files swapped after the check", SwapAt(sig, b, kDigests, t::Traced({"-o", t::InRoot("/trace"), "-P", sig, "-e", "trace=openat", "-e", "inject=openat:delay_enter=2s"}, {S, "log"})),
       kOff + "release counter: 42\n" + Block(a, E, E) + Block(b, X, B) + fail, [&] { t::WriteFile(kDigests + ".x", E + X + X + Z); }, 0, E + X + X + Z},
      // clang-format on
  };
  const auto setUp = [&](const Case& k) {
    t::ResetDevice(0x42, 0);
    t::WriteFile(a, "");
    t::WriteFile(b, "b");
    t::WriteFile(l99, "z");
    fs::create_symlink(l99, c);
    t::WriteFile(kManifest, a + " \t" + b + "\n\n" + b + "\t" + c + "\n");
    t::WriteFile(kDigests, records + "junk");
    t::WriteFile(kLog, "OLD\n");
    if (k.args.back() != "hash" && std::find(k.args.begin(), k.args.end(), S) != k.args.end()) {
      sign("digest_key.pem");
    }
  };
  for (const Case& k : cases) {
    SCOPED_TRACE(k.name);
    setUp(k);
    k.change();
    const auto digests = t::ReadFile(kDigests);
    auto run = t::Run(k.args);
    EXPECT_EQ(std::to_string(run.status) + run.out, std::to_string(k.status) + k.out);
    // A BN line starts the log anew; nothing else touches it.
    const auto bn = k.out.find("BN=");
    EXPECT_EQ(t::ReadFile(kLog), bn == std::string::npos ? "OLD\n" : k.out.substr(bn)) << k.out;
    EXPECT_EQ(t::ReadFile(kDigests), k.digests ? k.digests : digests) << k.out;
  }
}

// keymgr-mkdigest makes what keymgr hash makes on the device: over a tree
// seen at "/" (a link with an absolute target, ".." entries) the same bytes;
// an entry it cannot hash (a folder, a missing file) is named, and nothing
// is written. Inside an image root, absolute links and ".." stay in the
// root. The same tree and key give the same keymgr.sig on every host: the
// one below was made on x86-64, and the aarch64 suite makes it under
// qemu-user; so does the Buildroot script.
TEST(KeymgrTest, MkdigestMakesWhatHashMakesInsideTheImageRoot) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN, M = KEYMGR_TEST_MKDIGEST_BIN, X = t::Sha256("x");
  const std::string key = KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/digest_key.pem";
  t::ResetDevice(0x42, 0);
  const std::string d = t::InRoot("/d");
  t::WriteFile(d + "/a", "a");
  t::WriteFile(d + "/sub/b", "b");
  fs::create_symlink(d + "/a", d + "/l");
  const std::string list = d + "/a " + d + "/sub/../sub/b " + d + "/l " + d + "/sub/../../d/a\n";
  for (const std::string& extra : {std::string(), d + "/sub", d + "/gone"}) {
    t::WriteFile(kManifest, list + extra);
    t::Run({K, "hash"});
    const std::string hashed = *t::ReadFile(kDigests);
    t::WriteFile(kDigests, "OLD");
    const auto made = t::Run({M, "--root", "/", "--manifest", kManifest, "--output", kDigests});
    EXPECT_EQ(made.status, extra.empty() ? 0 : 1) << extra;
    EXPECT_EQ(*t::ReadFile(kDigests), extra.empty() ? hashed : "OLD") << extra;
    EXPECT_EQ(made.err.find(extra + ": cannot be hashed") != std::string::npos, !extra.empty())
        << made.err;
  }
  const std::string root = t::InRoot("/image"), hidden = root + "/quorvan/hidden/";
  t::WriteFile(root + "/etc/x", "x");
  fs::create_symlink("/etc/x", root + "/etc/l");
  fs::create_symlink("../../../etc/x", root + "/etc/up");
  t::WriteFile(hidden + "keymgr.list", "/etc/l /etc/up /../etc/x\n");
  std::vector<std::vector<std::string>> runs(2,
                                             {M, "--root", root, "--key", key, "--counter", "7"});
  if (!t::UnderEmulator()) {
    runs.push_back({"env", "KEYMGR_MKDIGEST=" + M, "KEYMGR_DIGEST_KEY=" + key,
                    "KEYMGR_RELEASE_COUNTER=7",
                    KEYMGR_TEST_SOURCE_DIR "/dist/buildroot/keymgr-digest.sh", root});
  }
  for (const auto& run : runs) {
    std::filesystem::remove(hidden + "keymgr.sig");
    ASSERT_EQ(t::Run(run).status, 0) << run[0];
    EXPECT_EQ(t::ReadFile(hidden + "keymgr.cb"), X + X + X);
    EXPECT_EQ(
        t::Hex(*t::ReadFile(hidden + "keymgr.sig")),
        t::Hex(t::FromHex("4b4d534700000001e85ccff33f6ba91c0000000000000007a94e6fc76671dc7adc1689"
                          "1d8d5363846aa7e3c5f13bd90cb3388ce149b41a6b335fa9f48894ed578d7c6676cfd0"
                          "f1510752479cbd604daea1472a0363639702072c8e848c6e5212a325e9a9cdba94b26a"
                          "d67af18613dd80afafae7b105ced93610409cfbd2adaf949f0f837007f407405df5685"
                          "54815b2a416e02e05e361c0c")));
  }
}

// The PCR value of a PCR reset to zeros and extended with |verdict|'s event.
std::string PcrAfter(const std::string& verdict) {
  std::string pcr =
      t::Hex(t::Sha256(std::string(32, '\0') + t::Sha256("keymgr boot verdict: " + verdict)));
  std::erase(pcr, ' ');
  return verdict.empty() ? std::string(64, '0') : pcr;
}

// keymgr-measured extends PCR 14 with one event a boot run whose digest is
// its verdict's alone: after a power cycle the PCR holds the good value only
// after a good boot, and its event log replays to the PCR. A run without a
// TPM keeps its BN line and status, and leaves the log empty. A verifier
// follows the README's recipe: an attestation key quotes the PCR with its
// nonce, tpm2_checkquote checks the quote, keymgr-eventlog replays the log to
// the quoted value; an edited log and a stale nonce are refused.
TEST(KeymgrTest, MeasuredBootPutsItsVerdictInAPcrThatAQuoteAttests) {
  const std::string M = KEYMGR_TEST_MEASURED_BIN, K = KEYMGR_TEST_KEYMGR_BIN, tcti = KEYMGR_TCTI;
  const std::string events = keymgr::kEventLogPath,
                    socket = tcti.substr(std::strlen("swtpm:path="));
  // PCR 14 as tpm2-tools print it (upper case), and as a quote gives it.
  const auto pcr = [&] {
    const std::string out = t::Run({"tpm2_pcrread", "sha256:14", "-T", tcti}).out;
    return out.substr(out.find("0x") + 2, 64);
  };
  const auto in = [](const char* name) { return t::InRoot(std::string("/run/") + name); };
  // quote quotes PCR 14 with |nonce| and checks the quote with |check|.
  const auto quote = [&](const std::string& nonce, const std::string& check) {
    const t::RunResult q = t::Run({"tpm2_quote", "-c", "0x81010002", "-l", "sha256:14", "-q", nonce,
                                   "-m", in("quote.msg"), "-s", in("quote.sig"), "-o",
                                   in("quote.pcrs"), "-g", "sha256", "-T", tcti});
    const bool checked =
        t::Run({"tpm2_checkquote", "-u", in("ak.pub"), "-m", in("quote.msg"), "-s", in("quote.sig"),
                "-f", in("quote.pcrs"), "-g", "sha256", "-q", check})
            .status == 0;
    const std::size_t at = q.out.find("14: 0x");
    return checked && at != std::string::npos ? q.out.substr(at + 6, 64) : "refused";
  };
  // The endorsement and attestation keys, persistent: the simulator has no
  // resource manager to keep its few slots clear.
  const auto keep = t::PersistentHandles();
  for (const std::vector<std::string>& step :
       {std::vector<std::string>{"tpm2_createek", "-c", "0x81010001", "-G", "rsa", "-u",
                                 in("ek.pub")},
        {"tpm2_createak", "-C", "0x81010001", "-c", in("ak.ctx"), "-G", "rsa", "-g", "sha256", "-s",
         "rsassa", "-u", in("ak.pub"), "-f", "pem"},
        {"tpm2_evictcontrol", "-c", in("ak.ctx"), "0x81010002"},
        {"tpm2_flushcontext", "-t"}}) {
    auto args = step;
    args.insert(args.end(), {"-T", tcti});
    ASSERT_EQ(t::Run(args).status, 0) << step[0];
  }
  const struct {
    const char* name;
    std::function<void()> change;
    int status;
    std::string line, verdict;  // a line of the output; "" for no event
  } rows[] = {
      // clang-format off
      {"a good boot", [] {}, 0, "BN=OK\n", "BN=OK"},
      {"a file altered", Put(b, "x"), 0, "BN=FAIL\n", "BN=FAIL"},
      {"no digest file", Put(kDigests), 1, "BN=FAIL\n", "BN=FAIL"},
      {"the gate closed", [] { t::MakeEeprom(0x00, 0); }, 0, kOff, "none"},
      {"no EEPROM", Put(KEYMGR_EEPROM_PATH), 0, "Read Error [-2]", "none"},
      {"no TPM", [&] { fs::rename(socket, socket + ".away"); }, 0, "BN=OK\n", ""},
      // clang-format on
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    t::ResetDevice(0x42, 0);
    t::WriteFile(a, "");
    t::WriteFile(b, "b");
    t::WriteFile(kManifest, a + " " + b);
    t::Run({K, "hash"});
    t::PowerCycleTpm();
    row.change();
    const t::RunResult run = t::Run({M});
    if (row.verdict.empty()) {
      fs::rename(socket + ".away", socket);
    }
    EXPECT_EQ(run.status, row.status);
    EXPECT_NE(run.out.find(row.line), std::string::npos) << run.out;
    EXPECT_EQ(pcr(), PcrAfter(row.verdict));
    EXPECT_EQ(t::Run({KEYMGR_TEST_EVENTLOG_BIN, events, "--expect", pcr()}).status,
              row.verdict.empty() ? 1 : 0);
    EXPECT_EQ(t::ReadFile(events)->find("\"verdict\":\"" + row.verdict + "\"") != std::string::npos,
              !row.verdict.empty());
    if (row.verdict.starts_with("BN=")) {  // a verifier's view of the boot
      EXPECT_EQ(quote("feed01", "feed01"), PcrAfter(row.verdict));
      EXPECT_EQ(quote("feed02", "feed01"), "refused");
      EXPECT_EQ(
          t::Run({KEYMGR_TEST_EVENTLOG_BIN, events, "--expect", quote("feed03", "feed03")}).status,
          0);
      std::string edited = *t::ReadFile(events);
      edited.replace(edited.find(row.verdict), row.verdict.size(),
                     row.verdict == "BN=OK" ? "BN=FAIL" : "BN=OK");
      t::WriteFile(events, edited);
      EXPECT_NE(t::Run({KEYMGR_TEST_EVENTLOG_BIN, events, "--expect", pcr()}).status, 0);
    }
  }
  t::EvictAllBut(keep);
}

// keymgr hash killed anywhere leaves the old digest file or the new one,
// never a torn or empty one, and the boot after it ends cleanly.
TEST(KeymgrTest, KilledHashLeavesTheOldOrTheNewDigestFile) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN;
  t::ResetDevice(0x42, 0);
  std::string list;
  for (int i = 0; i < 3000; ++i) {
    list += t::InRoot("/f/" + std::to_string(i)) + "\n";
    t::WriteFile(t::InRoot("/f/" + std::to_string(i)), std::to_string(i));
  }
  t::WriteFile(kManifest, list);
  t::Run({K, "hash"});
  const std::string old = *t::ReadFile(kDigests);
  t::WriteFile(t::InRoot("/f/2999"), "altered");
  // Synced, renamed into place, and the folder synced.
  EXPECT_EQ(t::SyncTrace({K, "hash"}), "F L R:keymgr.cb D ");
  const std::string fresh = *t::ReadFile(kDigests);
  ASSERT_EQ(fresh.size(), old.size());

  std::vector<std::pair<std::string, int>> points = {
      {"fsync", 1}, {"fsync", 2}, {"linkat", 1}, {"renameat", 1}};
  for (int n = 1; n <= 24; n += 3) {
    points.emplace_back("write", n);
  }
  for (int n = 100; n <= 3000; n += 450) {
    points.emplace_back("openat", n);
  }
  for (const auto& [call, n] : points) {
    SCOPED_TRACE(call + std::to_string(n));
    t::WriteFile(kDigests, old);
    EXPECT_TRUE(t::RunKilledAt(call, n, {K, "hash"}));
    for (const auto& entry : fs::directory_iterator(t::InRoot("/quorvan/hidden"))) {
      const std::string name = entry.path().filename(), bytes = *t::ReadFile(entry.path());
      EXPECT_TRUE(name == "keymgr.list" || (name == "keymgr.cb" && bytes == old) || bytes == fresh)
          << name;
    }
    const auto boot = t::Run({K});
    EXPECT_EQ(boot.out, kOff + (*t::ReadFile(kDigests) == fresh ? "BN=OK\n" : "BN=FAIL\n"));
  }
}

// Runs with one hashing thread and with four print, log and leave the same,
// failures included; the boot outcome is also checked on its own, so that a
// fault common to both is caught. Every fifth file spans several reads and
// goes to the workers; the caller hashes the others.
TEST(KeymgrTest, ThreadedRunsMatchOneAtATime) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN;
  const auto path = [](int i) { return t::InRoot("/h/" + std::to_string(i)); };
  const auto grow = [&](int i) { std::ofstream(path(i), std::ios::app) << "more"; };
  const std::pair<std::string, std::function<void()>> cases[] = {
      {"intact", [] {}},
      {"first corrupted", Put(path(0), "x")},
      {"middle corrupted", Put(path(31), "x")},
      {"last corrupted", Put(path(59), "x")},
      {"missing", Put(path(22))},
      {"large shrinks", [&] { fs::resize_file(path(10), 1000); }},
      {"large grows", [&] { grow(15); }},
      {"small grows", [&] { grow(16); }},
      {"fifo",
       [&] {
         fs::remove(path(25));
         mkfifo(path(25).c_str(), 0600);
       }},
      {"folder",
       [&] {
         fs::remove(path(35));
         fs::create_directory(path(35));
       }},
  };
  for (const auto& [name, change] : cases) {
    SCOPED_TRACE(name);
    t::ResetDevice(0x42, 0);
    std::string list;
    for (int i = 0; i < 60; ++i) {
      t::WriteFile(path(i), std::string(i % 5 == 0 ? 300000 + i : 10 + i, char('a' + i % 26)));
      list += path(i) + "\n";
    }
    t::WriteFile(kManifest, list);
    t::Run({"/usr/bin/env", "KEYMGR_HASH_THREADS=1", K, "hash"});
    change();
    const auto digests = t::ReadFile(kDigests);
    for (const char* command : {"", "log", "hash"}) {
      std::string seen[2];
      for (int threads : {1, 4}) {
        t::WriteFile(kDigests, *digests);
        t::WriteFile(kLog, "OLD\n");
        const auto run =
            t::Run({"/usr/bin/env", "KEYMGR_HASH_THREADS=" + std::to_string(threads), K, command});
        EXPECT_EQ(run.err, "") << command << threads;  // where a sanitizer reports
        seen[threads > 1] = std::to_string(run.status) + run.out + "|" + *t::ReadFile(kLog) + "|" +
                            t::Hex(*t::ReadFile(kDigests));
      }
      EXPECT_EQ(seen[0], seen[1]) << command;
      if (*command != 'h') {
        EXPECT_EQ(t::ReadFile(kLog), name == "intact" ? "BN=OK\n" : "BN=FAIL\n") << command;
      }
    }
  }
}

}  // namespace
