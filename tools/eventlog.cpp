// keymgr-eventlog: a verifier's reading of keymgr's event log.
//   keymgr-eventlog LOG [--expect HEX]
// Prints each record of LOG (the TCG canonical event log's JSON form, one
// record a line) with its verdict, and the value of each PCR that the
// records replay to from a PCR reset to zeros. Exits 1 when a record is not
// one of keymgr's, when its digest is not its verdict's, or when the replayed
// PCR (the log's one PCR) is not HEX, the value a quote gave.
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <string_view>

#include "util/hex.h"
#include "util/owned.h"
#include "verdict/event_log.h"

namespace {

using keymgr::verdict::PcrValue;

int Fail(const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-eventlog: %s\n", what.c_str());
  return 1;
}

std::string Hex(const PcrValue& value) {
  return keymgr::HexText(value, keymgr::HexCase::kLower).data();
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2 && !(argc == 4 && std::strcmp(argv[2], "--expect") == 0)) {
    (void)std::fprintf(stderr, "usage: keymgr-eventlog LOG [--expect HEX]\n");
    return 2;
  }
  const keymgr::File log(std::fopen(argv[1], "r"));
  if (!log) {
    return Fail(std::string(argv[1]) + ": " + std::strerror(errno));
  }
  std::map<unsigned, PcrValue> pcrs;
  std::array<char, 4096> buffer{};
  for (int number = 1; std::fgets(buffer.data(), buffer.size(), log.get()) != nullptr; ++number) {
    const std::string_view line(buffer.data(), std::strcspn(buffer.data(), "\n"));
    keymgr::verdict::Event event;
    if (!keymgr::verdict::DecodeEvent(line, &event).ok() || event.pcr > 23) {
      return Fail("line " + std::to_string(number) + " is not a record of keymgr's");
    }
    // The digest is the verdict's: content that says otherwise was edited.
    if (event.digest != keymgr::verdict::VerdictDigest(event.verdict)) {
      return Fail("line " + std::to_string(number) + ": the digest is not that of its verdict");
    }
    std::printf("%d pcr %u sha256:%s %s\n", number - 1, event.pcr, Hex(event.digest).c_str(),
                keymgr::verdict::VerdictName(event.verdict));
    pcrs[event.pcr] = keymgr::verdict::Extended(pcrs[event.pcr], event.digest);
  }
  for (const auto& [pcr, value] : pcrs) {
    std::printf("pcr %u replays to sha256:%s\n", pcr, Hex(value).c_str());
  }
  if (argc == 4) {
    std::string_view expect = argv[3];
    if (expect.starts_with("0x") || expect.starts_with("0X")) {
      expect.remove_prefix(2);
    }
    PcrValue value{};
    if (pcrs.size() != 1 || !keymgr::HexDecode(expect, value) || value != pcrs.begin()->second) {
      return Fail("the log does not replay to " + std::string(argv[3]));
    }
  }
  return 0;
}
