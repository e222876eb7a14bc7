// keymgr-eventlog takes one boot's log of one PCR: its verdict, then at most
// the separator. 0: such a log (that replays to the quoted value); 1: one of
// another PCR than the quoted, or that replays to another value; 2: any
// other log, or wrong arguments.
#include <gtest/gtest.h>

#include <array>

#include "support/sandbox.h"
#include "verdict/event_log.h"

namespace {

namespace t = keymgr::test;
using namespace keymgr::verdict;

std::string Line(const Event& event) {
  std::array<char, kEventLineSize> line{};
  return std::string(line.data(), EncodeEvent(event, line)) + "\n";
}

std::string Digest(const Event& event) {
  return {event.digest.begin(), event.digest.end()};
}

// Extend is a PCR at |pcr| extended with |event|'s digest, by OpenSSL's
// one-shot call.
std::string Extend(const std::string& pcr, const Event& event) {
  return t::Sha256(pcr + Digest(event));
}

TEST(Eventlog, ReplaysOneBootOfOnePcr) {
  const Event ok = VerdictEvent(0, 14, Verdict::kOk), fail = VerdictEvent(0, 14, Verdict::kFail);
  const Event separator = SeparatorEvent(1, 14);
  const std::string zeros(32, '\0'), booted = Extend(zeros, ok);
  const std::string good = t::LowerHex(Extend(booted, separator)), okOnly = t::LowerHex(booted);
  Event edited = ok, stamped = separator;
  edited.digest = fail.digest;
  stamped.digest = ok.digest;
  std::string wide = Line(ok);
  wide.replace(wide.find("\"pcr\":14"), 8, "\"pcr\":4294967310");
  const struct {
    const char* name;
    std::string log;
    std::vector<std::string> args;
    int status;
  } rows[] = {
      // clang-format off
      {"verdict and separator", Line(ok) + Line(separator), {"--pcr", "14", "--expect", good}, 0},
      {"the verdict alone, 0x", Line(ok), {"--pcr", "14", "--expect", "0x" + okOnly}, 0},
      {"no value to match", Line(fail) + Line(separator), {}, 0},
      {"another value", Line(ok), {"--pcr", "14", "--expect", good}, 1},
      {"a log of another PCR", Line(ok) + Line(separator), {"--pcr", "15", "--expect", good}, 1},
      {"two verdicts", Line(fail) + Line(VerdictEvent(1, 14, Verdict::kOk)), {"--pcr", "14", "--expect", t::LowerHex(Extend(Extend(zeros, fail), ok))}, 2},
      {"separator first", Line(SeparatorEvent(0, 14)) + Line(VerdictEvent(1, 14, Verdict::kOk)), {}, 2},
      {"two separators", Line(ok) + Line(separator) + Line(SeparatorEvent(2, 14)), {}, 2},
      {"recnums out of order", Line(VerdictEvent(1, 14, Verdict::kOk)), {}, 2},
      {"records of two PCRs", Line(ok) + Line(SeparatorEvent(1, 15)), {}, 2},
      {"a verdict's digest not its own", Line(edited), {}, 2},
      {"a separator with a verdict's digest", Line(ok) + Line(stamped), {}, 2},
      {"PCR 24", Line(VerdictEvent(0, 24, Verdict::kOk)), {}, 2},
      {"PCR 14 + 2^32", wide, {}, 2},
      {"a NUL byte in a record's line", Line(ok).substr(0, Line(ok).size() - 1) + std::string("\0x\n", 3), {}, 2},
      {"no record", "", {}, 2},
      {"--expect without --pcr", Line(ok), {"--expect", okOnly}, 2},
      {"--pcr 24", Line(ok), {"--pcr", "24"}, 2},
      // clang-format on
  };
  const std::string log = t::InRoot("/events");
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    t::WriteFile(log, row.log);
    std::vector<std::string> argv = {KEYMGR_TEST_EVENTLOG_BIN, log};
    argv.insert(argv.end(), row.args.begin(), row.args.end());
    const auto run = t::Run(argv);
    EXPECT_EQ(run.status, row.status) << run.err;
    if (&row == rows) {
      EXPECT_EQ(run.out, "0 pcr 14 sha256:" + t::LowerHex(Digest(ok)) +
                             " BN=OK\n1 pcr 14 sha256:" + t::LowerHex(Digest(separator)) +
                             " separator\npcr 14 replays to sha256:" + good + "\n");
    }
  }
}

}  // namespace
