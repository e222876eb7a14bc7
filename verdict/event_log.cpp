#include "verdict/event_log.h"

#include <array>
#include <charconv>
#include <cstring>
#include <type_traits>

#include "util/hex.h"

namespace keymgr::verdict {

namespace {

// KindKey is the key of the content of an event of |kind|.
std::string_view KindKey(EventKind kind) {
  return kind == EventKind::kVerdict ? "{\"verdict\":\"" : "{\"separator\":\"";
}

// Writer and Reader walk a record's text through Layout, one writing it and
// the other taking it apart, so that both follow the same layout. Each call
// returns false when the line is full, or does not go on as the layout says.
struct Writer {
  std::span<char> line;
  std::size_t used = 0;

  bool Literal(std::string_view text) {
    if (text.size() > line.size() - used) {
      return false;
    }
    std::memcpy(line.data() + used, text.data(), text.size());
    used += text.size();
    return true;
  }
  template <class Int>
  requires std::is_integral_v<Int>
  bool Value(Int value) {
    const auto [end, error] = std::to_chars(line.data() + used, line.data() + line.size(), value);
    used = static_cast<std::size_t>(end - line.data());
    return error == std::errc();
  }
  bool Value(const PcrValue& digest) {
    return Literal({HexText(digest, HexCase::kLower).data(), 2 * digest.size()});
  }
  bool Value(Verdict verdict) { return Literal(VerdictName(verdict)); }
  bool Value(EventKind kind) { return Literal(KindKey(kind)); }
  template <class T>
  bool Field(std::string_view key, const std::optional<T>& value, std::string_view end) {
    return !value || (Literal(key) && Value(*value) && Literal(end));
  }
};

struct Reader {
  std::string_view rest;

  bool Literal(std::string_view text) {
    if (!rest.starts_with(text)) {
      return false;
    }
    rest.remove_prefix(text.size());
    return true;
  }
  // A number out of its type's range is refused, never wrapped.
  template <class Int>
  requires std::is_integral_v<Int>
  bool Value(Int& value) {
    const auto [end, error] = std::from_chars(rest.data(), rest.data() + rest.size(), value);
    rest.remove_prefix(static_cast<std::size_t>(end - rest.data()));
    return error == std::errc();
  }
  bool Value(PcrValue& digest) {
    const std::size_t digits = 2 * digest.size();
    if (!HexDecode(rest.substr(0, digits), digest)) {
      return false;
    }
    rest.remove_prefix(digits);
    return true;
  }
  bool Value(Verdict& verdict) {
    for (const Verdict named : {Verdict::kOk, Verdict::kFail, Verdict::kNone}) {
      if (Literal(VerdictName(named))) {
        verdict = named;
        return true;
      }
    }
    return false;
  }
  bool Value(EventKind& kind) {
    for (const EventKind named : {EventKind::kVerdict, EventKind::kSeparator}) {
      if (Literal(KindKey(named))) {
        kind = named;
        return true;
      }
    }
    return false;
  }
  template <class T>
  bool Field(std::string_view key, std::optional<T>& value, std::string_view end) {
    if (!Literal(key)) {
      value.reset();
      return true;
    }
    return Value(value.emplace()) && Literal(end);
  }
};

// Layout is the record's text, field by field; |event| is an Event, const
// for the Writer. The content's first key tells the event's kind, and a
// verdict's fields follow it.
template <class Io, class E>
bool Layout(Io& io, E& event) {
  if (!(io.Literal("{\"recnum\":") && io.Value(event.recnum) && io.Literal(",\"pcr\":") &&
        io.Value(event.pcr) && io.Literal(",\"digests\":[{\"hashAlg\":\"sha256\",\"digest\":\"") &&
        io.Value(event.digest) && io.Literal("\"}],\"content_type\":\"keymgr\",\"content\":") &&
        io.Value(event.kind))) {
    return false;
  }
  if (event.kind == EventKind::kSeparator) {
    return io.Literal("proof\"}}");
  }
  return io.Value(event.verdict) && io.Literal("\"") &&
         io.Field(",\"manifest_sha256\":\"", event.manifestSha256, "\"") &&
         io.Field(",\"digests_sha256\":\"", event.digestsSha256, "\"") &&
         io.Field(",\"release\":", event.release, "") && io.Literal("}}");
}

}  // namespace

Event VerdictEvent(std::uint32_t recnum, std::uint32_t pcr, Verdict verdict) {
  Event event;
  event.recnum = recnum;
  event.pcr = pcr;
  event.digest = VerdictDigest(verdict);
  event.verdict = verdict;
  return event;
}

Event SeparatorEvent(std::uint32_t recnum, std::uint32_t pcr) {
  Event event;
  event.recnum = recnum;
  event.pcr = pcr;
  event.digest = SeparatorDigest();
  event.kind = EventKind::kSeparator;
  return event;
}

std::size_t EncodeEvent(const Event& event, std::span<char> line) {
  Writer out{line};
  return Layout(out, event) ? out.used : 0;
}

Status DecodeEvent(std::string_view line, Event* event) {
  Event read;
  Reader in{line};
  // What the reader takes in other forms than the writer's (leading zeros,
  // upper-case digits) does not encode back to the line.
  std::array<char, kEventLineSize> again{};
  if (!Layout(in, read) || !in.rest.empty() ||
      std::string_view(again.data(), EncodeEvent(read, again)) != line) {
    return Refused("event log record");
  }
  *event = read;
  return Status();
}

}  // namespace keymgr::verdict
