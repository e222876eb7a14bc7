// The EEPROM library over an image file of any size and content, with calls
// of any device, offset, length and section: a call moves exactly the bytes
// asked when the range lies inside the image (and the named section) and
// nothing otherwise, and the image ends as a model of it predicts.
#include <fuzzer/FuzzedDataProvider.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "platform/eeprom.h"
#include "util/paths.h"

namespace {

// Longer than any image the fuzzer makes, so that every range can be asked.
constexpr std::uint32_t kMaxLength = 70000;

void Check(bool holds) {
  if (!holds) {
    std::abort();
  }
}

std::string ReadImage() {
  std::ifstream in(keymgr::kEepromPath, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  std::filesystem::create_directories(std::filesystem::path(keymgr::kEepromPath).parent_path());
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzedDataProvider in(data, size);
  enum Kind { kRead, kReadMsok, kWriteSection, kWriteSema };
  struct Call {
    Kind kind;
    int device;
    std::uint32_t offset, length, sectionStart, sectionLength;
    std::uint8_t fill;
  };
  std::vector<Call> calls(in.ConsumeIntegralInRange(1, 4));
  for (Call& call : calls) {
    call.kind = static_cast<Kind>(in.ConsumeIntegralInRange(0, 3));
    call.device = in.ConsumeBool() ? 0 : in.ConsumeIntegral<int>();
    call.offset = in.ConsumeIntegral<std::uint32_t>();
    call.length = in.ConsumeIntegralInRange<std::uint32_t>(0, kMaxLength);
    call.sectionStart = in.ConsumeIntegral<std::uint32_t>();
    call.sectionLength = in.ConsumeIntegral<std::uint32_t>();
    call.fill = in.ConsumeIntegral<std::uint8_t>();
  }
  std::string image = in.ConsumeRemainingBytesAsString();
  std::ofstream(keymgr::kEepromPath, std::ios::binary | std::ios::trunc)
      .write(image.data(), static_cast<std::streamsize>(image.size()));

  for (const Call& call : calls) {
    const std::uint64_t end = std::uint64_t{call.offset} + call.length;
    bool inside = call.device == 0 && end <= image.size();
    if (call.kind == kWriteSection) {
      inside = inside && call.offset >= call.sectionStart &&
               end <= std::uint64_t{call.sectionStart} + call.sectionLength;
    }
    // The buffer is exactly as long as the call says, so that ASan sees any
    // byte moved past it.
    std::vector<std::uint8_t> buffer(call.length, call.fill);
    int result = -1;
    switch (call.kind) {
      case kRead:
        result = ReadEEPROM(call.device, call.offset, call.length, buffer.data());
        break;
      case kReadMsok:
        result = ReadEEPROM_msok(call.device, call.offset, call.length, buffer.data());
        break;
      case kWriteSection:
        result = WriteSectionEEPROM(call.device, call.offset, call.length, buffer.data(),
                                    call.sectionStart, call.sectionLength);
        break;
      case kWriteSema:
        result = WriteEEPROM_Bytes_Sema(call.device, call.offset, call.length, buffer.data());
        break;
    }
    Check(inside ? result == static_cast<int>(call.length) : result < 0);
    const bool reads = call.kind == kRead || call.kind == kReadMsok;
    if (reads && inside) {
      Check(std::equal(buffer.begin(), buffer.end(), image.begin() + call.offset,
                       [](std::uint8_t a, char b) { return a == static_cast<std::uint8_t>(b); }));
    } else if (reads) {
      Check(std::vector<std::uint8_t>(call.length, call.fill) == buffer);  // untouched
    } else if (inside) {
      image.replace(call.offset, call.length, call.length, static_cast<char>(call.fill));
    }
  }
  Check(ReadImage() == image);
  return 0;
}
