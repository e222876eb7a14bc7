// keymgr-eventlog: a verifier's reading of keymgr's event log.
//   keymgr-eventlog LOG [--expect HEX]
// Prints each record of LOG (the TCG canonical event log's JSON form, one
// record a line) with its verdict, and the value of each PCR that the
// records replay to from a PCR reset to zeros. Exits 1 when a record is not
// one of keymgr's, when its digest is not its verdict's, or when the replayed
// PCR (the log's one PCR) is not HEX, the value a quote gave.
#include <array>
#include <cctype>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>

#include "util/hex.h"
#include "util/owned.h"
#include "verdict/verdict.h"

namespace {

using keymgr::verdict::PcrValue;
using keymgr::verdict::Verdict;

int Fail(const std::string& what) {
  (void)std::fprintf(stderr, "keymgr-eventlog: %s\n", what.c_str());
  return 1;
}

std::string Hex(const PcrValue& value) {
  return keymgr::HexText(value, keymgr::HexCase::kLower).data();
}

// Field returns the text of |name|'s value in |line|: up to the next quote
// for a string, else up to the next comma or brace.
std::string Field(const std::string& line, const char* name) {
  const std::string key = std::string("\"") + name + "\":";
  const std::size_t at = line.find(key);
  if (at == std::string::npos) {
    return "";
  }
  const std::size_t start = at + key.size() + (line[at + key.size()] == '"' ? 1 : 0);
  return line.substr(start,
                     line.find_first_of(line[start - 1] == '"' ? "\"" : ",}", start) - start);
}

// ReadRecord reads one record's PCR, digest and verdict; false for a line
// that is not a record of keymgr's.
bool ReadRecord(const std::string& line, unsigned* pcr, PcrValue* digest, std::string* verdict) {
  const std::string index = Field(line, "pcr");
  const std::string hex = Field(line, "digest");
  *verdict = Field(line, "verdict");
  char* end = nullptr;
  *pcr = static_cast<unsigned>(std::strtoul(index.c_str(), &end, 10));
  return !index.empty() && *end == '\0' && *pcr <= 23 && Field(line, "hashAlg") == "sha256" &&
         Field(line, "content_type") == "keymgr" && keymgr::HexDecode(hex, *digest);
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
    const std::string line(buffer.data(), std::strcspn(buffer.data(), "\n"));
    unsigned pcr = 0;
    PcrValue digest{};
    std::string verdict;
    if (!ReadRecord(line, &pcr, &digest, &verdict)) {
      return Fail("line " + std::to_string(number) + " is not a record of keymgr's");
    }
    // The digest is the verdict's: content that says otherwise was edited.
    bool named = false;
    for (Verdict v : {Verdict::kOk, Verdict::kFail, Verdict::kNone}) {
      named = named || (verdict == keymgr::verdict::VerdictName(v) &&
                        digest == keymgr::verdict::VerdictDigest(v));
    }
    if (!named) {
      return Fail("line " + std::to_string(number) + ": the digest is not that of its verdict");
    }
    std::printf("%d pcr %u sha256:%s %s\n", number - 1, pcr, Hex(digest).c_str(), verdict.c_str());
    pcrs[pcr] = keymgr::verdict::Extended(pcrs[pcr], digest);
  }
  for (const auto& [pcr, value] : pcrs) {
    std::printf("pcr %u replays to sha256:%s\n", pcr, Hex(value).c_str());
  }
  if (argc == 4) {
    std::string expect = argv[3];
    expect = expect.starts_with("0x") || expect.starts_with("0X") ? expect.substr(2) : expect;
    for (char& c : expect) {
      c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
    if (pcrs.size() != 1 || Hex(pcrs.begin()->second) != expect) {
      return Fail("the log does not replay to " + std::string(argv[3]));
    }
  }
  return 0;
}
