// Hashing the manifest's files ahead of their turn, on worker threads.
#include <sched.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>

#include "integrity/internal.h"

namespace keymgr::integrity {

namespace {

// Below this limit on open files, a window of open files could crowd out
// the run's other files, and the files are hashed one at a time.
constexpr rlim_t kFilesForWindow = 4 * HashAhead::kWindow;

// HashThreads is the number of threads that hash: one per CPU this process
// may run on; beyond a few, the storage sets the pace, not the hashing.
unsigned HashThreads() {
#ifdef KEYMGR_HASH_THREADS_FROM_ENV
  // Test builds can force the count, to compare one thread with several.
  if (const char* forced = std::getenv("KEYMGR_HASH_THREADS")) {
    return std::clamp(static_cast<unsigned>(std::atoi(forced)), 1U, HashAhead::kMaxThreads);
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
  return static_cast<unsigned>(std::clamp<long>(cpus, 1, HashAhead::kMaxThreads));
}

// Prepare reads the next entry into |hashed| and opens its file into |file|,
// |soon| when that is ahead of its turn. Returns false when the entry ends
// the pass: the manifest has no entry left, the entry is too long or its
// file failed.
bool Prepare(std::FILE* manifest, HashedEntry& hashed, FileToHash& file, bool soon) {
  hashed.entry.fill(0);
  hashed.read = ReadEntry(manifest, hashed.entry);
  hashed.result = {};
  if (hashed.read == EntryRead::kEntry) {
    hashed.result = OpenFileToHash(hashed.entry.data(), file, soon);
  }
  return hashed.read == EntryRead::kEntry && hashed.result.ok();
}

// Small files are read in one go: handing one over to a worker costs more
// than hashing it.
bool IsSmall(const FileToHash& file) {
  return file.size <= kFileReadChunk;
}

}  // namespace

HashAhead::HashAhead(std::FILE* manifest) : manifest_(manifest) {
  const unsigned threads = HashThreads();
  // A worker that cannot be started leaves its share to the others; with
  // none, the caller hashes every file in its turn.
  while (threads > 1 && started_ < threads &&
         pthread_create(&workers_[started_], nullptr, Work, this) == 0) {
    ++started_;
  }
  window_ = started_ > 0 ? kWindow : 1;
}

HashAhead::~HashAhead() {
  abandon_.store(true, std::memory_order_relaxed);
  pthread_mutex_lock(&lock_);
  stopping_ = true;
  pthread_cond_broadcast(&workOrStop_);
  pthread_mutex_unlock(&lock_);
  for (unsigned i = 0; i < started_; ++i) {
    pthread_join(workers_[i], nullptr);
  }
  // Files opened ahead of a failure are never hashed; they close with their
  // jobs.
}

// Waiting returns the first job from |from| on that nobody hashes yet and is
// small or large as asked, or null; lock held.
HashAhead::Job* HashAhead::Waiting(std::size_t from, bool small) {
  for (std::size_t i = from; i < claimed_; ++i) {
    Job& job = jobs_[i % kWindow];
    if (!job.picked && !job.done && IsSmall(job.file) == small) {
      return &job;
    }
  }
  return nullptr;
}

// Hash picks |job|, hashes it without the lock and marks it done. Called
// with the lock held; returns with it held.
void HashAhead::Hash(Job& job, FileHasher& hasher, const std::atomic<bool>* abandon) {
  job.picked = true;
  pthread_mutex_unlock(&lock_);
  const Status status = HashOpenFile(hasher, job.file, job.hashed.digest, abandon);
  job.hashed.result = {status.ok() ? HashResult::kNone : HashResult::kOpen, status};
  pthread_mutex_lock(&lock_);
  job.done = true;
  if (callerWaits_ && &job == &jobs_[taken_ % kWindow]) {
    pthread_cond_signal(&headDone_);
  }
}

void* HashAhead::Work(void* self) {
  auto& ahead = *static_cast<HashAhead*>(self);
  FileHasher hasher;
  pthread_mutex_lock(&ahead.lock_);
  for (;;) {
    Job* job = nullptr;
    while (!ahead.stopping_ && (job = ahead.Waiting(ahead.taken_, false)) == nullptr) {
      ++ahead.workersWait_;
      pthread_cond_wait(&ahead.workOrStop_, &ahead.lock_);
      --ahead.workersWait_;
    }
    if (ahead.stopping_) {
      break;
    }
    ahead.Hash(*job, hasher, &ahead.abandon_);
  }
  pthread_mutex_unlock(&ahead.lock_);
  return nullptr;
}

const HashedEntry& HashAhead::Next() {
  pthread_mutex_lock(&lock_);
  if (holding_) {
    ++taken_;
  }
  holding_ = true;
  // Keep the window full, one job at a time so that busy workers never run
  // dry.
  while (!ended_ && claimed_ < taken_ + window_) {
    Job& job = jobs_[claimed_ % kWindow];
    pthread_mutex_unlock(&lock_);
    const bool more = Prepare(manifest_, job.hashed, job.file, window_ > 1);
    job.picked = false;
    job.done = !more;
    pthread_mutex_lock(&lock_);
    ++claimed_;
    ended_ = !more;
    if (more && workersWait_ > 0 && !IsSmall(job.file)) {
      pthread_cond_signal(&workOrStop_);
    }
  }
  Job& head = jobs_[taken_ % kWindow];
  while (!head.done) {
    // The head if no worker has it, else a small file rather than idling.
    Job* job = head.picked ? Waiting(taken_ + 1, true) : &head;
    if (job != nullptr) {
      Hash(*job, hasher_, nullptr);
      continue;
    }
    callerWaits_ = true;
    pthread_cond_wait(&headDone_, &lock_);
    callerWaits_ = false;
  }
  pthread_mutex_unlock(&lock_);
  return head.hashed;
}

}  // namespace keymgr::integrity
