// End-to-end runs of the built keymgr in the sandbox root.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
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
  static const char kSwap[] =
      R"((until grep -q "$1" "$4" 2>/dev/null; do sleep 0.05; done; printf x >"$2";)"
      R"( cat "$3.x" >"$3") & shift 4; exec "$@")";
  std::vector<std::string> args = {"sh", "-c", kSwap,   "sh",
                                   held, file, digests, t::InRoot("/trace")};
  args.insert(args.end(), argv.begin(), argv.end());
  return args;
}

const std::string K = KEYMGR_TEST_KEYMGR_BIN, S = KEYMGR_TEST_SIGNED_BIN, E = t::Sha256(""),
                  B = t::Sha256("b"), Z = t::Sha256("z"), X = t::Sha256("x");
const std::string sig = keymgr::kSignaturePath, data = KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/";
// B with its last byte changed: a record that differs from b's digest there alone.
const std::string lastByte = B.substr(0, 31) + static_cast<char>(B[31] ^ 1);
// A log left by an earlier boot, longer than any line that replaces it.
const std::string kOldLog = "OLD " + std::string(40, '.') + "\n";

void Sign(const std::string& key) {
  t::Run({KEYMGR_TEST_MKDIGEST_BIN, "--root", "/", "--manifest", kManifest, "--output", kDigests,
          "--key", data + key, "--counter", "42"});
}
// Resign makes byte |at| of keymgr.sig |byte| and signs the file again with
// the test key.
void Resign(std::size_t at, char byte) {
  std::string file = *t::ReadFile(sig);
  file[at] = byte;
  t::WriteFile(t::InRoot("/body"), file.substr(0, 88));
  t::Run({"openssl", "pkeyutl", "-sign", "-rawin", "-inkey", data + "digest_key.pem", "-in",
          t::InRoot("/body"), "-out", t::InRoot("/signature")});
  t::WriteFile(sig, file.substr(0, 88) + *t::ReadFile(t::InRoot("/signature")));
}
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
};

// Every run starts from a (empty), b, and c, a link to a file whose path has
// 99 characters (the most an entry may hold), listed with mixed white space,
// b twice; their records followed by bytes never read; a log left by an
// earlier boot; and an EEPROM whose control byte alone opens the gate. The
// signed build's runs (keymgr-signed, the test key built in) start from a
// digest file and keymgr.sig that keymgr-mkdigest made, with release 42.
// A BN line starts the log anew; nothing else touches it.
class Commands : public testing::TestWithParam<Case> {};
TEST_P(Commands, GateOutcomeAndExitStatus) {
  const Case& k = GetParam();
  t::ResetDevice(0x42, 0);
  t::WriteFile(a, "");
  t::WriteFile(b, "b");
  t::WriteFile(l99, "z");
  fs::create_symlink(l99, c);
  t::WriteFile(kManifest, a + " \t" + b + "\n\n" + b + "\t" + c + "\n");
  t::WriteFile(kDigests, records + "junk");
  t::WriteFile(kLog, kOldLog);
  if (k.args.back() != "hash" && std::find(k.args.begin(), k.args.end(), S) != k.args.end()) {
    Sign("digest_key.pem");
  }
  k.change();
  const auto digests = t::ReadFile(kDigests);
  auto run = t::Run(k.args);
  EXPECT_EQ(std::to_string(run.status) + run.out, std::to_string(k.status) + k.out);
  const auto bn = k.out.find("BN=");
  EXPECT_EQ(t::ReadFile(kLog), bn == std::string::npos ? kOldLog : k.out.substr(bn));
  EXPECT_EQ(t::ReadFile(kDigests), k.digests ? k.digests : digests);
}
const Case kCases[] = {
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
    {"file whose record differs in its last byte", {K, "file", b}, Block(b, B, lastByte), Put(kDigests, E + lastByte)},
    {"hash by prefix", {K, "hashes"}, "", Put(kDigests), 0, records},
    {"hash stops at a missing entry", {K, "hash"}, "file[" + b + "] status error!!\n", Put(b), 0, E},
    {"hash without a manifest", {K, "hash"}, kManifest + " open error!!!\n", Put(kManifest), 0, ""},
    {"hash stops at an entry too long", {K, "hash"}, tooLong, Put(kManifest, l99 + " " + l99 + "z " + c), 0, Z},
    {"a corrupted entry", {K, "log"}, kOff + Block(a, E, E) + Block(b, t::Sha256("altered"), B) + fail, Put(b, "altered")},
    {"a record differing in its last byte", {K, "log"}, kOff + Block(a, E, E) + Block(b, B, lastByte) + fail, Put(kDigests, E + lastByte + B + Z)},
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
    {"signed, the digest file rebuilt unsigned", {S}, kOff + badSig + fail, [] { t::WriteFile(b, "x"); t::Run({K, "hash"}); }, 1},
    {"signed, no keymgr.sig", {S}, kOff + badSig + fail, Put(sig), 1},
    {"signed, keymgr.sig empty", {S}, kOff + badSig + fail, Put(sig, ""), 1},
    {"signed, keymgr.sig cut short", {S}, kOff + badSig + fail, [] { fs::resize_file(sig, 151); }, 1},
    {"signed, a bit flipped", {S}, kOff + badSig + fail, [] { std::string f = *t::ReadFile(sig); f[120] ^= 1; t::WriteFile(sig, f); }, 1},
    {"signed by another key", {S}, kOff + badSig + fail, [] { Sign("other_key.pem"); }, 1},
    {"signed, another format version", {S}, kOff + badSig + fail, [] { Resign(7, 2); }, 1},
    {"signed, the last entry dropped", {S}, kOff + badSig + fail, Put(kManifest, a + " " + b + " " + b), 1},
    {"signed, two entries swapped", {S}, kOff + badSig + fail, Put(kManifest, b + " " + a + " " + b + " " + c), 1},
    {"signed, an entry added", {S}, kOff + badSig + fail, Put(kManifest, a + " " + b + " " + b + " " + c + " " + a), 1},
    {"signed, hash refused", {S, "hash"}, "hash is done on the build host in a signed build!!!\n", [] {}, 1},
    {"signed, file checked", {S, "file", b}, Block(b, B, B)},
    {"signed, file against a bad keymgr.sig", {S, "file", b}, badSig, Put(sig, "")},
    // The files swapped while keymgr.sig is being opened: what is hashed
    // against is what was checked.
    {"signed, files swapped after the check", SwapAt(sig, b, kDigests, t::Traced({"-o", t::InRoot("/trace"), "-P", sig, "-e", "trace=openat", "-e", "inject=openat:delay_enter=2s"}, {S, "log"})),
     kOff + "release counter: 42\n" + Block(a, E, E) + Block(b, X, B) + fail, [] { t::WriteFile(kDigests + ".x", E + X + X + Z); }, 0, E + X + X + Z},
    // clang-format on
};
INSTANTIATE_TEST_SUITE_P(Rows, Commands, testing::ValuesIn(kCases), t::RowName());

}  // namespace
