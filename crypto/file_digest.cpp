#include "crypto/file_digest.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "crypto/hash.h"
#include "util/owned.h"
#include "util/secure.h"

namespace keymgr {

namespace {

void FreeMemory(void* memory) {
  std::free(memory);
}

}  // namespace

Status ComputeFileDigest(const char* path, const char* mode,
                         std::span<std::uint8_t, kFileDigestSize> digest) {
  struct stat st;
  if (::stat(path, &st) < 0) {
    return ErrnoFailure("stat");
  }
  // The size is a signed 32-bit count; a file of 2 GiB or more cannot be
  // held, so it fails like an unopenable one rather than wrapping.
  if (st.st_size < 0 || st.st_size > std::numeric_limits<std::int32_t>::max()) {
    return ErrnoFailure("open", EFBIG);
  }
  const auto size = static_cast<std::int32_t>(st.st_size);

  File file = OpenFile(path, mode);
  if (!file) {
    return ErrnoFailure("open");
  }
  using Buffer = Owned<void*, FreeMemory>;
  Buffer buffer(std::calloc(static_cast<std::size_t>(size) + 1, 1));
  if (!buffer) {
    return ErrnoFailure("open", ENOMEM);
  }
  // A short read leaves zeros in place of the missing bytes.
  std::size_t got = std::fread(buffer.get(), 1, static_cast<std::size_t>(size), file.get());
  (void)got;
  file.reset();

  std::uint8_t out[kFileDigestSize] = {};
  crypto::Sha256 sha;
  if (Status status = sha.Update(buffer.get(), static_cast<std::size_t>(size)); !status.ok()) {
    return status;
  }
  if (Status status = sha.Final(out); !status.ok()) {
    return status;
  }
  std::memcpy(digest.data(), out, kFileDigestSize);
  return Status();
}

}  // namespace keymgr
