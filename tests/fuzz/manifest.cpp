// The manifest and digest-file reader. The input picks up to four data files
// and a manifest, either raw bytes or entries the harness lays out itself
// (the data files, missing, directory and FIFO names, names too long for the
// path buffer, names with a NUL byte, with any white space between). The
// harness then builds the digest file, maybe damages it, and verifies. Entries
// are names in a scratch folder, so nothing outside it is read. For laid-out
// manifests the records and the BN line must be those of a model: the
// digests of the leading entries that can be hashed, and BN=OK only for an
// undamaged digest file and a manifest with no failing entry. For any
// manifest, the verbose and quiet runs log the same, and every run with one
// hashing thread prints, logs and writes what it does with four.
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>

#include "integrity/manifest.h"
#include "support/files.h"
#include "util/paths.h"

namespace {

namespace fs = std::filesystem;
using namespace keymgr;
using test::Require;

constexpr std::size_t kDataFiles = 4;
constexpr char kSpaces[] = " \t\n\v\f\r";

// The folder the manifest's names are read in, and the file standard output
// goes to.
const fs::path kScratch = fs::path(kManifestPath).parent_path().parent_path() / "fuzz-files";
const std::string kOutput = kScratch.parent_path() / "fuzz-output";

// Run runs |call| with |threads| hashing threads and returns its result,
// what it printed, the boot status log and the digest file.
using Outcome = std::array<std::string, 4>;
Outcome Run(int threads, int (*call)(int), int verbose = 0) {
  setenv("KEYMGR_HASH_THREADS", std::to_string(threads).c_str(), 1);
  std::remove(kBootLogPath);
  Require(std::fflush(stdout) == 0 && ftruncate(fileno(stdout), 0) == 0);
  std::rewind(stdout);
  const int result = call(verbose);
  std::fflush(stdout);
  return {std::to_string(result), test::ReadFile(kOutput).value_or(""),
          test::ReadFile(kBootLogPath).value_or(""), test::ReadFile(kDigestFilePath).value_or("")};
}
constexpr auto kHash = +[](int) { return HashManifest(); };

// LayOut writes a manifest of entries chosen by |in|, and sets |records| to
// the records it must give and |allHashed| to whether every entry hashes.
std::string LayOut(FuzzedDataProvider& in, const std::array<std::string, kDataFiles>& data,
                   std::string& records, bool& allHashed) {
  std::string text;
  const std::size_t count = in.ConsumeIntegralInRange<std::size_t>(0, 40);
  for (std::size_t i = 0; i < count; ++i) {
    text.append(in.ConsumeIntegralInRange<std::size_t>(i == 0 ? 0 : 1, 3),
                kSpaces[in.ConsumeIntegralInRange<std::size_t>(0, sizeof(kSpaces) - 2)]);
    const int kind = in.ConsumeIntegralInRange(0, 6);
    const std::size_t file = in.ConsumeIntegralInRange<std::size_t>(0, kDataFiles - 1);
    if (kind <= 1 && allHashed) {
      records += test::Sha256(data[file]);
    }
    allHashed = allHashed && kind <= 1;
    // 99 characters fit the path buffer, 100 or more do not.
    text += kind <= 1   ? "f" + std::to_string(file)
            : kind == 2 ? "missing"
            : kind == 3 ? "dir"
            : kind == 4 ? std::string(in.ConsumeIntegralInRange<std::size_t>(99, 120), 'n')
            : kind == 5 ? "fifo"
                        : std::string("f0\0x", in.ConsumeIntegralInRange<std::size_t>(3, 4));
  }
  return text.append(in.ConsumeIntegralInRange<std::size_t>(0, 2), '\n');
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fs::create_directories(fs::path(kManifestPath).parent_path());
  fs::create_directories(fs::path(kBootLogPath).parent_path());
  fs::create_directories(kScratch / "dir");
  mkfifo((kScratch / "fifo").c_str(), 0600);
  // What the runs print is compared through this file.
  return std::freopen(kOutput.c_str(), "w+", stdout) != nullptr ? 0 : 1;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* input, std::size_t size) {
  FuzzedDataProvider in(input, size);
  // The scratch folder is the working one for the run; libFuzzer's, which
  // resolves its corpus and artifact paths, is restored afterwards.
  const fs::path home = fs::current_path();
  fs::current_path(kScratch);
  std::array<std::string, kDataFiles> data;
  for (std::size_t i = 0; i < kDataFiles; ++i) {
    // Large enough for a file to take more than one read and reach the
    // threads that hash ahead.
    data[i] = in.ConsumeBool() ? std::string(in.ConsumeIntegralInRange<std::size_t>(0, 300 * 1024),
                                             static_cast<char>(in.ConsumeIntegral<std::uint8_t>()))
                               : in.ConsumeRandomLengthString(64);
    test::WriteFile("f" + std::to_string(i), data[i]);
  }
  const bool laidOut = in.ConsumeBool();
  std::string model;
  bool allHashed = true;
  const std::string manifest =
      laidOut ? LayOut(in, data, model, allHashed) : in.ConsumeRandomLengthString();
  // Raw manifests name only files in the scratch folder.
  if (manifest.find('/') == std::string::npos) {
    test::WriteFile(kManifestPath, manifest);
    std::remove(kDigestFilePath);
    const Outcome hashed = Run(1, kHash);
    Require(hashed[0] == "0" && Run(4, kHash) == hashed);
    std::string records = test::ReadFile(kDigestFilePath).value_or("");
    Require(!laidOut || records == model);
    // Damage: one byte changed, or the file cut short.
    const int damage = in.ConsumeIntegralInRange(0, 2);
    if (damage != 0 && !records.empty()) {
      const std::size_t at = in.ConsumeIntegralInRange<std::size_t>(0, records.size() - 1);
      if (damage == 1) {
        records[at] = static_cast<char>(records[at] ^ (in.ConsumeIntegral<std::uint8_t>() | 1));
      } else {
        records.resize(at);
      }
      test::WriteFile(kDigestFilePath, records);
    }
    const Outcome quiet = Run(1, VerifyManifest), verbose = Run(1, VerifyManifest, 1);
    Require(Run(4, VerifyManifest) == quiet && Run(4, VerifyManifest, 1) == verbose);
    Require(quiet[0] == "0" && (quiet[2] == "BN=OK\n" || quiet[2] == "BN=FAIL\n") &&
            verbose[2] == quiet[2] && quiet[3] == records);
    Require(!laidOut || (quiet[2] == "BN=OK\n") == (allHashed && (damage == 0 || model.empty())));
    VerifyManifestFile(in.ConsumeRandomLengthString(8).c_str());
  }
  fs::current_path(home);
  return 0;
}
