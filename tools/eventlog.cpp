// keymgr-eventlog: a verifier's reading of keymgr's event log.
//   keymgr-eventlog LOG [--pcr N] [--expect HEX]
// Prints each record of LOG (the TCG canonical event log's JSON form, one
// record a line) and the value of its PCR that the records replay to from a
// PCR reset to zeros. A boot's log is its verdict event (record 0), then at
// most the separator (record 1), both in the one PCR; a verdict's digest is
// its verdict's, the separator's the separator's. Exits 0 when the log is
// such and, with --expect, replays to HEX, the value a quote of PCR N gave;
// 1 when it names another PCR than N or does not replay to HEX; 2 when it is
// not such a log or cannot be read, and for wrong arguments.
#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>

#include "util/hex.h"
#include "util/io.h"
#include "util/owned.h"
#include "verdict/event_log.h"

namespace {

using keymgr::verdict::EventKind;
using keymgr::verdict::PcrValue;

constexpr int kMismatch = 1;
constexpr int kMalformed = 2;
// The highest PCR index of a TPM's 24.
constexpr std::uint32_t kLastPcr = 23;

struct Args {
  const char* log = nullptr;
  std::optional<std::uint32_t> pcr;
  std::optional<PcrValue> expect;
};

int Fail(int status, const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-eventlog: %s\n", what.c_str());
  return status;
}

std::string Hex(const PcrValue& value) {
  return keymgr::HexText(value, keymgr::HexCase::kLower).data();
}

// ParseArgs reads LOG, then --pcr and --expect in any order; --expect needs
// --pcr: a quote's value is that of the PCR the verifier quoted, which the
// log must name.
bool ParseArgs(int argc, char** argv, Args& args) {
  if (argc < 2 || argc % 2 != 0) {
    return false;
  }
  args.log = argv[1];
  for (int i = 2; i < argc; i += 2) {
    std::string_view value = argv[i + 1];
    if (std::strcmp(argv[i], "--pcr") == 0 && !args.pcr) {
      std::uint32_t pcr = 0;
      const auto [end, error] = std::from_chars(value.data(), value.data() + value.size(), pcr);
      if (error != std::errc() || end != value.data() + value.size() || pcr > kLastPcr) {
        return false;
      }
      args.pcr = pcr;
    } else if (std::strcmp(argv[i], "--expect") == 0 && !args.expect) {
      if (value.starts_with("0x") || value.starts_with("0X")) {
        value.remove_prefix(2);
      }
      if (!keymgr::HexDecode(value, args.expect.emplace())) {
        return false;
      }
    } else {
      return false;
    }
  }
  return args.pcr || !args.expect;
}

}  // namespace

int main(int argc, char** argv) {
  Args args;
  if (!ParseArgs(argc, argv, args)) {
    (void)std::fprintf(stderr, "usage: keymgr-eventlog LOG [--pcr N [--expect HEX]]\n");
    return kMalformed;
  }
  // Read whole, so that a line is all its bytes, NULs included; a boot's log
  // is two records at most.
  const keymgr::File log(std::fopen(args.log, "r"));
  keymgr::HeapBytes bytes;
  std::size_t size = 0;
  if (!log ||
      !keymgr::ReadWhole(log.get(), 2 * (keymgr::verdict::kEventLineSize + 1), bytes, &size)) {
    return Fail(kMalformed, std::string(args.log) + ": " + std::strerror(errno));
  }
  std::string_view text(reinterpret_cast<const char*>(bytes.get()), size);
  std::optional<std::uint32_t> pcr;  // the log's
  PcrValue value{};
  for (std::uint32_t recnum = 0; !text.empty(); ++recnum) {
    const std::size_t end = std::min(text.find('\n'), text.size());
    const std::string_view record = text.substr(0, end);
    text.remove_prefix(std::min(end + 1, text.size()));
    const std::string line = "line " + std::to_string(recnum + 1);
    keymgr::verdict::Event event;
    if (!keymgr::verdict::DecodeEvent(record, &event).ok() || event.pcr > kLastPcr) {
      return Fail(kMalformed, line + " is not a record of keymgr's");
    }
    // One boot: its verdict, then at most the separator, numbered in turn.
    if (recnum > 1 || event.recnum != recnum ||
        event.kind != (recnum == 0 ? EventKind::kVerdict : EventKind::kSeparator)) {
      return Fail(kMalformed, line + ": a boot's log is its verdict, then at most the separator");
    }
    if (pcr.value_or(event.pcr) != event.pcr) {
      return Fail(kMalformed, line + ": the records name two PCRs");
    }
    pcr = event.pcr;
    // The digest is the content's: content that says otherwise was edited.
    const bool separator = event.kind == EventKind::kSeparator;
    if (event.digest != (separator ? keymgr::verdict::SeparatorDigest()
                                   : keymgr::verdict::VerdictDigest(event.verdict))) {
      return Fail(kMalformed, line + ": the digest is not that of its content");
    }
    std::printf("%u pcr %u sha256:%s %s\n", recnum, event.pcr, Hex(event.digest).c_str(),
                separator ? "separator" : keymgr::verdict::VerdictName(event.verdict));
    value = keymgr::verdict::Extended(value, event.digest);
  }
  if (!pcr) {
    return Fail(kMalformed, std::string(args.log) + ": holds no verdict");
  }
  std::printf("pcr %u replays to sha256:%s\n", *pcr, Hex(value).c_str());
  if (args.pcr && *args.pcr != *pcr) {
    return Fail(kMismatch,
                "the log is of pcr " + std::to_string(*pcr) + ", not " + std::to_string(*args.pcr));
  }
  if (args.expect && *args.expect != value) {
    return Fail(kMismatch, "the log does not replay to " + Hex(*args.expect));
  }
  return 0;
}
