// The manifest and digest-file reader. The input picks up to four data files
// and a manifest, either raw bytes or entries the harness lays out itself
// (the data files, missing and directory names, names too long for the path
// buffer, names with a NUL byte, with any white space between). The harness
// then builds the digest file, maybe damages it, and verifies. Entries are
// names in a scratch folder, so nothing outside it is read. For laid-out
// manifests the records and the BN line must be those of a model: the
// digests of the leading entries that can be hashed, and BN=OK only for an
// undamaged digest file and a manifest with no failing entry. For any
// manifest, the verbose and quiet runs agree.
#include <fuzzer/FuzzedDataProvider.h>
#include <openssl/sha.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "bootlog/boot_status.h"
#include "integrity/manifest.h"
#include "util/paths.h"

namespace {

namespace fs = std::filesystem;
using namespace keymgr;

constexpr std::size_t kDataFiles = 4;
// Large enough for a file to take more than one read and reach the threads
// that hash ahead.
constexpr std::size_t kMaxDataSize = 300 * 1024;
constexpr std::size_t kMaxEntries = 40;
constexpr char kSpaces[] = " \t\n\v\f\r";

std::string Read(const char* path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

void Write(const std::string& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary | std::ios::trunc)
      .write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
}

std::string Sha256(const std::string& bytes) {
  std::array<unsigned char, SHA256_DIGEST_LENGTH> digest{};
  SHA256(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(), digest.data());
  return {reinterpret_cast<const char*>(digest.data()), digest.size()};
}

// Verify runs the boot check and returns its result and whether it logged
// BN=OK.
std::pair<int, bool> Verify(int verbose) {
  std::remove(kBootLogPath);
  const int result = VerifyManifest(verbose);
  const std::string log = Read(kBootLogPath);
  if (log != "BN=OK\n" && log != "BN=FAIL\n") {
    std::abort();
  }
  return {result, log == "BN=OK\n"};
}

// Model is what a laid-out manifest must give: the records written, and
// whether every entry can be hashed.
struct Model {
  std::string records;
  bool allHashed = true;
};

// LayOut writes a manifest of entries chosen by |in| and returns its model.
std::string LayOut(FuzzedDataProvider& in, const std::array<std::string, kDataFiles>& data,
                   Model& model) {
  std::string text;
  const std::size_t count = in.ConsumeIntegralInRange<std::size_t>(0, kMaxEntries);
  for (std::size_t i = 0; i < count; ++i) {
    text.append(in.ConsumeIntegralInRange<std::size_t>(i == 0 ? 0 : 1, 3),
                kSpaces[in.ConsumeIntegralInRange<std::size_t>(0, sizeof(kSpaces) - 2)]);
    std::string entry;
    bool hashed = false;
    switch (in.ConsumeIntegralInRange(0, 5)) {
      case 0:
      case 1: {
        const std::size_t file = in.ConsumeIntegralInRange<std::size_t>(0, kDataFiles - 1);
        entry = "f" + std::to_string(file);
        hashed = true;
        if (model.allHashed) {
          model.records += Sha256(data[file]);
        }
        break;
      }
      case 2:
        entry = "missing";
        break;
      case 3:
        entry = "dir";
        break;
      case 4:  // 99 characters fit the path buffer, 100 or more do not
        entry = std::string(in.ConsumeIntegralInRange<std::size_t>(99, 120), 'n');
        break;
      default:
        entry = std::string("f0\0x", 4).substr(0, in.ConsumeIntegralInRange<std::size_t>(3, 4));
        break;
    }
    model.allHashed = model.allHashed && hashed;
    text += entry;
  }
  text.append(in.ConsumeIntegralInRange<std::size_t>(0, 2), '\n');
  return text;
}

// Scratch is the folder the manifest's names are read in.
fs::path Scratch() {
  return fs::path(kManifestPath).parent_path().parent_path() / "fuzz-files";
}

// InScratch makes the scratch folder the working one for a run and restores
// libFuzzer's, which resolves its corpus and artifact paths, afterwards.
struct InScratch {
  InScratch() : home(fs::current_path()) { fs::current_path(Scratch()); }
  ~InScratch() { fs::current_path(home); }
  fs::path home;
};

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fs::create_directories(fs::path(kManifestPath).parent_path());
  fs::create_directories(fs::path(kBootLogPath).parent_path());
  fs::create_directories(Scratch() / "dir");
  // The verbose runs print every digest; only the checks below matter.
  return std::freopen("/dev/null", "w", stdout) != nullptr ? 0 : 1;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* input, std::size_t size) {
  FuzzedDataProvider in(input, size);
  const InScratch scratch;
  std::array<std::string, kDataFiles> data;
  for (std::size_t i = 0; i < kDataFiles; ++i) {
    if (in.ConsumeBool()) {
      data[i].assign(in.ConsumeIntegralInRange<std::size_t>(0, kMaxDataSize),
                     static_cast<char>(in.ConsumeIntegral<std::uint8_t>()));
    } else {
      data[i] = in.ConsumeRandomLengthString(64);
    }
    Write("f" + std::to_string(i), data[i]);
  }
  const bool laidOut = in.ConsumeBool();
  Model model;
  const std::string manifest = laidOut ? LayOut(in, data, model) : in.ConsumeRandomLengthString();
  // Raw manifests name only files in the scratch folder.
  if (manifest.find('/') != std::string::npos) {
    return 0;
  }
  Write(kManifestPath, manifest);
  std::remove(kDigestFilePath);
  if (HashManifest() != 0) {
    std::abort();
  }
  std::string records = Read(kDigestFilePath);
  if (laidOut && records != model.records) {
    std::abort();
  }
  // Damage: one byte changed, or the file cut short.
  const int damage = in.ConsumeIntegralInRange(0, 2);
  if (damage != 0 && !records.empty()) {
    const std::size_t at = in.ConsumeIntegralInRange<std::size_t>(0, records.size() - 1);
    if (damage == 1) {
      records[at] = static_cast<char>(records[at] ^ (in.ConsumeIntegral<std::uint8_t>() | 1));
    } else {
      records.resize(at);
    }
    Write(kDigestFilePath, records);
  }
  const bool damaged = damage != 0 && !model.records.empty();
  const auto quiet = Verify(0);
  if (Verify(1) != quiet || quiet.first != 0) {
    std::abort();
  }
  if (laidOut && quiet.second != (model.allHashed && !damaged)) {
    std::abort();
  }
  VerifyManifestFile(in.ConsumeRandomLengthString(8).c_str());
  return 0;
}
