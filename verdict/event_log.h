// keymgr's event log: the TCG canonical event log in its JSON form, one
// record a line. The one codec of its records, for the writer (keymgr) and
// the verifier (keymgr-eventlog).
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

#include "util/status.h"
#include "verdict/verdict.h"

namespace keymgr::verdict {

// What an event records, which gives its content's form: the boot verdict,
// or the separator that the first key proof of a boot (or, in a signed build
// without sealed keys, the boot run) extends after it, so that nothing later
// in the boot finds the verdict's value in the PCR.
enum class EventKind : std::uint8_t { kVerdict, kSeparator };

struct Event {
  std::uint32_t recnum = 0;
  std::uint32_t pcr = 0;
  PcrValue digest{};  // what the PCR was extended with
  EventKind kind = EventKind::kVerdict;
  // The content of a verdict event: the verdict, and for a verifier what it
  // was reached over. A separator has none.
  Verdict verdict = Verdict::kNone;
  std::optional<PcrValue> manifestSha256;
  std::optional<PcrValue> digestsSha256;
  std::optional<std::uint64_t> release;  // the counter of keymgr.sig

  bool operator==(const Event&) const = default;
};

// VerdictEvent is the event of |verdict|, numbered |recnum|, in PCR |pcr|.
Event VerdictEvent(std::uint32_t recnum, std::uint32_t pcr, Verdict verdict);
// SeparatorEvent is the separator, numbered |recnum|, in PCR |pcr|.
Event SeparatorEvent(std::uint32_t recnum, std::uint32_t pcr);

// Room for the longest record.
inline constexpr std::size_t kEventLineSize = 512;

// EncodeEvent writes |event| into |line| as one line of the log, without the
// line feed, and returns its length; 0 when it does not fit.
std::size_t EncodeEvent(const Event& event, std::span<char> line);

// DecodeEvent reads |line|, one line of the log without its line feed, into
// |event|. Only what EncodeEvent writes is a record: the fields in its order
// and spacing, numbers in range without leading zeros, digests in 64
// lower-case hex digits, nothing after; anything else is refused.
Status DecodeEvent(std::string_view line, Event* event);

}  // namespace keymgr::verdict
