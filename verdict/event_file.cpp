#include "verdict/event_file.h"

#include <array>
#include <cstring>
#include <string_view>

#include "util/atomic_file.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"

namespace keymgr::verdict {

namespace {

// A boot logs a verdict and a separator; room for a few more.
constexpr std::size_t kMaxEvents = 8;
constexpr unsigned int kEventLogMode = 0644;

}  // namespace

Status WriteEventLog(std::span<const Event> events) {
  AtomicFile log;
  if (Status status = log.Open(kEventLogPath, kEventLogMode); !status.ok()) {
    return status;
  }
  for (const Event& event : events) {
    std::array<char, kEventLineSize + 1> line{};
    const std::size_t length = EncodeEvent(event, std::span(line).first(kEventLineSize));
    if (length == 0) {
      return Refused("event log record");
    }
    line[length] = '\n';
    log.Write(line.data(), length + 1);
  }
  return log.Commit();
}

Status AppendEvent(Event event) {
  std::array<Event, kMaxEvents> events{};
  std::size_t count = 0;
  HeapBytes bytes;
  std::size_t size = 0;
  const File file = OpenFile(kEventLogPath, "r");
  if (file && ReadWhole(file.get(), kMaxEvents * (kEventLineSize + 1), bytes, &size)) {
    std::string_view rest(reinterpret_cast<const char*>(bytes.get()), size);
    while (!rest.empty() && count + 1 < events.size()) {
      const std::size_t end = rest.find('\n');
      if (end == std::string_view::npos || !DecodeEvent(rest.substr(0, end), &events[count]).ok()) {
        count = 0;
        break;
      }
      rest.remove_prefix(end + 1);
      ++count;
    }
  }
  event.recnum = static_cast<std::uint32_t>(count);
  events[count++] = event;
  return WriteEventLog(std::span(events).first(count));
}

}  // namespace keymgr::verdict
