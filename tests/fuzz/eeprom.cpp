// The EEPROM library over an image file of any size and content, with calls
// of any device, offset, length, section and a buffer or none: a call moves
// exactly the bytes asked when the range lies inside the image (and the named
// section) and a buffer takes them, and nothing otherwise; the image ends as
// a model of it predicts.
#include <fuzzer/FuzzedDataProvider.h>

#include <cstdint>
#include <string>
#include <vector>

#include "eeprom/eeprom.h"
#include "support/files.h"
#include "util/paths.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using keymgr::test::Require;
  FuzzedDataProvider in(data, size);
  struct Call {
    int kind, device;
    bool buffer;  // false: no buffer at all
    std::uint32_t offset, length, sectionStart, sectionLength;
    std::uint8_t fill;
  };
  std::vector<Call> calls(in.ConsumeIntegralInRange(1, 4));
  for (Call& call : calls) {
    // Lengths run past any image the fuzzer makes, so that every range is asked.
    call = {in.ConsumeIntegralInRange(0, 3),
            in.ConsumeBool() ? 0 : in.ConsumeIntegral<int>(),
            in.ConsumeIntegralInRange(0, 15) != 0,
            in.ConsumeIntegral<std::uint32_t>(),
            in.ConsumeIntegralInRange<std::uint32_t>(0, 70000),
            in.ConsumeIntegral<std::uint32_t>(),
            in.ConsumeIntegral<std::uint32_t>(),
            in.ConsumeIntegral<std::uint8_t>()};
  }
  std::string image = in.ConsumeRemainingBytesAsString();
  keymgr::test::WriteFile(keymgr::kEepromPath, image);
  for (const Call& call : calls) {
    const std::uint64_t end = std::uint64_t{call.offset} + call.length;
    const bool inside =
        call.device == 0 && end <= image.size() && (call.buffer || call.length == 0) &&
        (call.kind != 2 || (call.offset >= call.sectionStart &&
                            end <= std::uint64_t{call.sectionStart} + call.sectionLength));
    // The buffer is exactly as long as the call says, so that ASan sees any
    // byte moved past it.
    std::string buffer(call.length, static_cast<char>(call.fill));
    char* bytes = call.buffer ? buffer.data() : nullptr;
    const int result =
        call.kind == 0   ? ReadEEPROM(call.device, call.offset, call.length, bytes)
        : call.kind == 1 ? ReadEEPROM_msok(call.device, call.offset, call.length, bytes)
        : call.kind == 2 ? WriteSectionEEPROM(call.device, call.offset, call.length, bytes,
                                              call.sectionStart, call.sectionLength)
                         : WriteEEPROM_Bytes_Sema(call.device, call.offset, call.length, bytes);
    Require(inside ? result == static_cast<int>(call.length) : result < 0);
    if (call.kind < 2) {  // a read gives the image's bytes, or leaves the buffer untouched
      Require(buffer == (inside ? image.substr(call.offset, call.length)
                                : std::string(call.length, static_cast<char>(call.fill))));
    } else if (inside) {
      image.replace(call.offset, call.length, call.length, static_cast<char>(call.fill));
    }
  }
  Require(keymgr::test::ReadFile(keymgr::kEepromPath) == image);
  return 0;
}
