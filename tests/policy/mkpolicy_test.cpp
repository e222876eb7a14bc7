// keymgr-mkpolicy end to end: the same inputs give the same file, which
// decodes to what it printed, and it writes nothing when it refuses. The
// policy digests, names and signatures meet the TPM in the chain tests, where
// a sealed key opens only if each is right.
#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "policy/file.h"
#include "support/sandbox.h"
#include "util/hex.h"
#include "verdict/verdict.h"

namespace keymgr::policy {
namespace {

using test::ReadFile;

const std::string kTool = KEYMGR_TEST_MKPOLICY_BIN;
const std::string kData = KEYMGR_TEST_SOURCE_DIR "/tests/policy/data/";

// Argv runs keymgr-mkpolicy with good options, but |change|'s option set to
// its value (left out when that is empty), and |extra| after them.
std::vector<std::string> Argv(const std::string& output,
                              const std::pair<std::string, std::string>& change = {},
                              const std::vector<std::string>& extra = {}) {
  std::vector<std::string> argv = {kTool};
  for (auto [option, value] : std::initializer_list<std::pair<std::string, std::string>>{
           {"--key", kData + "vendor_key.pem"},
           {"--release", "9"},
           {"--verdict-pcr", "15"},
           {"--uki", kData + "uki.efi"},
           {"--pcr", "0=" + std::string(64, 'a')},
           {"--output", output}}) {
    value = option == change.first ? change.second : value;
    if (!value.empty()) {
      argv.insert(argv.end(), {option, value});
    }
  }
  argv.insert(argv.end(), extra.begin(), extra.end());
  return argv;
}

class Mkpolicy : public testing::Test {
 protected:
  void SetUp() override {
    test::ResetSandbox();
    std::filesystem::create_directories(dir_);
  }
  const std::string dir_ = test::InRoot("/policy/");
};

TEST_F(Mkpolicy, TheSameInputsGiveTheSameFileAsPrinted) {
  const std::vector<std::string> argv = Argv(dir_ + "policy");
  const test::RunResult first = test::Run(argv);
  ASSERT_EQ(first.status, 0) << first.err;
  const std::string bytes = *ReadFile(dir_ + "policy");
  EXPECT_EQ(std::filesystem::status(dir_ + "policy").permissions(), std::filesystem::perms(0644));
  EXPECT_EQ(test::Run(argv).out, first.out);
  EXPECT_EQ(ReadFile(dir_ + "policy"), bytes);

  // What it printed is what it signed.
  PolicyFile file;
  ASSERT_TRUE(
      DecodePolicyFile({reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()}, &file)
          .ok());
  EXPECT_EQ(file.release, 9u);
  EXPECT_EQ(file.pcrs, 1u << 0 | 1u << 4 | 1u << 12 | 1u << 15);
  // PCR 4 is the UKI's (the boot chain's test pins it); the policy digests
  // meet the TPM in the chain tests.
  const auto hex = [](const auto& digest) {
    return std::string(HexText(digest, HexCase::kLower).data());
  };
  EXPECT_EQ(first.out,
            "PCR 0 = " + std::string(64, 'a') +
                "\nPCR 4 = 513cc4705c822e55680dad553078a59468980f0226be7419add9237879701ec6"
                "\nPCR 12 = " +
                std::string(64, '0') + "\nPCR 15 = " + hex(verdict::GoodPcrValue()) +
                "\nkey policy = " + hex(file.keyPolicy) +
                "\ncounter policy = " + hex(file.counterPolicy) + "\n");
}

TEST_F(Mkpolicy, RefusalsWriteNothing) {
  const std::string smallKey = dir_ + "small.pem", exponent3 = dir_ + "e3.pem";
  for (const auto& [key, options] :
       {std::pair{smallKey, "rsa_keygen_bits:1024"}, {exponent3, "rsa_keygen_pubexp:3"}}) {
    ASSERT_EQ(
        test::Run({"openssl", "genpkey", "-algorithm", "RSA", "-pkeyopt", options, "-out", key})
            .status,
        0);
  }
  const std::string out = dir_ + "policy", hex = std::string(64, '0');
  const struct {
    std::pair<std::string, std::string> change;
    std::vector<std::string> extra = {};
    int status = 2;
  } cases[] = {
      {{"--output", ""}},
      {{"--release", "0"}},
      {{"--release", "18446744073709551616"}},
      {{"--verdict-pcr", "13"}},
      {{"--pcr", "24=" + hex}},
      {{"--pcr", "0=" + hex.substr(2)}},
      {{}, {"--pcr", "0=" + hex}},
      {{"--pcr", "4=" + hex}},
      {{"--pcr", "12=" + hex}},
      {{"--pcr", "15=" + hex}},
      {{}, {"--pcr"}},
      {{}, {"--counter", "1"}},
      {{"--key", smallKey}, {}, 1},
      {{"--key", exponent3}, {}, 1},
      {{"--key", KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/digest_key.pem"}, {}, 1},
      {{"--uki", kData + "vendor_key.pem"}, {}, 1},
      {{"--output", dir_ + "missing/policy"}, {}, 1},
  };
  for (const auto& refusal : cases) {
    const test::RunResult r = test::Run(Argv(out, refusal.change, refusal.extra));
    EXPECT_EQ(r.status, refusal.status) << r.err;
    EXPECT_EQ(r.out, "");
    EXPECT_TRUE(r.err.starts_with("keymgr-mkpolicy: ")) << r.err;
    EXPECT_FALSE(std::filesystem::exists(out)) << r.err;
  }
}

}  // namespace
}  // namespace keymgr::policy
