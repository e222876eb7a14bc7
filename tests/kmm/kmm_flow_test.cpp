// The module's flows over the fake EEPROM and key manager of the test support,
// and the real crypto services behind --wrap wrappers that inject faults and
// count containers.
#include <sys/prctl.h>

#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <algorithm>
#include <filesystem>
#include <regex>
#include <set>

#include "eeprom/eeprom_map.h"
#include "kmm/internal.h"
#include "support/fake_platform.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace {

// The |at|-th call (from 1) of |call| fails: a create returns no container;
// the others return |code|, or with code 0 run and report |length| as output.
enum CryptoCall { kCreate, kHash, kAesProcess };
struct CryptoFault {
  int call = -1, at = 0;
  std::uint32_t code = 0, length = 0;
} g_fault;
std::array<int, 3> g_calls{};
int g_live = 0;      // containers created and not yet destroyed
int g_dumpable = 0;  // whether a crypto call ran while a core could be taken

bool Hit(int call) {
  return ++g_calls[call] == g_fault.at && call == g_fault.call;
}
// Faulty takes the |result| of a real call: a faulty one reports |length| as
// output and returns |code|, or with code 0 the result.
std::uint32_t Faulty(int call, std::uint32_t* outLength, std::uint32_t result) {
  g_dumpable |= prctl(PR_GET_DUMPABLE);
  if (!Hit(call)) {
    return result;
  }
  *outLength = g_fault.length;
  return g_fault.code != 0 ? g_fault.code : result;
}
ProtectedKey g_dmsetup;  // the disk-mapper tool's expected digest

}  // namespace

extern "C" {
CryptoContainer __real_VKT_DTC_CreateCryptoContainer(void);
uint32_t __real_VKT_DTC_DestroyCryptoContainer(CryptoContainer);
uint32_t __real_VKT_DTC_GetHash(CryptoContainer, uint32_t, const ProtectedKey*, uint32_t,
                                ProtectedKey*, uint32_t*);
uint32_t __real_VKT_DTC_AES_Process(CryptoContainer, const ProtectedKey*, uint32_t, ProtectedKey*,
                                    uint32_t*);
CryptoContainer __wrap_VKT_DTC_CreateCryptoContainer(void) {
  const bool fails = Hit(kCreate);
  g_live += fails ? 0 : 1;
  return fails ? nullptr : __real_VKT_DTC_CreateCryptoContainer();
}
uint32_t __wrap_VKT_DTC_DestroyCryptoContainer(CryptoContainer c) {
  --g_live;
  return __real_VKT_DTC_DestroyCryptoContainer(c);
}
uint32_t __wrap_VKT_DTC_GetHash(CryptoContainer c, uint32_t s, const ProtectedKey* in, uint32_t n,
                                ProtectedKey* out, uint32_t* outLength) {
  return Faulty(kHash, outLength, __real_VKT_DTC_GetHash(c, s, in, n, out, outLength));
}
uint32_t __wrap_VKT_DTC_AES_Process(CryptoContainer c, const ProtectedKey* in, uint32_t n,
                                    ProtectedKey* out, uint32_t* outLength) {
  return Faulty(kAesProcess, outLength, __real_VKT_DTC_AES_Process(c, in, n, out, outLength));
}
uint32_t __real_VKT_DTC_GetConstant(uint32_t, ProtectedKey**, uint32_t*);
uint32_t __wrap_VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* n) {
  const uint32_t rc = __real_VKT_DTC_GetConstant(index, ref, n);
  *ref = index == DTC_CONST_DMSETUP_DIGEST ? &g_dmsetup : *ref;
  return rc;
}
}  // extern "C"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;
using namespace eeprom;
auto& g_image = Eeprom().image;
const std::string kLine(68, '=');
const std::string kFail = "SFE_003 - [4]\nDT=FAIL\nNormal Boot Error!!\n";
const std::string kRegenerated =
    "Seed Key is created!!\nSecret Key is created!!\nSC Digest is created!!\n"
    "Successed to generate one_off_key by TPM.\nSuccessed to generate user_name_hex.\n"
    "Successed to generate user_pass_hex.\nSuccessed to create OOK.\n"
    "Successed to encrypt Stored-OOK.\nSuccessed to open keymgr.hddkeyid\n"
    "Successed to open keymgr.hddpwd\nSuccessed to open keymgr.ook\nST Key is encrypted!!\n";

void Reset() {
  ResetSandbox();
  Eeprom().Reset();
  g_image[kSfeConfOffset] = kSfe003Mask;  // SFE_003 on: DT lines reach the log
  KeyManager().Reset();
  g_fault = {};
  g_calls = {};
  prctl(PR_SET_DUMPABLE, 1);
  g_dumpable = 0;
}

// Call runs KeyManage, keeps its result in g_context and returns what it
// printed, with the asctime text of the banners checked and replaced by "T".
KeyContext* g_context = nullptr;
std::string Call(int option, int logFlag = 1) {
  static const std::regex kTime(R"( (Start|End) KMM : \w{3} \w{3} [ \d]\d \d\d:\d\d:\d\d \d{4}\n)");
  return std::regex_replace(Output([&] { g_context = KeyManage(option, logFlag); }), kTime,
                            " $1 KMM : T\n");
}

std::string Text(const char* path) {
  return ReadFile(path).value_or("-");
}
std::string Region(std::uint32_t offset, std::uint32_t length) {
  return {&g_image[offset], &g_image[offset + length]};
}
// State sums up what a regeneration left: store key and EEPROM digest (set
// or -), the sizes of keymgr.cs and the three key files, and the TPM keys.
std::string State() {
  std::string s;
  for (auto [offset, length] :
       {std::pair{kStoreKeyOffset, kStoreKeyLength}, {kScDigestOffset, kScDigestLength}}) {
    s += Region(offset, length) == std::string(length, '\xFF') ? "- " : "set ";
  }
  for (const char* path : {kScDigestPath, kKeyIdPath, kKeyPwdPath, kStoredOokPath}) {
    std::error_code error;
    const auto size = fs::file_size(path, error);
    s += error ? "- " : std::to_string(size) + " ";
  }
  return s + std::to_string(KeyManager().keys.size());
}

// A regeneration replaces the temporary names that a killed one left. A core
// taken once the flows hold key material, or as the program exits, would
// carry it: the kernel is told to write none before the first crypto call.
TEST(KmmFlow, RegenerationIsProvedAtBoot) {
  Reset();
  for (const char* name : {"/.keymgr.cs.new", "/.keymgr.hddpwd.new", "/.keymgr.ook.new"}) {
    WriteFile(fs::path(kKeyIdPath).parent_path().string() + name, "left by a killed run");
  }
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
  EXPECT_EQ(State(), "set set 32 20 20 284 1");
  EXPECT_EQ(KeyManager().keys[KeyAuth(Text(kKeyIdPath))], KeyAuth(Text(kKeyPwdPath)));
  EXPECT_EQ(Text(kScDigestPath), Region(kScDigestOffset, kScDigestLength));
  EXPECT_EQ(Eeprom().lastSection, (std::array{kSectionStart, kSectionLength}));
  const std::string ook = Text(kStoredOokPath).substr(0, 32);  // the fake seals in the clear
  EXPECT_EQ(Call(KMM_OPTION_NORMAL_BOOT, 0),
            kLine + "\n Start KMM : T\n" + kLine + "\n\nSuccessed to open keymgr.ook\n" +
                "Successed to decrypt OOK.\none_off_key: print_array: size[32] " + Hex(ook) +
                " \nST Key is decrypted!!\nSC Digest is created!!\n"
                "SC Digest Test Success [EEPROM]!!\nSC Digest Test Success [HDD]!!\n\n" +
                kLine + "\n End KMM : T\n" + kLine + "\n\n\n\n");
  EXPECT_EQ(Text(kBootLogPath), "-");
  EXPECT_EQ(g_dumpable, 0);
  EXPECT_EQ(prctl(PR_GET_DUMPABLE), 0);
  // Another option is rejected, and the context is zeroed all the same.
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(g_context);
  EXPECT_EQ(Call(2), "Key manage option invalid(2)!!\n");
  EXPECT_EQ(g_context, nullptr);
  EXPECT_TRUE(std::all_of(bytes, bytes + sizeof(KeyContext), [](auto b) { return b == 0; }));
}

// A fault at each step: regenerations start from nothing, boots from a
// regeneration. Each is reported with its lines, every failure ends with an
// error line, and what was stored stays (see State). No container is left.
const std::string kSecret = "Generate Secret Key Error!!!\nRegenerate Key Error!!\n";
const std::string kDigest = "Generate Message Digest Error!!!\nRegenerate Key Error!!\n";
const std::string kStore = "Generate Store Key Error!!!\nRegenerate Key Error!!\n";
const std::string kUnseal = "Decrypt Store Key Error!!\n" + kFail;
const std::string kRead =
    "Read Error [-5] - Store Key from EEPROM !!!\nRead Store Key error [Retry:";
const std::string kValues = "Read Store Key but values are error [Retry:";
std::string Retries(const std::string& line) {
  return line + "2]!!!\n" + line + "1]!!!\n" + line + "0]!!!\n";
}
constexpr std::uint32_t kLast = kStoreKeyOffset + kStoreKeyLength - 1;  // its last byte
// What a regeneration leaves: nothing, the digest, or also the key files. A
// key whose identity never reached the disk is evicted again.
const std::string kNone = "- - - - - - 0", kDigestOnly = "- set 32 - - - 0";
const std::string kFiles = "- set 32 20 20 284 1";

struct Row {
  const char* name;
  int option;
  void (*arm)();
  std::string out;    // part of stdout
  std::string after;  // State() after a regeneration, the boot status log after a boot
};
class Faults : public testing::TestWithParam<Row> {};
TEST_P(Faults, AreReportedAndLeaveWhatWasStored) {
  const Row& row = GetParam();
  ASSERT_GE(KmmSeedRandom(), 0);  // as a host does, so no draw of the row goes to seeding
  Reset();
  if (row.option == KMM_OPTION_NORMAL_BOOT) {
    ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
    g_calls = {};
  }
  row.arm();
  const std::string out = Call(row.option, row.after != "-");  // a boot expecting no log: logFlag 0
  EXPECT_NE(out.find(row.out), std::string::npos) << out;
  EXPECT_EQ(g_context == nullptr, out.ends_with("Error!!\n"));  // every failure ends so
  EXPECT_EQ(row.option == KMM_OPTION_REGENERATE ? State() : Text(kBootLogPath), row.after);
  EXPECT_EQ(g_live, 0);
}
const Row kRows[] = {
    // clang-format off
    {"no container for the secret key", 3, [] { g_fault = {kCreate, 1, 0}; }, "Failed. nRes=0x00000000\n" + kSecret, kNone},
    {"secret key hash fails", 3, [] { g_fault = {kHash, 1, 0xD7C00007}; }, "GetHash Failed. nRes=0xd7c00007\n" + kSecret, kNone},
    {"secret key hash of 33 bytes", 3, [] { g_fault = {kHash, 1, 0, 33}; }, "GetHash Failed. nRes=0x00000000\n" + kSecret, kNone},
    {"no container for the digest", 3, [] { g_fault = {kCreate, 2, 0}; }, "Failed. nRes=0x00000000\n" + kDigest, kNone},
    {"digest not written to EEPROM", 3, [] { Eeprom().fault = {kScDigestOffset, kScDigestOffset + kScDigestLength, 1}; }, "Write error - Message Digest to EEPROM !!!\n" + kDigest, kNone},
    // A draw that fails stops the regeneration: nothing is sealed under the
    // built-in initial one-off key, a previous identity or zeros.
    {"one-off key not drawn", 3, [] { KeyManager().fail[kRandom] = 1; }, "Failed to generate one_off_key by TPM.\n" + kStore, kDigestOnly},
    {"password not drawn", 3, [] { KeyManager().fail[kRandom] = 0b100; }, "name_hex.\nFailed to generate user_pass_hex.\n" + kStore, kDigestOnly},
    {"TPM key not created", 3, [] { KeyManager().fail[kCreateKey] = 1; }, "pass_hex.\nFailed to create OOK.\n" + kStore, kDigestOnly},
    {"one-off key not sealed", 3, [] { KeyManager().fail[kEncrypt] = 1; }, "OOK.\nFailed to encrypt Stored-OOK.\n" + kStore, kDigestOnly},
    {"identity file not replaced", 3, [] { fs::create_directory(kKeyIdPath); }, "Stored-OOK.\nFailed to open keymgr.hddkeyid\n" + kStore, "- set 32 - - - 0"},
    {"password file not replaced", 3, [] { fs::create_directory(kKeyPwdPath); }, "keymgr.hddkeyid\nFailed to open keymgr.hddpwd\n" + kStore, "- set 32 20 - - 1"},
    {"no container for sealing", 3, [] { g_fault = {kCreate, 3, 0}; }, "ook\nVKT_DTC_CreateCryptoContainer Failed.\n" + kStore, kFiles},
    {"sealing gives 32 bytes", 3, [] { g_fault = {kAesProcess, 1, 0, 32}; }, "ook\nDTC_AES Failed.\n" + kStore, kFiles},
    {"store key not written", 3, [] { Eeprom().fault = {kLast, kLast + 1, 1}; }, "Store Key to EEPROM !!!\nWrite Store Key Error!!!\n", kFiles},
    {"store key read once in vain", 1, [] { Eeprom().fault = {kLast, kLast + 1, 1}; }, kRead + "2]!!!\nSuccessed to open keymgr.ook\n", "DT=OK\n"},
    {"store key never read", 1, [] { Eeprom().fault = {kStoreKeyOffset, kStoreKeyOffset + 1, 3}; }, Retries(kRead) + kFail, "DT=FAIL\n"},
    {"store key blank", 1, [] { std::fill_n(&g_image[kStoreKeyOffset], 2, 0); }, Retries(kValues) + "Normal Boot", "-"},
    {"one-off key not unsealed", 1, [] { KeyManager().fail[kDecrypt] = 1; }, "Failed to decrypt OOK.\n", "DT=FAIL\n"},
    {"digest in EEPROM altered", 1, [] { g_image[kScDigestOffset + 5] ^= 1; }, "SC Digest Test Fail [EEPROM]!!\n" + kFail, "DT=FAIL\n"},
    {"digest copy altered", 1, [] { WriteFile(kScDigestPath, std::string(32, 'x')); }, "Success [EEPROM]!!\nSC Digest Test Fail [HDD]!!\n" + kFail, "DT=FAIL\n"},
    {"store key altered", 1, [] { g_image[kStoreKeyOffset + 20] ^= 1; }, "ST Key is decrypted!!\nSC Digest is created!!\nSC Digest Test Fail", "DT=FAIL\n"},
    {"no container for unsealing", 1, [] { g_fault = {kCreate, 1, 0}; }, "VKT_DTC_CreateCryptoContainer Failed.\n" + kUnseal, "DT=FAIL\n"},
    {"unsealing gives 47 bytes", 1, [] { g_fault = {kAesProcess, 1, 0, 47}; }, "DTC_AES Failed.\n" + kUnseal, "DT=FAIL\n"},
    // clang-format on
};
INSTANTIATE_TEST_SUITE_P(Rows, Faults, testing::ValuesIn(kRows), RowName());

// Weak tells whether random() gave the eight words of the seed key in
// |context| (after its date and time) seeded a weak way: not at all, with a
// clock within half a day, or with one of the first 131072 process ids.
bool Weak(const KeyContext* context) {
  std::array<std::int32_t, 8> words{};
  for (std::uint32_t i = 0; i < 32; ++i) {
    reinterpret_cast<std::uint8_t*>(words.data())[i] =
        ProtectedKey_ByteAt(&context->seedKeyPK, 12 + i);
  }
  const auto seededWith = [&](unsigned seed) {
    std::array<char, 128> state{};  // the default size, as a process starts
    random_data data{};
    initstate_r(seed, state.data(), state.size(), &data);
    return std::all_of(words.begin(), words.end(), [&](std::int32_t word) {
      std::int32_t next = 0;
      return random_r(&data, &next) == 0 && next == word;
    });
  };
  const auto dayAgo = static_cast<unsigned>(std::time(nullptr)) - 43200;
  for (unsigned seed = 0; seed <= (1u << 17); ++seed) {  // seed 0 is seed 1, as unseeded
    if (seededWith(seed) || (seed <= 86400 && seededWith(dayAgo + seed))) {
      return true;
    }
  }
  return false;
}

// A host that never seeds, one that seeds through the TPM and one that
// seeds through the kernel (the TPM's draw failing) each get a key that is
// unguessable and unlike the others, within one second. The search does find
// keys from random() seeded the weak ways after the host's seeding, so it
// proves something when it fails.
TEST(KmmFlow, SeedKeyIsUnguessableWhetherOrNotTheHostSeeds) {
  srandom(1);  // a host's own weak seeding, without KmmSeedRandom
  std::set<std::string> digests;
  for (const int seeding : {-1, KMM_ENTROPY_TPM, KMM_ENTROPY_GETRANDOM}) {
    Reset();
    KeyManager().fail[kRandom] = seeding == KMM_ENTROPY_GETRANDOM;
    EXPECT_TRUE(seeding < 0 || KmmSeedRandom() == seeding) << seeding;
    ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
    digests.insert(Text(kScDigestPath));
    EXPECT_FALSE(Weak(g_context)) << seeding;
    // random() still yields 31 bits: the top bit of each word's last byte is 0.
    for (std::uint32_t at = 15; at < kmm::kSeedKeySize; at += 4) {
      EXPECT_EQ(ProtectedKey_ByteAt(&g_context->seedKeyPK, at) & 0x80, 0) << at;
    }
  }
  EXPECT_EQ(digests.size(), 3u);
  static std::array<char, 128> fresh;  // a generator as a process starts with
  for (unsigned int weak : {1u, static_cast<unsigned int>(std::time(nullptr)), 4321u}) {
    Reset();
    ASSERT_GE(KmmSeedRandom(), 0);
    initstate(weak, fresh.data(), fresh.size());  // what a host does after it is its own
    ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
    EXPECT_TRUE(Weak(g_context)) << weak;
  }
}

// The disk-mapper tool check fails, quietly, when only the last byte of the
// tool's digest differs from the expected one. (A tool that matches, and one
// that cannot be opened, are the hostile files' end-to-end rows.)
TEST(KmmFlow, DmsetupDigestFailsQuietlyOnItsLastByte) {
  static std::string tool = *ReadFile(KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/dmsetup"),
                     expected = Sha256(tool);
  WriteFile(kDmsetupPath, tool);
  expected[31] ^= 1;
  ASSERT_EQ(ProtectedKey_Attach(&g_dmsetup, 0, reinterpret_cast<std::uint8_t*>(expected.data())),
            0u);
  ASSERT_EQ(ProtectedKey_SetLength(&g_dmsetup, 32), 0u);
  EXPECT_EQ(Output([] { EXPECT_EQ(CheckDmsetupDigest(), -1); }), "");
}

}  // namespace
}  // namespace keymgr::test
