// The event log's codec over any line: what DecodeEvent accepts encodes back
// to the very bytes, and a record made of the bytes encodes to a line that
// decodes back to it.
#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <string_view>

#include "support/files.h"
#include "util/endian.h"
#include "verdict/event_log.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace verdict = keymgr::verdict;
  using keymgr::test::Require;
  std::array<char, verdict::kEventLineSize> line{};
  verdict::Event event;
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  if (verdict::DecodeEvent(input, &event).ok()) {
    Require(std::string_view(line.data(), verdict::EncodeEvent(event, line)) == input);
  }
  // The record: recnum, pcr, verdict and which fields it has (or that it is a
  // separator), release, then
  // the three digests; missing bytes are zeros.
  std::array<std::uint8_t, 18 + 3 * 32> bytes{};
  std::memcpy(bytes.data(), data, std::min(size, bytes.size()));
  verdict::Event made;
  made.recnum = keymgr::LoadBig32(bytes.data());
  made.pcr = keymgr::LoadBig32(bytes.data() + 4);
  made.verdict = static_cast<verdict::Verdict>(bytes[8] % 3);
  std::memcpy(made.digest.data(), bytes.data() + 18, 32);
  if ((bytes[9] & 1) != 0) {
    std::memcpy(made.manifestSha256.emplace().data(), bytes.data() + 50, 32);
  }
  if ((bytes[9] & 2) != 0) {
    std::memcpy(made.digestsSha256.emplace().data(), bytes.data() + 82, 32);
  }
  if ((bytes[9] & 4) != 0) {
    made.release = keymgr::LoadBig64(bytes.data() + 10);
  }
  if ((bytes[9] & 8) != 0) {  // a separator carries no content beyond its kind
    made = verdict::SeparatorEvent(made.recnum, made.pcr);
  }
  const std::size_t length = verdict::EncodeEvent(made, line);
  Require(length > 0 && verdict::DecodeEvent({line.data(), length}, &event).ok() && event == made);
  return 0;
}
