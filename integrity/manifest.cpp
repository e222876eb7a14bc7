#include "integrity/manifest.h"

#include <cstdint>
#include <cstdio>
#include <cstring>

#include "bootlog/boot_status.h"
#include "integrity/internal.h"
#include "util/atomic_file.h"
#include "util/bytes.h"
#include "util/debug_print.h"

namespace {

using keymgr::File;
using namespace keymgr::integrity;

void PrintOpenError(const char* path) {
  DebugPrint("%s open error!!!\n", path);
}

void PrintTooLong(const EntryBuffer& entry) {
  DebugPrint("file[%.40s...] name too long!!\n", entry.data());
}

// PrintHashFailure prints the line of a failed hash; returns whether
// |result| is a success.
bool PrintHashFailure(const keymgr::HashResult& result, const EntryBuffer& entry) {
  if (!result.ok()) {
    DebugPrint(result.failure == keymgr::HashResult::kStat ? "file[%s] status error!!\n"
                                                           : "file[%s] open error!!\n",
               entry.data());
  }
  return result.ok();
}

// How a pass over the manifest ended.
enum Outcome {
  kAllPassed = 0,
  kEntryFailed = 1,  // an entry failed: BN=FAIL
  kUnreadable = 2,   // the manifest or the digest file could not be read on
};

// PrintEntryFailure prints the line of an entry that cannot be hashed, and
// says how the pass ends.
Outcome PrintEntryFailure(EntryRead read, const EntryBuffer& entry) {
  switch (read) {
    case EntryRead::kTooLong:
      PrintTooLong(entry);
      return kEntryFailed;
    case EntryRead::kNul:
      DebugPrint("file[%s] open error!!\n", entry.data());
      return kEntryFailed;
    case EntryRead::kReadError:
      PrintOpenError(keymgr::kManifestPath);
      return kUnreadable;
    case EntryRead::kEntry:
    case EntryRead::kEnd:
      break;
  }
  return kAllPassed;
}

// NextHashed returns the next entry with its digest, or null at the end of
// the manifest or at the first entry that fails, whose line it prints and
// which sets |outcome|.
const HashedEntry* NextHashed(HashAhead& ahead, Outcome& outcome) {
  const HashedEntry& hashed = ahead.Next();
  if (hashed.read != EntryRead::kEntry) {
    outcome = PrintEntryFailure(hashed.read, hashed.entry);
    return nullptr;
  }
  if (!PrintHashFailure(hashed.result, hashed.entry)) {
    outcome = kEntryFailed;
    return nullptr;
  }
  return &hashed;
}

// ReadRecord reads the next digest record. Missing bytes stay zero, so a
// short digest file fails the comparison instead of being reported; a file
// that cannot be read is reported and returns false.
bool ReadRecord(std::FILE* digests, Digest& record) {
  record.fill(0);
  const std::size_t got = std::fread(record.data(), 1, record.size(), digests);
  (void)got;
  if (std::ferror(digests)) {
    PrintOpenError(keymgr::kDigestFilePath);
    return false;
  }
  return true;
}

void PrintDigest(const char* label, const Digest& digest) {
  DebugPrint("%s", label);
  PrintHexDump(digest.data(), digest.size(), 0);
}

void PrintOutcome(const EntryBuffer& entry, bool matches) {
  if (matches) {
    DebugPrint("[%s] has integrity!!\n\n", entry.data());
  } else {
    DebugPrint("[%s] is corrupted!!\n\n", entry.data());
  }
}

bool SameDigest(const Digest& a, const Digest& b) {
  return std::memcmp(a.data(), b.data(), a.size()) == 0;
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
#if KEYMGR_SIGNED_BUILD
  // keymgr-mkdigest makes and signs the digest file; the device holds no
  // key to sign one, so a digest file made here could only fail the boot.
  DebugPrint("hash is done on the build host in a signed build!!!\n");
  return kHashRefused;
#endif
  // The new digest file is built aside and replaces the old one whole at the
  // end, so a run killed part way leaves the old file intact. Its end states
  // stay those of a file truncated first: empty when the manifest is missing,
  // the records before a failed entry otherwise.
  keymgr::AtomicFile digests;
  if (!digests.Open(keymgr::kDigestFilePath, keymgr::kDigestFileMode).ok()) {
    PrintOpenError(keymgr::kDigestFilePath);
    return 1;
  }
  File manifest = OpenManifest();
  int result = manifest ? 0 : 1;
  if (manifest) {
    HashAhead ahead(manifest.get());
    Outcome outcome = kAllPassed;
    while (const HashedEntry* job = NextHashed(ahead, outcome)) {
      digests.Write(job->digest.data(), job->digest.size());
    }
    // Records of part of a manifest that could not be read are not put in
    // place: the old digest file stays.
    if (outcome == kUnreadable) {
      return 1;
    }
  }
  // A digest file that cannot be put in place fails like one that cannot be
  // opened.
  if (!digests.Commit().ok()) {
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
  SignedFiles held;
  File digests;
  File manifest;
  BootCheck unheld;  // one file's check holds no release floor
  if (!OpenBoth(digests, manifest) || !CheckSigned(held, digests, manifest, false, &unheld)) {
    return;
  }
  EntryRead read = EntryRead::kEnd;
  while ((read = ReadEntry(manifest.get(), entry)) == EntryRead::kEntry) {
    // Every entry before the match skips its record, to stay in step.
    Digest record{};
    if (std::strcmp(entry.data(), path) != 0) {
      if (!ReadRecord(digests.get(), record)) {
        break;
      }
      continue;
    }
    Digest digest{};
    if (!PrintHashFailure(keymgr::ComputeFileDigest(entry.data(), digest), entry)) {
      break;
    }
    PrintDigest("md_sha: ", digest);
    if (!ReadRecord(digests.get(), record)) {
      break;
    }
    PrintDigest("rd_sha: ", record);
    PrintOutcome(entry, SameDigest(digest, record));
    break;
  }
  (void)PrintEntryFailure(read, entry);
  CloseBoth(digests, manifest);
}

int VerifyManifest(int verbose) {
  keymgr::integrity::BootCheck check;
  return VerifyManifestChecked(verbose, &check);
}

int VerifyManifestChecked(int verbose, keymgr::integrity::BootCheck* check) {
  using keymgr::verdict::Verdict;
  Outcome outcome = kAllPassed;
  SignedFiles held;  // outlives the streams that may read its bytes
  File digests;
  File manifest;
  if (!OpenBoth(digests, manifest) || !CheckSigned(held, digests, manifest, verbose == 1, check)) {
    CloseBoth(digests, manifest);
    WriteBootStatus(kBootStatusBnFail);
    check->verdict = Verdict::kFail;
    return 1;
  }
  {
    // Every worker has stopped at the end of this block, before the manifest
    // is closed. Failures to hash are reported whatever the verbose flag.
    HashAhead ahead(manifest.get());
    while (const HashedEntry* job = NextHashed(ahead, outcome)) {
      if (verbose == 1) {
        PrintDigest("md_sha: ", job->digest);
      }
      Digest record{};
      if (!ReadRecord(digests.get(), record)) {
        outcome = kUnreadable;
        break;
      }
      if (verbose == 1) {
        PrintDigest("rd_sha: ", record);
      }
      const bool matches = SameDigest(job->digest, record);
      if (verbose == 1) {
        PrintOutcome(job->entry, matches);
      }
      if (!matches) {
        outcome = kEntryFailed;
        break;
      }
    }
  }
  CloseBoth(digests, manifest);
  // The outcome travels only in the status line; the result says whether the
  // files could be opened and read.
  WriteBootStatus(outcome != kAllPassed ? kBootStatusBnFail : kBootStatusBnOk);
  check->verdict = outcome != kAllPassed ? Verdict::kFail : Verdict::kOk;
  return outcome == kUnreadable ? 1 : 0;
}
