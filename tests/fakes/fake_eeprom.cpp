#include <cstring>

#include "fake_platform.h"
#include "platform/eeprom.h"

namespace keymgr::fake {
namespace {

struct Fault {
  EepromOp op;
  std::uint32_t begin;
  std::uint32_t end;
  int count;
  int result;
};

std::array<std::uint8_t, kEepromSize> g_image;
std::vector<Fault> g_faults;
std::vector<EepromCall> g_calls;

// Access checks one call the way the image-file library does and applies
// any armed fault; it returns the call's result.
int Access(EepromOp op, int device, std::uint32_t offset, std::uint32_t length) {
  if (device != 0 || offset > kEepromSize || length > kEepromSize - offset) {
    return -22;
  }
  for (Fault& f : g_faults) {
    if (f.op == op && f.count > 0 && offset < f.end && offset + length > f.begin) {
      --f.count;
      return f.result;
    }
  }
  return static_cast<int>(length);
}

int Record(EepromCall call) {
  g_calls.push_back(call);
  return call.result;
}

int Read(int device, std::uint32_t offset, std::uint32_t length, void* dst) {
  int result = Access(EepromOp::kRead, device, offset, length);
  if (result >= 0) {
    std::memcpy(dst, g_image.data() + offset, length);
  }
  return Record({EepromOp::kRead, offset, length, 0, 0, result});
}

int Write(std::uint32_t offset, std::uint32_t length, const void* src, int result) {
  if (result >= 0) {
    std::memcpy(g_image.data() + offset, src, length);
  }
  return result;
}

}  // namespace

void ResetEeprom() {
  g_image.fill(0xFF);
  g_faults.clear();
  g_calls.clear();
}
std::array<std::uint8_t, kEepromSize>& EepromImage() {
  return g_image;
}
std::vector<std::uint8_t> EepromBytes(std::uint32_t offset, std::uint32_t length) {
  return {g_image.begin() + offset, g_image.begin() + offset + length};
}
void InjectEepromError(EepromOp op, std::uint32_t begin, std::uint32_t end, int count, int result) {
  g_faults.push_back({op, begin, end, count, result});
}
const std::vector<EepromCall>& EepromCalls() {
  return g_calls;
}

}  // namespace keymgr::fake

using namespace keymgr::fake;

extern "C" {

int ReadEEPROM(int device, uint32_t offset, uint32_t length, void* dst) {
  return Read(device, offset, length, dst);
}
int ReadEEPROM_msok(int device, uint32_t offset, uint32_t length, void* dst) {
  return Read(device, offset, length, dst);
}
int WriteSectionEEPROM(int device, uint32_t offset, uint32_t length, const void* src,
                       uint32_t sectionStart, uint32_t sectionLength) {
  int result = Access(EepromOp::kWrite, device, offset, length);
  if (offset < sectionStart || offset + length > sectionStart + sectionLength) {
    result = -22;
  }
  return Record({EepromOp::kWrite, offset, length, sectionStart, sectionLength,
                 Write(offset, length, src, result)});
}
int WriteEEPROM_Bytes_Sema(int device, uint32_t offset, uint32_t length, const void* src) {
  int result = Access(EepromOp::kWrite, device, offset, length);
  return Record({EepromOp::kWrite, offset, length, 0, 0, Write(offset, length, src, result)});
}

}  // extern "C"
