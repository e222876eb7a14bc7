// Regeneration of all key material: seed key, secret key, SC digest, store key.
#include <array>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "kmm/internal.h"
#include "util/debug_print.h"
#include "util/secure.h"
#include "util/status.h"

using namespace keymgr::kmm;

namespace {

// Failed tells whether a step's |result| is a failure, and prints its line
// then.
bool Failed(int result, const char* line) {
  if (result != 0) {
    DebugPrint("%s", line);
  }
  return result != 0;
}

// WriteSealedStoreKey writes the store key that the context holds masked.
int WriteSealedStoreKey(KeyContext* context) {
  std::array<std::uint8_t, kSealedKeySize> storeKey{};
  for (std::uint32_t i = 0; i < kSealedKeySize; ++i) {
    storeKey[i] = ProtectedKey_ByteAt(&context->storeKeyPK, i);
  }
  return WriteStoreKey(kSealedKeySize, storeKey.data());
}

}  // namespace

int RegenerateKey(KeyContext* context) {
  // The digest is stored before the store key is sealed and written: a later
  // failure leaves the new digest beside the old store key, and the next boot
  // reports the mismatch until a regeneration succeeds.
  std::array<std::uint8_t, kScDigestSize> digest{};
  const bool failed =
      Failed(GenerateSeedKey(context), "Generate Seed Key Error!!!\n") ||
      Failed(GenerateSecretKey(context), "Generate Secret Key Error!!!\n") ||
      Failed(GenerateMessageDigest(kScDigestSize, context->secretKeyPK, 1, digest.data()),
             "Generate Message Digest Error!!!\n") ||
      Failed(GenerateStoreKey(context), "Generate Store Key Error!!!\n") ||
      Failed(WriteSealedStoreKey(context), "Write Store Key Error!!!\n");
  return failed ? 1 : 0;
}

int GenerateSeedKey(KeyContext* context) {
  // The random words are only as good as the generator's state: a host that
  // never filled it would get a key found by searching a day of timestamps.
  if (!SeedRandomOnce()) {
    keymgr::LogRefused("no source of randomness for the seed key");
    return 1;
  }
  std::array<char, 12> date{};
  keymgr::Secret<sizeof(KmmSeedKey::seedRandom)> random;

  std::time_t now = std::time(nullptr);
  std::tm local{};
  // Without a local time the date part stays zero; the random part still
  // makes the seed.
  if (localtime_r(&now, &local) != nullptr) {
    int written = std::snprintf(date.data(), date.size(), "%04d%02d%02d", local.tm_year + 1900,
                                local.tm_mon + 1, local.tm_mday);
    if (written < 0 || static_cast<std::size_t>(written) >= date.size()) {
      date.fill('\0');
    }
  }
  for (std::size_t k = 0; k < random.size() / 4; ++k) {
    auto word = static_cast<std::uint32_t>(::random());
    std::memcpy(random.data() + 4 * k, &word, sizeof(word));
  }
  auto seconds = static_cast<std::uint32_t>(std::time(nullptr));

  KmmSeedKey& seed = context->seedKey;
  std::memcpy(seed.seedDate, date.data(), sizeof(seed.seedDate));
  std::memcpy(seed.seedTime, &seconds, sizeof(seed.seedTime));
  std::memcpy(seed.seedRandom, random.data(), sizeof(seed.seedRandom));

  context->seedKeyLength = kSeedKeySize;
  Bind(&context->seedKeyPK, reinterpret_cast<std::uint8_t*>(&context->seedKey),
       context->seedKeyLength);
  DebugPrint("Seed Key is created!!\n");
  return 0;
}

int GenerateSecretKey(KeyContext* context) {
  static_assert(kSecretKeySize == kScDigestSize);
  context->secretKeyLength = kSecretKeySize;  // capacity going in
  Attach(&context->secretKeyPK, context->secretKeyBytes);
  if (HashRecord(&context->seedKeyPK, kSeedKeySize, &context->secretKeyPK,
                 &context->secretKeyLength) != 0) {
    return 1;
  }
  // The sealing later in this regeneration uses this reference as it is.
  FetchConstant(DTC_CONST_AES_PARAM, &context->cipherParamRef, &context->cipherParamLength);
  DebugPrint("Secret Key is created!!\n");
  return 0;
}
