#include "verdict/verdict.h"

#include <cstring>

#include "crypto/hash.h"

namespace keymgr::verdict {

const char* VerdictName(Verdict verdict) {
  return verdict == Verdict::kOk ? "BN=OK" : verdict == Verdict::kFail ? "BN=FAIL" : "none";
}

namespace {

// TextDigest is the SHA-256 of |prefix| and |text|.
PcrValue TextDigest(const char* prefix, const char* text) {
  PcrValue digest{};
  crypto::Sha256 sha;
  (void)sha.Update(prefix, std::strlen(prefix));
  (void)sha.Update(text, std::strlen(text));
  (void)sha.Final(digest);
  return digest;
}

}  // namespace

PcrValue VerdictDigest(Verdict verdict) {
  return TextDigest("keymgr boot verdict: ", VerdictName(verdict));
}

PcrValue SeparatorDigest() {
  return TextDigest("keymgr boot separator", "");
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
