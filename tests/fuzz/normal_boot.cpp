// The key files and the normal-boot proof over the fake EEPROM and key
// manager: a device that is blank, or regenerated and then altered from the
// input (key files and keymgr.cs rewritten or removed, EEPROM bytes
// overwritten, EEPROM ranges and key-manager calls made to fail, a TPM key
// made for whatever identity and password the files hold), then
// KeyManage(1, 1). Untouched key material proves, and the result and the DT
// line agree.
#include <fuzzer/FuzzedDataProvider.h>
#include <kmm/kmm.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "support/fake_platform.h"
#include "support/files.h"
#include "util/paths.h"

namespace fs = std::filesystem;
using namespace keymgr;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fs::create_directories(fs::path(kKeyIdPath).parent_path());
  fs::create_directories(fs::path(kBootLogPath).parent_path());
  // Every step of the flows prints a line; only failures of the checks below
  // and sanitizer reports matter here.
  return std::freopen("/dev/null", "w", stdout) != nullptr ? 0 : 1;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzedDataProvider in(data, size);
  test::FakeEeprom& eeprom = test::Eeprom();
  test::FakeKeyManager& keyManager = test::KeyManager();
  eeprom.Reset();
  keyManager.Reset();
  const char* files[] = {kKeyIdPath, kKeyPwdPath, kStoredOokPath, kScDigestPath, kBootLogPath};
  for (const char* path : files) {
    std::remove(path);
  }
  std::srand(1);
  eeprom.image[eeprom::kSfeConfOffset] = eeprom::kSfe003Mask;  // DT lines reach the log
  const bool regenerated = in.ConsumeBool();
  test::Require(!regenerated || KeyManage(KMM_OPTION_REGENERATE, 0) != nullptr);
  const bool altered = in.remaining_bytes() > 0;
  while (in.remaining_bytes() > 0) {
    const int step = in.ConsumeIntegralInRange(0, 4);
    if (step == 0) {
      const char* path = files[in.ConsumeIntegralInRange(0, 3)];
      in.ConsumeBool() ? (void)std::remove(path)
                       : test::WriteFile(path, in.ConsumeRandomLengthString(400));
    } else if (step == 1) {
      const auto offset = in.ConsumeIntegralInRange<std::uint32_t>(0, eeprom::kSize - 1);
      const std::string bytes = in.ConsumeRandomLengthString(eeprom::kSize - offset);
      std::memcpy(eeprom.image.data() + offset, bytes.data(), bytes.size());
    } else if (step == 2) {
      eeprom.fault = {in.ConsumeIntegralInRange<std::uint32_t>(0, eeprom::kSize),
                      in.ConsumeIntegralInRange<std::uint32_t>(0, eeprom::kSize),
                      in.ConsumeIntegralInRange(0, 4)};
    } else if (step == 3) {
      keyManager.fail[in.ConsumeIntegralInRange(0, 3)] = in.ConsumeIntegralInRange(0u, 3u);
    } else {
      keyManager.keys[test::KeyAuth(test::ReadFile(kKeyIdPath).value_or(""))] =
          test::KeyAuth(test::ReadFile(kKeyPwdPath).value_or(""));
    }
  }
  const KeyContext* context = KeyManage(KMM_OPTION_NORMAL_BOOT, 1);
  const std::string log = test::ReadFile(kBootLogPath).value_or("");
  test::Require(
      (!regenerated || altered || context != nullptr) &&
      (log.empty() || log == (context != nullptr ? "DT=OK\n" : "DT=FAIL\n")) &&
      (context == nullptr || (context->secretKeyLength == 48 && context->storeKeyLength == 48)));
  return 0;
}
