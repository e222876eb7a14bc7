// The policy digests against the suite's swtpm, which computes each in a
// trial session of tpm2-tools, and keymgr-mkpolicy end to end: its file
// decodes, its signatures are those the TPM verifies, and it writes nothing
// when it refuses.
#include <tss2/tss2_mu.h>

#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <filesystem>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "policy/boot_chain.h"
#include "policy/digests.h"
#include "policy/file.h"
#include "support/sandbox.h"
#include "verdict/verdict.h"

namespace keymgr::policy {
namespace {

using test::FromHex;
using test::ReadFile;
using test::Tpm2;
using test::WriteFile;

const std::string kTool = KEYMGR_TEST_MKPOLICY_BIN;
const std::string kData = KEYMGR_TEST_SOURCE_DIR "/tests/policy/data/";

template <std::size_t N>
std::string Text(const std::array<std::uint8_t, N>& bytes) {
  return {bytes.begin(), bytes.end()};
}

template <std::size_t N>
std::array<std::uint8_t, N> Array(const std::string& bytes) {
  std::array<std::uint8_t, N> array{};
  EXPECT_EQ(bytes.size(), N);
  std::copy_n(bytes.begin(), std::min(N, bytes.size()), array.begin());
  return array;
}

std::string Modulus() {
  const std::string out = test::Run({"openssl", "rsa", "-pubin", "-in",
                                     kData + "vendor_key.pub.pem", "-noout", "-modulus"})
                              .out;
  return FromHex(out.substr(out.find('=') + 1, 512));
}

// LoadVendorKey loads the vendor's public key into the TPM as the device
// does (TPM2_LoadExternal: RSASSA with SHA-256, sign only, the default
// exponent as 0), and returns the name the TPM gives it.
std::string LoadVendorKey(const std::string& dir) {
  const std::string modulus = Modulus();
  TPM2B_PUBLIC key{};
  key.publicArea.type = TPM2_ALG_RSA;
  key.publicArea.nameAlg = TPM2_ALG_SHA256;
  key.publicArea.objectAttributes = TPMA_OBJECT_SIGN_ENCRYPT | TPMA_OBJECT_USERWITHAUTH;
  TPMS_RSA_PARMS& rsa = key.publicArea.parameters.rsaDetail;
  rsa.symmetric.algorithm = TPM2_ALG_NULL;
  rsa.scheme.scheme = TPM2_ALG_RSASSA;
  rsa.scheme.details.rsassa.hashAlg = TPM2_ALG_SHA256;
  rsa.keyBits = 2048;
  key.publicArea.unique.rsa.size = 256;
  std::copy(modulus.begin(), modulus.end(), key.publicArea.unique.rsa.buffer);
  std::array<std::uint8_t, sizeof(key)> bytes{};
  std::size_t size = 0;
  EXPECT_EQ(Tss2_MU_TPM2B_PUBLIC_Marshal(&key, bytes.data(), bytes.size(), &size), 0u);
  WriteFile(dir + "vendor.pub", std::string(bytes.begin(), bytes.begin() + size));
  EXPECT_EQ(Tpm2({"tpm2_loadexternal", "-C", "n", "-u", dir + "vendor.pub", "-c",
                  dir + "vendor.ctx", "-n", dir + "vendor.name"})
                .status,
            0);
  return *ReadFile(dir + "vendor.name");
}

// Trial runs tpm2-tools' policy commands in a trial session and returns the
// digest it ends with.
std::string Trial(const std::string& dir, const std::vector<std::vector<std::string>>& commands) {
  const std::string session = dir + "trial.ctx", digest = dir + "trial.policy";
  EXPECT_EQ(Tpm2({"tpm2_startauthsession", "-S", session}).status, 0);
  for (std::vector<std::string> command : commands) {
    command.insert(command.begin() + 1, {"-S", session, "-L", digest});
    EXPECT_EQ(Tpm2(command).status, 0) << command[0];
  }
  EXPECT_EQ(Tpm2({"tpm2_flushcontext", session}).status, 0);
  return ReadFile(digest).value_or("");
}

class Mkpolicy : public testing::Test {
 protected:
  void SetUp() override {
    test::ResetSandbox();
    std::filesystem::create_directories(dir_);
  }
  // Nothing loaded stays: the suite's swtpm has no resource manager.
  void TearDown() override { Tpm2({"tpm2_flushcontext", "-t"}); }
  const std::string dir_ = test::InRoot("/policy/");
};

TEST_F(Mkpolicy, TheTpmComputesThePolicyDigestsAndNamesAsTheLibraryDoes) {
  // PCRs 0, 4, 12 and 14 at values of their own.
  const PcrMask mask = 1 << 0 | 1 << 4 | 1 << 12 | 1 << 14;
  std::vector<Digest> values;
  std::string valueFile;
  for (const std::uint8_t fill : {0x10, 0x04, 0x00, 0x0E}) {
    values.push_back({});
    values.back().fill(fill);
    valueFile += Text(values.back());
  }
  WriteFile(dir_ + "pcrs.bin", valueFile);
  const Digest pcrDigest = PcrDigest(values);
  const std::vector<std::string> policyPcr = {"tpm2_policypcr", "-l", "sha256:0,4,12,14", "-f",
                                              dir_ + "pcrs.bin"};
  EXPECT_EQ(Trial(dir_, {policyPcr}), Text(PolicyPcr(Digest{}, mask, pcrDigest)));
  EXPECT_EQ(Trial(dir_, {policyPcr, {"tpm2_policycommandcode", "TPM2_CC_NV_Increment"}}),
            Text(ApprovedCounterPolicy(mask, pcrDigest)));

  // A counter with the release counter's attributes, beside its handle, and
  // a policy that the test meets: its name before and after an increment,
  // and PolicyNV over it.
  const std::string handle = "0x01800C0E";  // beside the counters of the builds
  const Digest increment = PolicyCommandCode(Digest{}, TPM2_CC_NV_Increment);
  WriteFile(dir_ + "increment.policy", Text(increment));
  ASSERT_EQ(Tpm2({"tpm2_nvdefine", handle, "-C", "o", "-s", "8", "-a", "0x02040018", "-L",
                  dir_ + "increment.policy"})
                .status,
            0);
  const auto name = [&] {
    static const std::regex kName("name: ([0-9a-f]{68})");
    std::smatch match;
    const std::string out = Tpm2({"tpm2_nvreadpublic", handle}).out;
    return std::regex_search(out, match, kName) ? FromHex(match[1].str()) : "";
  };
  EXPECT_EQ(name(), Text(NvIndexName(kCounterHandle + 0x100, kCounterAttributes, increment, 8)));
  const std::string session = dir_ + "write.ctx";
  EXPECT_EQ(Tpm2({"tpm2_startauthsession", "--policy-session", "-S", session}).status, 0);
  EXPECT_EQ(Tpm2({"tpm2_policycommandcode", "-S", session, "TPM2_CC_NV_Increment"}).status, 0);
  EXPECT_EQ(Tpm2({"tpm2_nvincrement", "-C", handle, "-P", "session:" + session, handle}).status, 0);
  Tpm2({"tpm2_flushcontext", session});
  const Name written =
      NvIndexName(kCounterHandle + 0x100, kCounterAttributes | kCounterWritten, increment, 8);
  EXPECT_EQ(name(), Text(written));
  WriteFile(dir_ + "release.bin", FromHex("0000000000000007"));
  EXPECT_EQ(Trial(dir_, {policyPcr, {"tpm2_policynv", "-i", dir_ + "release.bin", handle, "ule"}}),
            Text(ApprovedKeyPolicy(mask, pcrDigest, 7, written)));
  EXPECT_EQ(Tpm2({"tpm2_nvundefine", handle, "-C", "o"}).status, 0);

  // The vendor key's name, and PolicyAuthorize with it.
  const std::string vendorName = LoadVendorKey(dir_);
  const Name signer = RsaSigningKeyName(Array<256>(Modulus()));
  EXPECT_EQ(vendorName, Text(signer));
  WriteFile(dir_ + "ref", Text(kKeyPolicyRef));
  EXPECT_EQ(Trial(dir_, {{"tpm2_policyauthorize", "-i", dir_ + "increment.policy", "-q",
                          dir_ + "ref", "-n", dir_ + "vendor.name"}}),
            Text(PolicyAuthorize(signer, kKeyPolicyRef)));
}

TEST_F(Mkpolicy, TheSameInputsGiveTheSameSignedFileThatTheTpmVerifies) {
  const std::string pcr0 = std::string(64, 'a');
  const std::vector<std::string> argv = {
      kTool,          "--key", kData + "vendor_key.pem", "--release", "9",         "--verdict-pcr",
      "15",           "--uki", kData + "uki.efi",        "--pcr",     "0=" + pcr0, "--output",
      dir_ + "policy"};
  const test::RunResult first = test::Run(argv);
  ASSERT_EQ(first.status, 0) << first.err;
  const std::string bytes = *ReadFile(dir_ + "policy");
  EXPECT_EQ(std::filesystem::status(dir_ + "policy").permissions(), std::filesystem::perms(0644));
  const test::RunResult again = test::Run(argv);
  EXPECT_EQ(again.out, first.out);
  EXPECT_EQ(ReadFile(dir_ + "policy"), bytes);

  // What it printed is what it signed.
  PolicyFile file;
  ASSERT_TRUE(
      DecodePolicyFile({reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()}, &file)
          .ok());
  EXPECT_EQ(file.release, 9u);
  EXPECT_EQ(file.pcrs, 1u << 0 | 1u << 4 | 1u << 12 | 1u << 15);
  std::map<std::string, std::string> printed;
  static const std::regex kLine("(.+) = ([0-9a-f]{64})\n");
  for (std::sregex_iterator it(first.out.begin(), first.out.end(), kLine), end; it != end; ++it) {
    printed[(*it)[1]] = FromHex((*it)[2].str());
  }
  ASSERT_EQ(printed.size(), 6u) << first.out;
  UkiPcrs uki;
  const std::string image = *ReadFile(kData + "uki.efi");
  ASSERT_TRUE(
      PredictUkiPcrs({reinterpret_cast<const std::uint8_t*>(image.data()), image.size()}, &uki)
          .ok());
  EXPECT_EQ(printed["PCR 0"], FromHex(pcr0));
  EXPECT_EQ(printed["PCR 4"], Text(uki.bootImages));
  EXPECT_EQ(printed["PCR 12"], std::string(32, '\0'));
  EXPECT_EQ(printed["PCR 15"], Text(verdict::GoodPcrValue()));
  const std::vector<Digest> values = {Array<32>(printed["PCR 0"]), uki.bootImages, Digest{},
                                      verdict::GoodPcrValue()};
  const Digest pcrDigest = PcrDigest(values);
  const Name counter =
      CounterName(ReleaseCounter(Array<256>(Modulus()), 15, verdict::GoodPcrValue()), true);
  EXPECT_EQ(file.keyPolicy, ApprovedKeyPolicy(file.pcrs, pcrDigest, 9, counter));
  EXPECT_EQ(file.counterPolicy, ApprovedCounterPolicy(file.pcrs, pcrDigest));
  EXPECT_EQ(printed["key policy"], Text(file.keyPolicy));
  EXPECT_EQ(printed["counter policy"], Text(file.counterPolicy));

  // TPM2_VerifySignature takes both signatures, and not one altered.
  LoadVendorKey(dir_);
  const auto verifies = [&](const Digest& approved, std::span<const std::uint8_t> ref,
                            std::string signature) {
    WriteFile(dir_ + "approval", Text(ApprovalDigest(approved, ref)));
    WriteFile(dir_ + "signature", signature);
    const bool verified = Tpm2({"tpm2_verifysignature", "-c", dir_ + "vendor.ctx", "-d",
                                dir_ + "approval", "-f", "rsassa", "-s", dir_ + "signature"})
                              .status == 0;
    Tpm2({"tpm2_flushcontext", "-t"});  // each run loads the key again
    return verified;
  };
  EXPECT_TRUE(verifies(file.keyPolicy, kKeyPolicyRef, Text(file.keySignature)));
  EXPECT_TRUE(verifies(file.counterPolicy, kCounterPolicyRef, Text(file.counterSignature)));
  EXPECT_FALSE(verifies(file.counterPolicy, kKeyPolicyRef, Text(file.counterSignature)));
}

TEST_F(Mkpolicy, RefusalsWriteNothing) {
  const std::string smallKey = dir_ + "small.pem", exponent3 = dir_ + "e3.pem";
  ASSERT_EQ(test::Run({"openssl", "genpkey", "-algorithm", "RSA", "-pkeyopt",
                       "rsa_keygen_bits:1024", "-out", smallKey})
                .status,
            0);
  ASSERT_EQ(
      test::Run({"openssl", "genpkey", "-algorithm", "RSA", "-pkeyopt", "rsa_keygen_bits:2048",
                 "-pkeyopt", "rsa_keygen_pubexp:3", "-out", exponent3})
          .status,
      0);
  const std::string out = dir_ + "policy", hex = std::string(64, '0');
  const std::map<std::string, std::string> good = {{"--key", kData + "vendor_key.pem"},
                                                   {"--release", "1"},
                                                   {"--verdict-pcr", "14"},
                                                   {"--uki", kData + "uki.efi"},
                                                   {"--output", out}};
  const struct {
    std::map<std::string, std::string> change;
    std::vector<std::string> extra;
    int status;
  } cases[] = {
      {{{"--output", ""}}, {}, 2},
      {{{"--release", "0"}}, {}, 2},
      {{{"--release", "18446744073709551616"}}, {}, 2},
      {{{"--verdict-pcr", "13"}}, {}, 2},
      {{}, {"--pcr", "24=" + hex}, 2},
      {{}, {"--pcr", "0=" + hex.substr(2)}, 2},
      {{}, {"--pcr", "0=" + hex, "--pcr", "0=" + hex}, 2},
      {{}, {"--pcr", "4=" + hex}, 2},
      {{}, {"--pcr", "12=" + hex}, 2},
      {{}, {"--pcr", "14=" + hex}, 2},
      {{}, {"--pcr"}, 2},
      {{}, {"--counter", "1"}, 2},
      {{{"--key", smallKey}}, {}, 1},
      {{{"--key", exponent3}}, {}, 1},
      {{{"--key", KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/digest_key.pem"}}, {}, 1},
      {{{"--uki", kData + "vendor_key.pem"}}, {}, 1},
      {{{"--output", dir_ + "missing/policy"}}, {}, 1},
  };
  for (const auto& refusal : cases) {
    std::vector<std::string> argv = {kTool};
    for (auto [option, value] : good) {
      value = refusal.change.contains(option) ? refusal.change.at(option) : value;
      if (!value.empty()) {
        argv.insert(argv.end(), {option, value});
      }
    }
    argv.insert(argv.end(), refusal.extra.begin(), refusal.extra.end());
    const test::RunResult r = test::Run(argv);
    EXPECT_EQ(r.status, refusal.status) << r.err;
    EXPECT_EQ(r.out, "");
    EXPECT_TRUE(r.err.starts_with("keymgr-mkpolicy: ")) << r.err;
    EXPECT_FALSE(std::filesystem::exists(out)) << r.err;
  }
}

}  // namespace
}  // namespace keymgr::policy
