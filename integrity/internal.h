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
#include "integrity/manifest.h"
#include "util/owned.h"
#include "util/paths.h"

namespace keymgr::integrity {

using Digest = std::array<std::uint8_t, crypto::kSha256Size>;
#if KEYMGR_SIGNED_BUILD
// SignedFiles holds the bytes that keymgr.sig covers, read once. Check reads
// the digest file and the manifest whole, checks keymgr.sig against them and
// the built-in key, and its release against |check|'s floor, and puts
// streams over the bytes it checked in the files' place, so that a file
// swapped after the check changes nothing. It prints the signature error
// line and returns false when the check fails, and the release counter with
// |verbose|. Once it accepts, |check| takes the release and the digests of
// the bytes checked.
class SignedFiles {
 public:
  bool Check(File& digests, File& manifest, bool verbose, BootCheck* check);

 private:
  HeapBytes digests_, manifest_;
};
inline bool CheckSigned(SignedFiles& held, File& digests, File& manifest, bool verbose,
                        BootCheck* check) {
  return held.Check(digests, manifest, verbose, check);
}
// kHashRefused is HashManifest's result in a signed build: digest files are
// made and signed on the build host.
inline constexpr int kHashRefused = 2;
#else
// Without a built-in key the files are taken as they are.
struct SignedFiles {};
inline bool CheckSigned(SignedFiles& /*held*/, File& /*digests*/, File& /*manifest*/,
                        bool /*verbose*/, BootCheck* /*check*/) {
  return true;
}
#endif

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
