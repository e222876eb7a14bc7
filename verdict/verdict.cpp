#include "verdict/verdict.h"

#include <cstring>

#include "crypto/hash.h"

namespace keymgr::verdict {

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

PcrValue Extended(const PcrValue& pcr, const PcrValue& digest) {
  PcrValue value{};
  crypto::Sha256 sha;
  (void)sha.Update(pcr.data(), pcr.size());
  (void)sha.Update(digest.data(), digest.size());
  (void)sha.Final(value);
  return value;
}

PcrValue GoodPcrValue() {
  return Extended(PcrValue{}, VerdictDigest(Verdict::kOk));
}

}  // namespace keymgr::verdict
