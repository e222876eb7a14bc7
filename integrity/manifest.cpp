#include "integrity/manifest.h"

#include <array>
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <span>

#include "cli/boot_status.h"
#include "util/atomic_file.h"
#include "util/debug_print.h"
#include "util/file_digest.h"
#include "util/paths.h"
#include "util/secure.h"

namespace {

using keymgr::File;
using keymgr::kFileDigestSize;
using Digest = std::array<std::uint8_t, kFileDigestSize>;
using EntryBuffer = std::array<char, keymgr::kPathBufferSize>;

// The widest entry the path buffer can hold with its terminator.
static_assert(keymgr::kPathBufferSize == 100, "the entry format below reads 99 characters");
constexpr char kEntryFormat[] = "%99s";

enum class EntryRead { kEntry, kEnd, kTooLong };

// ReadEntry reads the next white-space separated manifest entry. An entry
// that does not fit the path buffer is reported, consumed to its end and
// returned as too long, which fails it like an entry that cannot be hashed.
EntryRead ReadEntry(std::FILE* manifest, EntryBuffer& entry) {
  if (std::fscanf(manifest, kEntryFormat, entry.data()) != 1) {
    return EntryRead::kEnd;
  }
  int next = std::getc(manifest);
  if (next == EOF || std::isspace(next)) {
    return EntryRead::kEntry;
  }
  while (next != EOF && !std::isspace(next)) {
    next = std::getc(manifest);
  }
  DebugPrint("file[%.40s...] name too long!!\n", entry.data());
  return EntryRead::kTooLong;
}

// HashEntry computes the digest of one entry and prints the failure line.
bool HashEntry(const EntryBuffer& entry, Digest& digest) {
  switch (keymgr::ComputeFileDigest(entry.data(), digest)) {
    case keymgr::FileDigestResult::kOk:
      return true;
    case keymgr::FileDigestResult::kStatusFailure:
      DebugPrint("file[%s] status error!!\n", entry.data());
      return false;
    case keymgr::FileDigestResult::kOpenFailure:
      DebugPrint("file[%s] open error!!\n", entry.data());
      return false;
  }
  return false;
}

// ReadRecord reads the next digest record. Missing bytes stay zero, so a
// short digest file fails the comparison instead of being reported.
void ReadRecord(std::FILE* digests, Digest& record) {
  record.fill(0);
  std::size_t got = std::fread(record.data(), 1, record.size(), digests);
  (void)got;
}

void PrintDigest(const char* label, const Digest& digest) {
  DebugPrint("%s", label);
  for (std::uint8_t byte : digest) {
    DebugPrint("%02X ", byte);
  }
  DebugPrint("\n");
}

void PrintOutcome(const EntryBuffer& entry, bool matches) {
  if (matches) {
    DebugPrint("[%s] has integrity!!\n\n", entry.data());
  } else {
    DebugPrint("[%s] is corrupted!!\n\n", entry.data());
  }
}

bool SameDigest(const Digest& a, const Digest& b) {
  return std::memcmp(a.data(), b.data(), kFileDigestSize) == 0;
}

void PrintOpenError(const char* path) {
  DebugPrint("%s open error!!!\n", path);
}

// OpenManifest opens the manifest, printing its open error on failure.
File OpenManifest() {
  File manifest = keymgr::OpenFile(keymgr::kManifestPath, "r");
  if (!manifest) {
    PrintOpenError(keymgr::kManifestPath);
  }
  return manifest;
}

// OpenBoth opens the digest file for reading, then the manifest, and prints
// the open error of the one that failed.
bool OpenBoth(File& digests, File& manifest) {
  digests = keymgr::OpenFile(keymgr::kDigestFilePath, "r");
  if (!digests) {
    PrintOpenError(keymgr::kDigestFilePath);
    return false;
  }
  manifest = OpenManifest();
  if (!manifest) {
    digests.reset();
    return false;
  }
  return true;
}

// CloseBoth closes the digest file first, then the manifest.
void CloseBoth(File& digests, File& manifest) {
  digests.reset();
  manifest.reset();
}

}  // namespace

int HashManifest() {
  EntryBuffer entry{};
  // The new digest file is built aside and replaces the old one whole at the
  // end, so a run killed part way leaves the old file intact. Its end states
  // stay those of a file truncated first: empty when the manifest is missing,
  // the records before a failed entry otherwise.
  keymgr::AtomicFile digests;
  if (!digests.Open(keymgr::kDigestFilePath, keymgr::kDigestFileMode)) {
    PrintOpenError(keymgr::kDigestFilePath);
    return 1;
  }
  File manifest = OpenManifest();
  int result = manifest ? 0 : 1;
  while (manifest && ReadEntry(manifest.get(), entry) == EntryRead::kEntry) {
    Digest digest{};
    if (!HashEntry(entry, digest)) {
      break;
    }
    digests.Write(digest.data(), digest.size());
    entry.fill(0);
  }
  // A digest file that cannot be put in place fails like one that cannot be
  // opened.
  if (!digests.Commit()) {
    PrintOpenError(keymgr::kDigestFilePath);
    result = 1;
  }
  return result;
}

void VerifyManifestFile(const char* path) {
  EntryBuffer entry{};
  if (path == nullptr) {
    return;
  }
  File digests;
  File manifest;
  if (!OpenBoth(digests, manifest)) {
    return;
  }
  while (ReadEntry(manifest.get(), entry) == EntryRead::kEntry) {
    if (std::strcmp(entry.data(), path) != 0) {
      // Skip this entry's record to stay in step with the manifest.
      Digest skipped{};
      ReadRecord(digests.get(), skipped);
      continue;
    }
    Digest digest{};
    if (!HashEntry(entry, digest)) {
      break;
    }
    PrintDigest("md_sha: ", digest);
    Digest record{};
    ReadRecord(digests.get(), record);
    PrintDigest("rd_sha: ", record);
    PrintOutcome(entry, SameDigest(digest, record));
    break;
  }
  CloseBoth(digests, manifest);
}

int VerifyManifest(int verbose) {
  int failed = 0;
  EntryBuffer entry{};
  File digests;
  File manifest;
  if (!OpenBoth(digests, manifest)) {
    WriteBootStatus(kBootStatusBnFail);
    return 1;
  }
  EntryRead read = EntryRead::kEnd;
  while ((read = ReadEntry(manifest.get(), entry)) == EntryRead::kEntry) {
    // Failures to hash are reported whatever the verbose flag.
    Digest digest{};
    if (!HashEntry(entry, digest)) {
      failed = 1;
      break;
    }
    if (verbose == 1) {
      PrintDigest("md_sha: ", digest);
    }
    Digest record{};
    ReadRecord(digests.get(), record);
    if (verbose == 1) {
      PrintDigest("rd_sha: ", record);
    }
    const bool matches = SameDigest(digest, record);
    if (verbose == 1) {
      PrintOutcome(entry, matches);
    }
    if (!matches) {
      failed = 1;
      break;
    }
    entry.fill(0);
  }
  if (read == EntryRead::kTooLong) {
    failed = 1;
  }
  CloseBoth(digests, manifest);
  // The outcome travels only in the status line; the result says whether the
  // files could be opened.
  WriteBootStatus(failed != 0 ? kBootStatusBnFail : kBootStatusBnOk);
  return 0;
}
