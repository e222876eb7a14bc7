// The normal-boot proof: the stored store key must unseal to a secret key
// whose SC digest matches the EEPROM copy and the disk copy.
#include <array>
#include <cstdint>
#include <cstring>
#include <ctime>

#include "bootlog/boot_status.h"
#include "kmm/internal.h"
#include "util/debug_print.h"

using namespace keymgr::kmm;

namespace {

constexpr char kBannerLine[] =
    "====================================================================\n";
static_assert(sizeof(kBannerLine) == 68 + 2);

constexpr int kStoreKeyAttempts = 3;

// LocalTimeText is the asctime text of the current local time, line feed
// included. A clock that cannot be converted gives a placeholder line, so
// the banner keeps its shape.
struct LocalTimeText {
  static constexpr char kUnavailable[] = "(local time unavailable)\n";
  std::array<char, 64> text{};
  LocalTimeText() {
    static_assert(sizeof(kUnavailable) <= sizeof(text));
    std::time_t now = std::time(nullptr);
    std::tm local{};
    if (localtime_r(&now, &local) == nullptr || asctime_r(&local, text.data()) == nullptr) {
      std::memcpy(text.data(), kUnavailable, sizeof(kUnavailable));
    }
  }
};

// The stored copies of the SC digest, in the order they are proved, with the
// lines that name them.
struct StoredCopy {
  int (*read)(std::uint8_t* dst);
  const char* readError;
  const char* name;
};
constexpr StoredCopy kStoredCopies[] = {
    {ReadDigestEEPROM, "Get Message Digest Error [EEPROM]!!\n", "EEPROM"},
    {ReadDigestHDD, "Get Message Digest Error from HDD!!\n", "HDD"},
};

// An all-0xFF or all-zero start marks a region that never held a key.
bool HoldsNoKey(const std::array<std::uint8_t, kSealedKeySize>& key) {
  return (key[0] == 0xFF && key[1] == 0xFF) || (key[0] == 0x00 && key[1] == 0x00);
}

}  // namespace

int NormalBoot(KeyContext* context, int logFlag) {
  auto fail = [logFlag] {
    if (logFlag != 0) {
      WriteBootStatus(kBootStatusDtFail);
    }
    return 1;
  };

  int counter = kStoreKeyAttempts;
  LocalTimeText start;
  context->statusWord = 0;
  std::array<std::uint8_t, kSealedKeySize> storeKey{};

  DebugPrint("%s", kBannerLine);
  DebugPrint(" Start KMM : %s", start.text.data());
  DebugPrint("%s\n", kBannerLine);

  // Read errors and blank contents share one budget of three attempts; the
  // attempts see the counter values 2, 1 and 0.
  std::uint32_t length = 0;
  while (counter-- != 0) {
    if (ReadStoreKey(&length, storeKey.data()) != 0) {
      DebugPrint("Read Store Key error [Retry:%d]!!!\n", counter);
      if (counter == 0) {
        return fail();
      }
      continue;
    }
    std::memcpy(context->storeKeyBytes, storeKey.data(),
                length < kSealedKeySize ? length : kSealedKeySize);
    if (HoldsNoKey(storeKey)) {
      DebugPrint("Read Store Key but values are error [Retry:%d]!!!\n", counter);
      if (counter == 0) {
        return fail();
      }
      continue;
    }
    break;
  }

  context->storeKeyLength = length;
  Bind(&context->storeKeyPK, context->storeKeyBytes, context->storeKeyLength);
  if (DecryptStoreKey(context) != 0) {
    DebugPrint("Decrypt Store Key Error!!\n");
    return fail();
  }

  std::array<std::uint8_t, kScDigestSize> computed{};
  if (GenerateMessageDigest(kScDigestSize, context->secretKeyPK, 0, computed.data()) != 0) {
    DebugPrint("Generate Message Digest Error!!\n");
    return fail();
  }
  // The EEPROM copy is proved first; the disk copy is read only after it.
  for (const StoredCopy& copy : kStoredCopies) {
    std::array<std::uint8_t, kScDigestSize> stored{};
    if (copy.read(stored.data()) != 0) {
      DebugPrint("%s", copy.readError);
      return fail();
    }
    if (std::memcmp(computed.data(), stored.data(), kScDigestSize) != 0) {
      DebugPrint("SC Digest Test Fail [%s]!!\n", copy.name);
      return fail();
    }
    DebugPrint("SC Digest Test Success [%s]!!\n", copy.name);
  }
  if (logFlag != 0) {
    WriteBootStatus(kBootStatusDtOk);
  }

  LocalTimeText end;
  DebugPrint("\n%s", kBannerLine);
  DebugPrint(" End KMM : %s", end.text.data());
  DebugPrint("%s\n\n\n", kBannerLine);
  return 0;
}
