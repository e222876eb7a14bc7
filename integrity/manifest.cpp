#include "integrity/manifest.h"

#include <pthread.h>
#include <sched.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <span>

#include "bootlog/boot_status.h"
#include "crypto/file_digest.h"
#include "util/atomic_file.h"
#include "util/debug_print.h"
#include "util/paths.h"
#include "util/secure.h"

namespace {

using keymgr::File;
using keymgr::kFileDigestSize;
using Digest = std::array<std::uint8_t, kFileDigestSize>;
using EntryBuffer = std::array<char, keymgr::kPathBufferSize>;

// The widest entry the path buffer can hold with its terminator.
static_assert(keymgr::kPathBufferSize == 100, "the entry format below reads 99 characters");
// White space, then an entry of up to 99 characters; the positions around
// the entry tell its length.
constexpr char kEntryFormat[] = " %n%99s%n";

enum class EntryRead {
  kEntry,
  kEnd,
  kTooLong,    // does not fit the path buffer
  kNul,        // holds a NUL byte, which would cut the path short
  kReadError,  // the manifest could not be read on
};

// ReadEntry reads the next white-space separated manifest entry. An entry
// that does not fit the path buffer is consumed to its end and returned as
// too long. Too long, one with a NUL byte and a read error each fail the
// run; none is taken for the end of the manifest. Nothing is printed here:
// entries are read ahead of their turn.
EntryRead ReadEntry(std::FILE* manifest, EntryBuffer& entry) {
  int start = 0;
  int end = 0;
  if (std::fscanf(manifest, kEntryFormat, &start, entry.data(), &end) != 1) {
    return std::ferror(manifest) ? EntryRead::kReadError : EntryRead::kEnd;
  }
  int next = std::getc(manifest);
  bool tooLong = false;
  while (next != EOF && !std::isspace(next)) {
    tooLong = true;
    next = std::getc(manifest);
  }
  if (std::ferror(manifest)) {
    return EntryRead::kReadError;
  }
  if (tooLong) {
    return EntryRead::kTooLong;
  }
  return std::strlen(entry.data()) == static_cast<std::size_t>(end - start) ? EntryRead::kEntry
                                                                            : EntryRead::kNul;
}

void PrintOpenError(const char* path) {
  DebugPrint("%s open error!!!\n", path);
}

void PrintTooLong(const EntryBuffer& entry) {
  DebugPrint("file[%.40s...] name too long!!\n", entry.data());
}

// PrintHashFailure prints the line of a failed hash; returns whether
// |status| is a success.
bool PrintHashFailure(const keymgr::Status& status, const EntryBuffer& entry) {
  if (!status.ok()) {
    DebugPrint(status.Is("stat") ? "file[%s] status error!!\n" : "file[%s] open error!!\n",
               entry.data());
  }
  return status.ok();
}

// --- Hashing ahead ------------------------------------------------------------
// The boot run and the hash command take the manifest's entries strictly in
// order. With more than one CPU the caller reads entries and opens their
// files up to kWindow entries ahead of the one it is on, and worker threads,
// one per CPU, hash the large ones among those files meanwhile. The caller
// hashes the small files itself (handing over a file that takes one read
// costs more than hashing it), and a large one that it reaches before any
// worker has. Only the caller prints, compares and writes, each entry in its
// turn, and it stops reading and opening at the first entry that fails, so a
// run shows and leaves what a one-at-a-time run does. With one CPU there is
// no worker and nothing is opened ahead.

// Beyond a few threads the storage, not the hashing, sets the pace.
constexpr unsigned kMaxHashThreads = 8;
// Files held open ahead of their turn.
constexpr std::size_t kWindow = 32;
// Below this limit on open files, a window of open files could crowd out
// the run's other files, and the files are hashed one at a time.
constexpr rlim_t kFilesForWindow = 4 * kWindow;

struct Job {
  EntryBuffer entry{};
  EntryRead read = EntryRead::kEnd;
  keymgr::Status result;
  keymgr::FileToHash file;
  Digest digest{};
  bool picked = false;  // someone hashes it
  bool done = false;    // hashed, or failed before hashing
};

// HashAhead is one pass over the manifest. It owns the workers; its
// destructor stops and joins them. Jobs |taken| to |claimed| are in the
// window: the caller claims a job by reading its entry and opening its file,
// a worker or the caller picks it to hash it, and the caller takes it in its
// turn. The lock guards the counters and the flags; a job's other fields
// belong to the caller until it is claimed, to whoever picked it until it is
// done, then to the caller again.
struct HashAhead {
  explicit HashAhead(std::FILE* list);
  ~HashAhead();
  HashAhead(const HashAhead&) = delete;
  HashAhead& operator=(const HashAhead&) = delete;

  // Next returns the next entry in manifest order once it is hashed, and
  // gives up the one returned before. The last one reads kEnd or kTooLong,
  // or failed.
  const Job& Next();

  std::FILE* manifest;
  pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
  pthread_cond_t headDone = PTHREAD_COND_INITIALIZER;
  pthread_cond_t workOrStop = PTHREAD_COND_INITIALIZER;
  std::array<Job, kWindow> jobs{};
  std::size_t window = 1;  // jobs claimed ahead of |taken|, its own included
  std::size_t claimed = 0;
  std::size_t taken = 0;
  bool ended = false;    // the last job is claimed
  bool holding = false;  // the caller holds job |taken|
  bool callerWaits = false;
  bool stopping = false;
  unsigned workersWait = 0;
  std::atomic<bool> abandon{false};
  std::array<pthread_t, kMaxHashThreads> workers{};
  unsigned started = 0;
  keymgr::FileHasher hasher;  // the caller's
};

// HashThreads is the number of threads that hash: one per CPU this process
// may run on.
unsigned HashThreads() {
#ifdef KEYMGR_HASH_THREADS_FROM_ENV
  // Test builds can force the count, to compare one thread with several.
  if (const char* forced = std::getenv("KEYMGR_HASH_THREADS")) {
    return std::clamp(static_cast<unsigned>(std::atoi(forced)), 1U, kMaxHashThreads);
  }
#endif
  long cpus = ::sysconf(_SC_NPROCESSORS_ONLN);
  cpu_set_t allowed;
  if (::sched_getaffinity(0, sizeof(allowed), &allowed) == 0) {
    cpus = std::min<long>(cpus, CPU_COUNT(&allowed));
  }
  struct rlimit files {};
  if (::getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < kFilesForWindow) {
    cpus = 1;
  }
  return static_cast<unsigned>(std::clamp<long>(cpus, 1, kMaxHashThreads));
}

// Prepare reads the next entry into |job| and opens its file, |soon| when
// that is ahead of its turn. Returns false when the job ends the pass: the
// manifest has no entry left, the entry is too long or its file failed. Such
// a job is done at once.
bool Prepare(std::FILE* manifest, Job& job, bool soon) {
  job.entry.fill(0);
  job.read = ReadEntry(manifest, job.entry);
  job.result = keymgr::Status();
  if (job.read == EntryRead::kEntry) {
    job.result = keymgr::OpenFileToHash(job.entry.data(), job.file, soon);
  }
  job.picked = false;
  job.done = job.read != EntryRead::kEntry || !job.result.ok();
  return !job.done;
}

// Small files are read in one go.
bool IsSmall(const Job& job) {
  return job.file.size <= keymgr::kFileReadChunk;
}

// Waiting returns the first job from |from| on that nobody hashes yet and is
// small or large as asked, or null; lock held.
Job* Waiting(HashAhead& ahead, std::size_t from, bool small) {
  for (std::size_t i = from; i < ahead.claimed; ++i) {
    Job& job = ahead.jobs[i % kWindow];
    if (!job.picked && !job.done && IsSmall(job) == small) {
      return &job;
    }
  }
  return nullptr;
}

// Hash picks |job|, hashes it without the lock and marks it done. Called
// with the lock held; returns with it held.
void Hash(HashAhead& ahead, Job& job, keymgr::FileHasher& hasher,
          const std::atomic<bool>* abandon) {
  job.picked = true;
  pthread_mutex_unlock(&ahead.lock);
  job.result = keymgr::HashOpenFile(hasher, job.file, job.digest, abandon);
  pthread_mutex_lock(&ahead.lock);
  job.done = true;
  if (ahead.callerWaits && &job == &ahead.jobs[ahead.taken % kWindow]) {
    pthread_cond_signal(&ahead.headDone);
  }
}

void* Work(void* arg) {
  auto& ahead = *static_cast<HashAhead*>(arg);
  keymgr::FileHasher hasher;
  pthread_mutex_lock(&ahead.lock);
  for (;;) {
    Job* job = nullptr;
    while (!ahead.stopping && (job = Waiting(ahead, ahead.taken, false)) == nullptr) {
      ++ahead.workersWait;
      pthread_cond_wait(&ahead.workOrStop, &ahead.lock);
      --ahead.workersWait;
    }
    if (ahead.stopping) {
      break;
    }
    Hash(ahead, *job, hasher, &ahead.abandon);
  }
  pthread_mutex_unlock(&ahead.lock);
  return nullptr;
}

HashAhead::HashAhead(std::FILE* list) : manifest(list) {
  const unsigned threads = HashThreads();
  // A worker that cannot be started leaves its share to the others; with
  // none, the caller hashes every file in its turn.
  while (threads > 1 && started < threads &&
         pthread_create(&workers[started], nullptr, Work, this) == 0) {
    ++started;
  }
  window = started > 0 ? kWindow : 1;
}

HashAhead::~HashAhead() {
  abandon.store(true, std::memory_order_relaxed);
  pthread_mutex_lock(&lock);
  stopping = true;
  pthread_cond_broadcast(&workOrStop);
  pthread_mutex_unlock(&lock);
  for (unsigned i = 0; i < started; ++i) {
    pthread_join(workers[i], nullptr);
  }
  // Files opened ahead of a failure are never hashed; they close with their
  // jobs.
}

const Job& HashAhead::Next() {
  pthread_mutex_lock(&lock);
  if (holding) {
    ++taken;
  }
  holding = true;
  // Keep the window full, one job at a time so that busy workers never run
  // dry. An unclaimed slot is the caller's alone: no lock while it is filled.
  while (!ended && claimed < taken + window) {
    Job& job = jobs[claimed % kWindow];
    pthread_mutex_unlock(&lock);
    const bool more = Prepare(manifest, job, window > 1);
    pthread_mutex_lock(&lock);
    ++claimed;
    ended = !more;
    if (more && workersWait > 0 && !IsSmall(job)) {
      pthread_cond_signal(&workOrStop);
    }
  }
  Job& head = jobs[taken % kWindow];
  while (!head.done) {
    // The head if no worker has it, else a small file rather than idling.
    Job* job = head.picked ? Waiting(*this, taken + 1, true) : &head;
    if (job != nullptr) {
      Hash(*this, *job, hasher, nullptr);
      continue;
    }
    callerWaits = true;
    pthread_cond_wait(&headDone, &lock);
    callerWaits = false;
  }
  pthread_mutex_unlock(&lock);
  return head;
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
const Job* NextHashed(HashAhead& ahead, Outcome& outcome) {
  const Job& job = ahead.Next();
  if (job.read != EntryRead::kEntry) {
    outcome = PrintEntryFailure(job.read, job.entry);
    return nullptr;
  }
  if (!PrintHashFailure(job.result, job.entry)) {
    outcome = kEntryFailed;
    return nullptr;
  }
  return &job;
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
    while (const Job* job = NextHashed(ahead, outcome)) {
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
  File digests;
  File manifest;
  if (!OpenBoth(digests, manifest)) {
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
  Outcome outcome = kAllPassed;
  File digests;
  File manifest;
  if (!OpenBoth(digests, manifest)) {
    WriteBootStatus(kBootStatusBnFail);
    return 1;
  }
  {
    // Every worker has stopped at the end of this block, before the manifest
    // is closed. Failures to hash are reported whatever the verbose flag.
    HashAhead ahead(manifest.get());
    while (const Job* job = NextHashed(ahead, outcome)) {
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
  return outcome == kUnreadable ? 1 : 0;
}
