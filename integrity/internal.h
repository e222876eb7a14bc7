// The manifest reader and the look-ahead hashing of its files. Private to
// integrity/.
#pragma once

#include <pthread.h>

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "crypto/file_digest.h"
#include "util/paths.h"

namespace keymgr::integrity {

using Digest = std::array<std::uint8_t, kFileDigestSize>;
using EntryBuffer = std::array<char, kPathBufferSize>;

enum class EntryRead {
  kEntry,
  kEnd,
  kTooLong,    // does not fit the path buffer
  kNul,        // holds a NUL byte, which would cut the path short
  kReadError,  // the manifest could not be read on
};

// ReadEntry reads the next white-space separated manifest entry into |entry|,
// which the caller zeroes. An entry that does not fit the path buffer is
// consumed to its end and returned as too long. Too long, one with a NUL
// byte and a read error each fail a run; none is taken for the end of the
// manifest. Nothing is printed: entries may be read ahead of their turn.
EntryRead ReadEntry(std::FILE* manifest, EntryBuffer& entry);

// A manifest entry with its file hashed, or with why it could not be.
struct HashedEntry {
  EntryBuffer entry{};
  EntryRead read = EntryRead::kEnd;
  HashResult result;
  Digest digest{};
};

// HashAhead is one pass over a manifest, which it reads through |manifest|.
// Next() gives the entries strictly in order, each once it is hashed, so
// that the caller prints, compares and writes as a one-at-a-time run would.
// With more than one CPU the pass reads entries and opens their files up to
// kWindow entries ahead, and worker threads (one per CPU) hash the large
// ones meanwhile; the caller hashes the small ones itself, and a large one
// it reaches before any worker has. It stops reading and opening at the
// first entry that fails, so a run shows and leaves what a one-at-a-time run
// does. With one CPU there is no worker and nothing is opened ahead. The
// destructor stops and joins the workers.
class HashAhead {
 public:
  explicit HashAhead(std::FILE* manifest);
  ~HashAhead();
  HashAhead(const HashAhead&) = delete;
  HashAhead& operator=(const HashAhead&) = delete;

  // Next returns the next entry and gives up the one returned before. The
  // last one reads kEnd, kTooLong, kNul or kReadError, or failed to hash.
  const HashedEntry& Next();

  static constexpr std::size_t kWindow = 32;
  static constexpr unsigned kMaxThreads = 8;

 private:
  struct Job {
    HashedEntry hashed;
    FileToHash file;
    bool picked = false;  // someone hashes it
    bool done = false;    // hashed, or failed before hashing
  };

  static void* Work(void* self);
  Job* Waiting(std::size_t from, bool small);
  void Hash(Job& job, FileHasher& hasher, const std::atomic<bool>* abandon);

  std::FILE* manifest_;
  // |lock_| guards the counters and the flags below it, and each job's
  // |picked| and |done|. Jobs |taken_| to |claimed_| are in the window: the
  // caller claims a job by reading its entry and opening its file (an
  // unclaimed slot is the caller's alone), a worker or the caller picks it
  // to hash it, and the caller takes it in its turn. A job's other fields
  // belong to whoever picked it until it is done, and to the caller
  // otherwise.
  pthread_mutex_t lock_ = PTHREAD_MUTEX_INITIALIZER;
  pthread_cond_t headDone_ = PTHREAD_COND_INITIALIZER;
  pthread_cond_t workOrStop_ = PTHREAD_COND_INITIALIZER;
  std::array<Job, kWindow> jobs_{};
  std::size_t window_ = 1;  // jobs claimed ahead of |taken_|, its own included
  std::size_t claimed_ = 0;
  std::size_t taken_ = 0;
  bool ended_ = false;    // the last job is claimed
  bool holding_ = false;  // the caller holds job |taken_|
  bool callerWaits_ = false;
  bool stopping_ = false;
  unsigned workersWait_ = 0;
  std::atomic<bool> abandon_{false};  // read by hashing workers without the lock
  std::array<pthread_t, kMaxThreads> workers_{};
  unsigned started_ = 0;
  FileHasher hasher_;  // the caller's
};

}  // namespace keymgr::integrity
