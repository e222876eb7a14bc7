// The module's flows over the fake EEPROM and TPM, with the real crypto
// services behind fault-injecting wrappers.
#include <gtest/gtest.h>
#include <kmm/kmm.h>
#include <openssl/sha.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <functional>
#include <numeric>
#include <regex>
#include <tuple>

#include "crypto_faults.h"
#include "fake_platform.h"
#include "kmm/internal.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<std::uint8_t>;
using fake::EepromOp;
using fake::PcpOp;

const std::string kLine(68, '=');
const std::string kStart = kLine + "\n Start KMM : T\n" + kLine + "\n\n";
const std::string kEnd = "\n" + kLine + "\n End KMM : T\n" + kLine + "\n\n\n\n";
const std::string kFailTail = "SFE_003 - [4]\nDT=FAIL\nNormal Boot Error!!\n";
const std::string kRegenerated =
    "Seed Key is created!!\nSecret Key is created!!\nSC Digest is created!!\n"
    "Successed to generate one_off_key by TPM.\nSuccessed to generate user_name_hex.\n"
    "Successed to generate user_pass_hex.\nSuccessed to create OOK.\n"
    "Successed to encrypt Stored-OOK.\nSuccessed to open keymgr.hddkeyid\n"
    "Successed to open keymgr.hddpwd\nSuccessed to open keymgr.ook\nST Key is encrypted!!\n";

std::string Output(const std::function<void()>& fn) {
  testing::internal::CaptureStdout();
  fn();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

// Banners carry the asctime text; it must have asctime's shape and is then
// replaced by "T" so that whole outputs can be compared.
std::string Normalized(const std::string& out) {
  static const std::regex kTime(R"( (Start|End) KMM : \w{3} \w{3} [ \d]\d \d\d:\d\d:\d\d \d{4}\n)");
  return std::regex_replace(out, kTime, " $1 KMM : T\n");
}

Bytes KeyBytes(const ProtectedKey* key, std::uint32_t n) {
  Bytes out(n);
  for (std::uint32_t i = 0; i < n; ++i) {
    out[i] = ProtectedKey_ByteAt(key, i);
  }
  return out;
}

Bytes Sha256(const Bytes& in) {
  Bytes out(SHA256_DIGEST_LENGTH);
  SHA256(in.data(), in.size(), out.data());
  return out;
}

std::string File(const char* path) {
  return ReadFile(path).value_or("<missing>");
}

std::string OokLine(const Bytes& ook) {
  return "one_off_key: print_array: size[32] " +
         Hex({reinterpret_cast<const char*>(ook.data()), ook.size()}) + " \n";
}

class KmmTest : public testing::Test {
 protected:
  void SetUp() override { Reset(); }
  static void Reset() {
    ResetSandbox();
    fake::ResetEeprom();
    fake::ResetPcp();
    Crypto() = {};
    fake::EepromImage()[kSfeConfOffset] = 0x04;  // SFE_003 on: DT lines reach the log
    std::fill_n(fake::EepromImage().begin() + kSfeConfOffset + 1, 3, 0);
  }
  // Call runs KeyManage with its output captured; |result| gets its result.
  static std::string Call(int option, int logFlag = 1, KeyContext** result = nullptr) {
    KeyContext* context = nullptr;
    std::string out = Output([&] { context = KeyManage(option, logFlag); });
    if (result != nullptr) {
      *result = context;
    }
    return Normalized(out);
  }
  static std::string Log() { return File(kBootLogPath); }
};

TEST_F(KmmTest, StorageUsesItsRegionsAndReportsFaults) {
  Bytes key(48);
  std::iota(key.begin(), key.end(), 1);
  EXPECT_EQ(Output([&] { EXPECT_EQ(WriteStoreKey(7, key.data()), 0); }), "");
  const fake::EepromCall& w = fake::EepromCalls().back();
  EXPECT_EQ(std::make_tuple(w.offset, w.length, w.sectionStart, w.sectionLength),
            std::make_tuple(4244u, 48u, 3072u, 2048u));
  EXPECT_EQ(fake::EepromBytes(4244, 48), key);

  Bytes dst(48, 0xAB), digest(32, 0xCD);
  std::uint32_t length = 99;
  fake::InjectEepromError(EepromOp::kRead, 4291, 4292, 1);  // touches the last byte only
  fake::InjectEepromError(EepromOp::kWrite, 4244, 4245, 1, -7);
  fake::InjectEepromError(EepromOp::kRead, 32256, 32288, 1);
  std::string out = Output([&] {
    EXPECT_EQ(ReadStoreKey(&length, dst.data()), 1);
    EXPECT_EQ(ReadStoreKey(&length, nullptr), 1);
    EXPECT_EQ(WriteStoreKey(48, key.data()), 1);
    EXPECT_EQ(WriteStoreKey(48, nullptr), 1);
    EXPECT_EQ(ReadDigestEEPROM(digest.data()), 1);
    EXPECT_EQ(ReadDigestHDD(digest.data()), 1);
  });
  EXPECT_EQ(out, std::string("Read Error [-5] - Store Key from EEPROM !!!\n"
                             "Read Error [NULL] - Store Key from EEPROM !!!\n"
                             "Write Error [-7] - Store Key to EEPROM !!!\n"
                             "Write Error [NULL] - Store Key to EEPROM !!!\n"
                             "Read Error - Message Digest from EEPROM !!!\n") +
                     kScDigestPath + " open error!!!\n");
  EXPECT_EQ(length, 99u);
  EXPECT_EQ(dst, Bytes(48, 0xAB));
}

TEST_F(KmmTest, RegenerationStoresKeyMaterialThatNormalBootProves) {
  KeyContext* context = nullptr;
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE, 1, &context), kRegenerated);
  ASSERT_NE(context, nullptr);
  EXPECT_EQ(Log(), "<missing>");  // regeneration writes no boot status

  // seed (date text, time, random words) -> secret -> SC digest, all stored.
  Bytes seed = KeyBytes(&context->seedKeyPK, 44);
  char today[16];
  std::time_t now = std::time(nullptr);
  std::strftime(today, sizeof(today), "%Y%m%d", std::localtime(&now));
  EXPECT_EQ(std::string(seed.begin(), seed.begin() + 8), today);
  for (int k = 0; k < 8; ++k) {
    EXPECT_EQ(seed[12 + 4 * k + 3] & 0x80, 0) << "random() words are stored native-endian";
  }
  Bytes secret = KeyBytes(&context->secretKeyPK, 32);
  EXPECT_EQ(context->secretKeyLength, 32u);
  EXPECT_EQ(secret, Sha256(seed));
  Bytes digest = Sha256(secret);
  EXPECT_EQ(fake::EepromBytes(32256, 32), digest);
  EXPECT_EQ(File(kScDigestPath), std::string(digest.begin(), digest.end()));
  EXPECT_EQ(fake::EepromBytes(4244, 48), KeyBytes(&context->storeKeyPK, 48));
  EXPECT_EQ(File(kKeyIdPath).size(), 20u);
  EXPECT_EQ(File(kKeyPwdPath).size(), 20u);
  EXPECT_EQ(File(kStoredOokPath).size(), 284u);
  Bytes ook = KeyBytes(context->oneOffKeyRef, 32);
  EXPECT_EQ(fake::PcpCalls().back().data, ook);  // the key the fragment seals
  EXPECT_EQ(fake::PcpKeyCount(), 1u);

  KeyContext* booted = nullptr;
  EXPECT_EQ(Call(KMM_OPTION_NORMAL_BOOT, 1, &booted),
            kStart + "Successed to open keymgr.ook\nSuccessed to decrypt OOK.\n" + OokLine(ook) +
                "ST Key is decrypted!!\nSC Digest is created!!\n"
                "SC Digest Test Success [EEPROM]!!\nSC Digest Test Success [HDD]!!\n"
                "SFE_003 - [4]\nDT=OK\n" +
                kEnd);
  EXPECT_EQ(booted, context);
  EXPECT_EQ(fake::PcpCalls().back().length, 268u);  // the fragment, not the whole file
  EXPECT_EQ(context->secretKeyLength, 48u);
  EXPECT_EQ(KeyBytes(&context->secretKeyPK, 48), [&] {
    secret.resize(48);  // the 16 bytes sealed after the secret key are zero
    return secret;
  }());
  EXPECT_EQ(Log(), "DT=OK\n");

  // The next generation evicts the previous TPM key first.
  std::string again = Call(KMM_OPTION_REGENERATE, 0);
  EXPECT_EQ(again.find("SC Digest is created!!\nSuccessed to delete ID/PWD in TPM.\n"
                       "Successed to generate one_off_key"),
            again.find("SC Digest is created!!\n"));
  EXPECT_EQ(fake::PcpKeyCount(), 1u);
}

TEST_F(KmmTest, StoreKeyReadHasThreeAttempts) {
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
  const auto image = fake::EepromImage();
  auto blank = [](std::uint8_t b0, std::uint8_t b1) {
    return [=] {
      fake::EepromImage()[4244] = b0;
      fake::EepromImage()[4245] = b1;
    };
  };
  auto failReads = [](int n) {
    return [=] { fake::InjectEepromError(EepromOp::kRead, 4244, 4292, n); };
  };
  const std::string kValues = "Read Store Key but values are error [Retry:";
  const std::string kReadError =
      "Read Error [-5] - Store Key from EEPROM !!!\nRead Store Key error [Retry:";
  struct Case {
    std::function<void()> arm;
    int logFlag;
    std::string expect;  // the whole output, or a part of it when |whole| is false
    bool whole;
    const char* log;
  } cases[] = {
      {failReads(1), 1, kStart + kReadError + "2]!!!\nSuccessed to open", false, "DT=OK\n"},
      {failReads(3), 1,
       kStart + kReadError + "2]!!!\n" + kReadError + "1]!!!\n" + kReadError + "0]!!!\n" +
           kFailTail,
       true, "DT=FAIL\n"},
      {blank(0xFF, 0xFF), 1,
       kStart + kValues + "2]!!!\n" + kValues + "1]!!!\n" + kValues + "0]!!!\n" + kFailTail, true,
       "DT=FAIL\n"},
      {blank(0x00, 0x00), 0,
       kStart + kValues + "2]!!!\n" + kValues + "1]!!!\n" + kValues +
           "0]!!!\nNormal Boot Error!!\n",
       true, "<missing>"},
      // Only equal pairs are blank; this one reaches the digest check.
      {blank(0x00, 0xFF), 1, "SC Digest Test Fail [EEPROM]!!\n" + kFailTail, false, "DT=FAIL\n"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.expect);
    fake::EepromImage() = image;
    fs::remove(kBootLogPath);
    c.arm();
    std::string out = Call(KMM_OPTION_NORMAL_BOOT, c.logFlag);
    if (c.whole) {
      EXPECT_EQ(out, c.expect);
    } else {
      EXPECT_NE(out.find(c.expect), std::string::npos) << out;
    }
    EXPECT_EQ(Log(), c.log);
  }
}

TEST_F(KmmTest, FailedOokDrawSealsUnderTheFixedKey) {
  fake::FailPcp(PcpOp::kGetRandom);
  std::string out = Call(KMM_OPTION_REGENERATE);
  EXPECT_NE(out.find("SC Digest is created!!\nFailed to generate one_off_key by TPM.\n"
                     "Successed to generate user_name_hex.\n"),
            std::string::npos);
  EXPECT_EQ(out.substr(out.size() - 22), "ST Key is encrypted!!\n");
  Bytes fixed(kmm::kInitialOneOffKey.begin(), kmm::kInitialOneOffKey.end());
  EXPECT_EQ(fake::PcpCalls().back().data, fixed);
  EXPECT_NE(Call(KMM_OPTION_NORMAL_BOOT).find(OokLine(fixed)), std::string::npos);
  EXPECT_EQ(Log(), "DT=OK\n");
}

TEST_F(KmmTest, SealingFailuresLeaveTheOldGenerationWithoutRollback) {
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
  const std::string id1 = File(kKeyIdPath), pwd1 = File(kKeyPwdPath), ook1 = File(kStoredOokPath);
  const Bytes store1 = fake::EepromBytes(4244, 48), digest1 = fake::EepromBytes(32256, 32);
  auto expectFiles = [&] {
    EXPECT_EQ(File(kKeyIdPath), id1);
    EXPECT_EQ(File(kKeyPwdPath), pwd1);
    EXPECT_EQ(File(kStoredOokPath), ook1);
  };

  // The old key is evicted before the new one fails to appear; the new
  // digest is already stored next to the old store key.
  fake::FailPcp(PcpOp::kCreateKey);
  KeyContext* context = nullptr;
  std::string out = Call(KMM_OPTION_REGENERATE, 1, &context);
  EXPECT_EQ(context, nullptr);
  EXPECT_NE(out.find("Successed to delete ID/PWD in TPM.\n"), std::string::npos);
  EXPECT_EQ(out.substr(out.find("Failed")),
            "Failed to create OOK.\nGenerate Store Key Error!!!\nRegenerate Key Error!!\n");
  EXPECT_EQ(fake::PcpKeyCount(), 0u);
  expectFiles();
  EXPECT_EQ(fake::EepromBytes(4244, 48), store1);
  Bytes digest2 = fake::EepromBytes(32256, 32);
  EXPECT_NE(digest2, digest1);
  EXPECT_EQ(File(kScDigestPath), std::string(digest2.begin(), digest2.end()));
  // Until a regeneration succeeds, boots fail.
  out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_NE(out.find("Failed to decrypt OOK.\n"), std::string::npos);
  EXPECT_NE(out.find("SC Digest Test Fail [EEPROM]!!\n" + kFailTail), std::string::npos);

  fake::FailPcp(PcpOp::kEncrypt);
  out = Call(KMM_OPTION_REGENERATE);
  EXPECT_NE(out.find("Failed to delete ID/PWD in TPM.\n"), std::string::npos);  // already gone
  EXPECT_EQ(out.substr(out.find("Successed to create OOK.")),
            "Successed to create OOK.\nFailed to encrypt Stored-OOK.\n"
            "Generate Store Key Error!!!\nRegenerate Key Error!!\n");
  EXPECT_EQ(fake::PcpKeyCount(), 1u);  // the new key stays
  expectFiles();

  // A password file that cannot be written splits the generation on disk.
  fs::remove(kKeyPwdPath);
  fs::create_directory(kKeyPwdPath);
  out = Call(KMM_OPTION_REGENERATE);
  EXPECT_EQ(out.substr(out.find("Successed to open")),
            "Successed to open keymgr.hddkeyid\nFailed to open keymgr.hddpwd\n"
            "Generate Store Key Error!!!\nRegenerate Key Error!!\n");
  EXPECT_NE(File(kKeyIdPath), id1);
  EXPECT_EQ(File(kKeyIdPath).size(), 20u);
  EXPECT_EQ(File(kStoredOokPath), ook1);
}

TEST_F(KmmTest, CryptoFaultsAreReportedAndEveryContainerIsReleased) {
  const std::string kRegen = "Regenerate Key Error!!\n";
  const std::string kSecret = "Generate Secret Key Error!!!\n" + kRegen;
  const std::string kDigest = "Generate Message Digest Error!!!\n" + kRegen;
  const std::string kStore = "Generate Store Key Error!!!\n" + kRegen;
  const std::string kDecrypt = "Decrypt Store Key Error!!\n" + kFailTail;
  const std::string kBootDigest = "Generate Message Digest Error!!\n" + kFailTail;
  const std::string kNoContainer = "VKT_DTC_CreateCryptoContainer Failed. nRes=0x00000000\n";
  const std::string kNoHash = "VKT_DTC_GetHash Failed. nRes=0x";
  struct Case {
    int option;
    CryptoCall call;
    CryptoFault fault;
    std::string tail;
    bool digestStored = false;
    bool filesWritten = false;
  } cases[] = {
      {3, CryptoCall::kCreate, {1}, kNoContainer + kSecret, false, false},
      {3, CryptoCall::kHash, {1, 0xD7C00007u}, kNoHash + "d7c00007\n" + kSecret, false, false},
      {3, CryptoCall::kHash, {1, 0, 33}, kNoHash + "00000000\n" + kSecret, false, false},
      {3, CryptoCall::kCreate, {2}, kNoContainer + kDigest, false, false},
      {3, CryptoCall::kHash, {2, 0, 31}, kNoHash + "00000000\n" + kDigest, false, false},
      {3, CryptoCall::kCreate, {3}, "VKT_DTC_CreateCryptoContainer Failed.\n" + kStore, true, true},
      {3,
       CryptoCall::kAesInit,
       {1, 0xD7C00005u},
       "VKT_DTC_AES_Init Failed.\n" + kStore,
       true,
       true},
      {3, CryptoCall::kAesProcess, {1, 0, 32}, "DTC_AES Failed.\n" + kStore, true, true},
      {1, CryptoCall::kCreate, {1}, "VKT_DTC_CreateCryptoContainer Failed.\n" + kDecrypt},
      {1, CryptoCall::kAesProcess, {1, 0xD7C00003u}, "VKT_DTC_AES_Process Failed.\n" + kDecrypt},
      {1, CryptoCall::kAesProcess, {1, 0, 47}, "DTC_AES Failed.\n" + kDecrypt},
      {1, CryptoCall::kCreate, {2}, kNoContainer + kBootDigest},
      {1, CryptoCall::kHash, {1, 0xD7C00001u}, kNoHash + "d7c00001\n" + kBootDigest},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.tail);
    Reset();
    if (c.option == KMM_OPTION_NORMAL_BOOT) {
      ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
      Crypto() = {};
    }
    Crypto().faults[static_cast<int>(c.call)] = c.fault;
    KeyContext* context = nullptr;
    std::string out = Call(c.option, 1, &context);
    EXPECT_EQ(context, nullptr);
    ASSERT_GE(out.size(), c.tail.size());
    EXPECT_EQ(out.substr(out.size() - c.tail.size()), c.tail);
    EXPECT_EQ(Crypto().created, Crypto().destroyed);
    if (c.option == KMM_OPTION_REGENERATE) {
      EXPECT_EQ(fake::EepromBytes(4244, 48), Bytes(48, 0xFF));
      EXPECT_EQ(fake::EepromBytes(32256, 32) != Bytes(32, 0xFF), c.digestStored);
      EXPECT_EQ(Exists(kScDigestPath), c.digestStored);
      EXPECT_EQ(Exists(kStoredOokPath), c.filesWritten);
    }
  }
}

TEST_F(KmmTest, DigestCopiesAreWrittenAndProvedInOrder) {
  // A failed EEPROM write stops before the disk copy.
  fake::InjectEepromError(EepromOp::kWrite, 32256, 32288, 1);
  std::string out = Call(KMM_OPTION_REGENERATE);
  EXPECT_EQ(out.substr(out.find("Secret Key is created!!\n") + 24),
            "Write error - Message Digest to EEPROM !!!\nGenerate Message Digest Error!!!\n"
            "Regenerate Key Error!!\n");
  EXPECT_FALSE(Exists(kScDigestPath));
  EXPECT_EQ(Crypto().created, Crypto().destroyed);

  // A disk copy that cannot be written does not stop the regeneration; the
  // boot then finds the EEPROM copy good and the disk copy wrong.
  fs::create_directory(kScDigestPath);
  KeyContext* context = nullptr;
  out = Call(KMM_OPTION_REGENERATE, 1, &context);
  EXPECT_NE(context, nullptr);
  EXPECT_NE(out.find(std::string(kScDigestPath) + " open error!!!\nSC Digest is created!!\n"),
            std::string::npos);
  EXPECT_NE(fake::EepromBytes(32256, 32), Bytes(32, 0xFF));
  out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_NE(
      out.find("SC Digest Test Success [EEPROM]!!\nSC Digest Test Fail [HDD]!!\n" + kFailTail),
      std::string::npos);

  fs::remove(kScDigestPath);
  out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_NE(out.find("SC Digest Test Success [EEPROM]!!\n" + std::string(kScDigestPath) +
                     " open error!!!\nGet Message Digest Error from HDD!!\n" + kFailTail),
            std::string::npos);
  fake::InjectEepromError(EepromOp::kRead, 32256, 32288, 1);
  out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_NE(out.find("SC Digest is created!!\nRead Error - Message Digest from EEPROM !!!\n"
                     "Get Message Digest Error [EEPROM]!!\n" +
                     kFailTail),
            std::string::npos);
}

TEST_F(KmmTest, KeyFilesAreNeededToUnseal) {
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE), kRegenerated);
  const std::string ook = File(kStoredOokPath), pwd = File(kKeyPwdPath);
  fs::remove(kStoredOokPath);
  EXPECT_EQ(Call(KMM_OPTION_NORMAL_BOOT),
            kStart + "Failed to open keymgr.ook\nDecrypt Store Key Error!!\n" + kFailTail);

  // Without the password file the TPM refuses the cleared password, and the
  // fixed initial key does not open the store key.
  WriteFile(kStoredOokPath, ook);
  fs::remove(kKeyPwdPath);
  Bytes fixed(kmm::kInitialOneOffKey.begin(), kmm::kInitialOneOffKey.end());
  std::string out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_NE(out.find("Successed to open keymgr.ook\nFailed to decrypt OOK.\n" + OokLine(fixed) +
                     "ST Key is decrypted!!\nSC Digest is created!!\n"
                     "SC Digest Test Fail [EEPROM]!!\n"),
            std::string::npos)
      << out;
  EXPECT_EQ(fake::PcpCalls().back().passHex, std::string(40, '0'));

  // Without the identity file the TPM is not asked at all.
  WriteFile(kKeyPwdPath, pwd);
  fs::remove(kKeyIdPath);
  std::size_t calls = fake::PcpCalls().size();
  out = Call(KMM_OPTION_NORMAL_BOOT);
  EXPECT_EQ(out.find("keymgr.ook"), std::string::npos);
  EXPECT_EQ(out.find("one_off_key"), std::string::npos);
  EXPECT_EQ(fake::PcpCalls().size(), calls);
}

TEST_F(KmmTest, EntryRejectsOtherOptionsWithAZeroedContext) {
  KeyContext* context = nullptr;
  ASSERT_EQ(Call(KMM_OPTION_REGENERATE, 0, &context), kRegenerated);
  for (int option : {2, 0, -7}) {
    KeyContext* result = context;
    EXPECT_EQ(Call(option, 1, &result),
              "Key manage option invalid(" + std::to_string(option) + ")!!\n");
    EXPECT_EQ(result, nullptr);
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(context);
    EXPECT_TRUE(std::all_of(bytes, bytes + sizeof(KeyContext), [](auto b) { return b == 0; }));
  }
  EXPECT_EQ(Log(), "<missing>");
}

}  // namespace
}  // namespace keymgr::test
