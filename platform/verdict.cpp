#include "platform/verdict.h"

#include <cstring>

#include "crypto/hash.h"

namespace keymgr::tpm {

const char* VerdictName(Verdict verdict) {
  return verdict == Verdict::kOk ? "BN=OK" : verdict == Verdict::kFail ? "BN=FAIL" : "none";
}

PcrValue VerdictDigest(Verdict verdict) {
  static constexpr char kPrefix[] = "keymgr boot verdict: ";
  PcrValue digest{};
  crypto::Sha256 sha;
  (void)sha.Update(kPrefix, sizeof(kPrefix) - 1);
  (void)sha.Update(VerdictName(verdict), std::strlen(VerdictName(verdict)));
  (void)sha.Final(digest);
  return digest;
}

PcrValue GoodPcrValue() {
  const PcrValue zeros{};
  const PcrValue good = VerdictDigest(Verdict::kOk);
  PcrValue value{};
  crypto::Sha256 sha;
  (void)sha.Update(zeros.data(), zeros.size());
  (void)sha.Update(good.data(), good.size());
  (void)sha.Final(value);
  return value;
}

}  // namespace keymgr::tpm
