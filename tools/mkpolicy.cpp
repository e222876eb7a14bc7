// keymgr-mkpolicy: the boot-chain policy file of a release
// (/quorvan/hidden/keymgr.policy), made and signed on the build host.
//   keymgr-mkpolicy --key VENDOR.pem --release N --verdict-pcr P [--uki FILE]
//                   [--pcr I=HEX]... --output FILE
// It binds PCR 4 and PCR 12 as the boot chain fills them when it starts the
// unified kernel image FILE, the verdict PCR P at its value after one good
// verdict, and any PCR I at HEX (at least one of --uki and --pcr: the boot
// chain must be bound); the sealed key's policy also holds the
// release counter to at most N. Both approved policies are signed with the
// vendor's RSA-2048 key (PKCS#1 v1.5, which is deterministic): the same
// inputs give the same file. Prints what it bound and signed.
#include <openssl/core_names.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "crypto/openssl_handles.h"
#include "policy/boot_chain.h"
#include "policy/digests.h"
#include "policy/file.h"
#include "util/atomic_file.h"
#include "util/hex.h"
#include "util/io.h"
#include "util/owned.h"
#include "verdict/verdict.h"

namespace {

namespace policy = keymgr::policy;

constexpr int kPcrCount = 24;
constexpr mode_t kPolicyFileMode = 0644;
// A UKI holds a kernel and an initrd: far less than this.
constexpr std::size_t kMaxUkiSize = std::size_t{1} << 30;

struct Args {
  std::string key, uki, output;
  std::uint64_t release = 0;
  int verdictPcr = -1;
  policy::PcrMask given = 0;  // the PCRs of --pcr
  std::array<policy::Digest, kPcrCount> values{};
};

int Usage(const std::string& why) {
  (void)std::fprintf(stderr,
                     "keymgr-mkpolicy: %s\n"
                     "usage: keymgr-mkpolicy --key VENDOR.pem --release N --verdict-pcr P "
                     "[--uki FILE] [--pcr I=HEX]... --output FILE\n",
                     why.c_str());
  return 2;
}

int Fail(const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-mkpolicy: %s\n", what.c_str());
  return 1;
}

// Decimal reads |text|, digits only, as a number of at most |max|.
bool Decimal(std::string_view text, std::uint64_t max, std::uint64_t* value) {
  if (text.empty() || text.size() > 20 ||
      text.find_first_not_of("0123456789") != std::string_view::npos) {
    return false;
  }
  errno = 0;
  *value = std::strtoull(std::string(text).c_str(), nullptr, 10);
  return errno == 0 && *value <= max;
}

// ParsePcr reads I=HEX into |args|.
bool ParsePcr(std::string_view text, Args& args) {
  const std::size_t equals = text.find('=');
  std::uint64_t pcr = 0;
  if (equals == std::string_view::npos || !Decimal(text.substr(0, equals), kPcrCount - 1, &pcr) ||
      ((args.given >> pcr) & 1U) != 0 ||
      !keymgr::HexDecode(text.substr(equals + 1), args.values.at(pcr))) {
    return false;
  }
  args.given |= policy::PcrMask{1} << pcr;
  return true;
}

// TakeOption reads one option and its value into |args|: each but --pcr
// only once.
bool TakeOption(const std::string& option, std::string_view value, Args& args) {
  std::string* path = option == "--key"      ? &args.key
                      : option == "--uki"    ? &args.uki
                      : option == "--output" ? &args.output
                                             : nullptr;
  std::uint64_t number = 0;
  if (path != nullptr) {
    const bool taken = path->empty() && !value.empty();
    if (taken) {
      *path = value;
    }
    return taken;
  }
  if (option == "--release") {
    return args.release == 0 && Decimal(value, UINT64_MAX, &args.release) && args.release >= 1;
  }
  if (option == "--verdict-pcr" && args.verdictPcr < 0 && Decimal(value, 15, &number) &&
      number >= 14) {
    args.verdictPcr = static_cast<int>(number);
    return true;
  }
  return option == "--pcr" && ParsePcr(value, args);
}

// ParseArgs reads the options into |args|, or says in |why| what is wrong.
bool ParseArgs(int argc, char** argv, Args& args, std::string& why) {
  for (int i = 1; i < argc; i += 2) {
    const std::string option = argv[i];
    if (i + 1 == argc) {
      why = option + " needs a value";
      return false;
    }
    if (!TakeOption(option, argv[i + 1], args)) {
      why = "bad option or value: " + option + " " + argv[i + 1];
      return false;
    }
  }
  if (args.key.empty() || args.output.empty() || args.release == 0 || args.verdictPcr < 0) {
    why = "--key, --release, --verdict-pcr and --output are all needed";
    return false;
  }
  // A policy of the verdict alone would open for whoever runs first and
  // extends the good value: it binds the boot chain too.
  if (args.uki.empty() && args.given == 0) {
    why = "the boot chain is needed: --uki, or --pcr for each of its PCRs";
    return false;
  }
  const policy::PcrMask predicted =
      (args.uki.empty() ? 0
                        : policy::PcrMask{1} << policy::kBootImagePcr |
                              policy::PcrMask{1} << policy::kLoadOptionsPcr) |
      policy::PcrMask{1} << args.verdictPcr;
  if ((args.given & predicted) != 0) {
    why = "--pcr names the verdict PCR, or PCR 4 or 12 with --uki, whose values are predicted";
    return false;
  }
  return true;
}

// ReadVendorKey reads the vendor's private key and its modulus. Only an
// RSA-2048 key with the exponent 65537 will do: the device loads the vendor
// key into its TPM with the default exponent.
int ReadVendorKey(const std::string& path, keymgr::crypto::EvpPkey& key,
                  std::array<std::uint8_t, policy::kRsaSignatureSize>& modulus) {
  const keymgr::File pem(std::fopen(path.c_str(), "r"));
  if (!pem) {
    return Fail(path + ": " + std::strerror(errno));
  }
  // Unbuffered, so that the key's text is left in no stdio buffer; OpenSSL
  // wipes its own.
  (void)std::setvbuf(pem.get(), nullptr, _IONBF, 0);
  key.reset(PEM_read_PrivateKey(pem.get(), nullptr, nullptr, nullptr));
  keymgr::crypto::BigNum n;
  keymgr::crypto::BigNum e;
  if (!key || EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA ||
      EVP_PKEY_get_bits(key.get()) != 2048 ||
      EVP_PKEY_get_bn_param(key.get(), OSSL_PKEY_PARAM_RSA_N, n.out()) != 1 ||
      EVP_PKEY_get_bn_param(key.get(), OSSL_PKEY_PARAM_RSA_E, e.out()) != 1 ||
      BN_is_word(e.get(), RSA_F4) != 1 ||
      BN_bn2binpad(n.get(), modulus.data(), static_cast<int>(modulus.size())) < 0) {
    return Fail(path + ": not an RSA-2048 private key in PEM with the exponent 65537");
  }
  return 0;
}

// Sign signs the approval of |approved| for |policyRef|: RSASSA-PKCS1-v1_5
// over SHA-256 of the approval digest, as TPM2_VerifySignature checks it.
bool Sign(EVP_PKEY* key, const policy::Digest& approved, std::span<const std::uint8_t> policyRef,
          policy::RsaSignature& signature) {
  const policy::Digest digest = policy::ApprovalDigest(approved, policyRef);
  const keymgr::crypto::EvpPkeyContext context(EVP_PKEY_CTX_new(key, nullptr));
  std::size_t size = signature.size();
  return context && EVP_PKEY_sign_init(context.get()) == 1 &&
         EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) == 1 &&
         EVP_PKEY_CTX_set_signature_md(context.get(), EVP_sha256()) == 1 &&
         EVP_PKEY_sign(context.get(), signature.data(), &size, digest.data(), digest.size()) == 1 &&
         size == signature.size();
}

std::string Hex(const policy::Digest& digest) {
  return keymgr::HexText(digest, keymgr::HexCase::kLower).data();
}

}  // namespace

int main(int argc, char** argv) {
  Args args;
  std::string why;
  if (!ParseArgs(argc, argv, args, why)) {
    return Usage(why);
  }
  keymgr::crypto::EvpPkey key;
  std::array<std::uint8_t, policy::kRsaSignatureSize> modulus{};
  if (ReadVendorKey(args.key, key, modulus) != 0) {
    return 1;
  }
  policy::PolicyFile policyFile;
  policyFile.release = args.release;
  policyFile.pcrs = args.given | policy::PcrMask{1} << args.verdictPcr;
  if (!args.uki.empty()) {
    const keymgr::File file(std::fopen(args.uki.c_str(), "rb"));
    keymgr::HeapBytes bytes;
    std::size_t size = 0;
    if (!file || !keymgr::ReadWhole(file.get(), kMaxUkiSize, bytes, &size)) {
      return Fail(args.uki + ": " + std::strerror(errno));
    }
    policy::UkiPcrs predicted;
    if (keymgr::Status status = policy::PredictUkiPcrs({bytes.get(), size}, &predicted);
        !status.ok()) {
      return Fail(args.uki + ": not a unified kernel image the boot chain starts (" +
                  status.call() + ")");
    }
    policyFile.pcrs |= policy::PcrMask{1} << policy::kBootImagePcr | policy::PcrMask{1}
                                                                         << policy::kLoadOptionsPcr;
    args.values.at(policy::kBootImagePcr) = predicted.bootImages;
    args.values.at(policy::kLoadOptionsPcr) = predicted.loadOptions;
  }
  args.values.at(args.verdictPcr) = keymgr::verdict::GoodPcrValue();
  std::vector<policy::Digest> bound;
  for (int pcr = 0; pcr < kPcrCount; ++pcr) {
    if (((policyFile.pcrs >> pcr) & 1U) != 0) {
      bound.push_back(args.values.at(pcr));
    }
  }
  const policy::Digest pcrDigest = policy::PcrDigest(bound);
  // The sealed key reads the counter once a release has moved it: written.
  const policy::Name counter = policy::CounterName(
      policy::ReleaseCounter(modulus, args.verdictPcr, keymgr::verdict::GoodPcrValue()), true);
  policyFile.keyPolicy =
      policy::ApprovedKeyPolicy(policyFile.pcrs, pcrDigest, args.release, counter);
  policyFile.counterPolicy = policy::ApprovedCounterPolicy(policyFile.pcrs, pcrDigest);
  if (!Sign(key.get(), policyFile.keyPolicy, policy::kKeyPolicyRef, policyFile.keySignature) ||
      !Sign(key.get(), policyFile.counterPolicy, policy::kCounterPolicyRef,
            policyFile.counterSignature)) {
    return Fail(args.key + ": cannot sign");
  }
  std::array<std::uint8_t, policy::kPolicyFileSize> encoded{};
  policy::EncodePolicyFile(policyFile, encoded);
  if (!keymgr::ReplaceFile(args.output.c_str(), encoded.data(), encoded.size(), kPolicyFileMode)
           .ok()) {
    return Fail(args.output + ": " + std::strerror(errno));
  }
  for (int pcr = 0; pcr < kPcrCount; ++pcr) {
    if (((policyFile.pcrs >> pcr) & 1U) != 0) {
      (void)std::printf("PCR %d = %s\n", pcr, Hex(args.values.at(pcr)).c_str());
    }
  }
  (void)std::printf("key policy = %s\ncounter policy = %s\n", Hex(policyFile.keyPolicy).c_str(),
                    Hex(policyFile.counterPolicy).c_str());
  return 0;
}
