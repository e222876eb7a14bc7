// The file-integrity manifest: building the digest file, checking one file
// and checking the whole list at boot.
#pragma once

#include <array>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string_view>

#include "util/paths.h"
#include "verdict/verdict.h"

namespace keymgr::integrity {

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

// IsCanonicalEntry tells whether |entry| names its file the one way the
// device reads it wherever it runs: an absolute path whose every component is
// a name, none empty (a doubled or trailing slash), "." or "..". The device
// hashes whatever entry it reads; the build host's tool signs only these.
bool IsCanonicalEntry(std::string_view entry);

}  // namespace keymgr::integrity

// HashManifest rewrites the digest file from the files the manifest lists.
// Returns 1 when either file could not be opened, else 0; in a signed build
// it refuses with a line and returns 2, leaving the digest file as it was.
int HashManifest();

// VerifyManifestFile checks the first manifest entry equal to |path| and
// prints both digests. A null or unlisted path prints nothing.
void VerifyManifestFile(const char* path);

// VerifyManifest checks every listed file, stopping at the first failure,
// and writes BN=OK or BN=FAIL to the boot status log. |verbose| 1 prints the
// per-file lines. Returns 1 when either file could not be opened, else 0.
int VerifyManifest(int verbose);

namespace keymgr::integrity {

// BootCheck is what a measured boot run tells the check, and what the check
// tells it back.
struct BootCheck {
  // The release floor that keymgr.sig is held against in a signed build,
  // when the TPM gave one: a lower release fails like a bad signature.
  std::optional<std::uint64_t> floor;
  // The verdict written, kOk or kFail.
  verdict::Verdict verdict = verdict::Verdict::kNone;
  // In a signed build, once keymgr.sig was accepted: its release, and the
  // SHA-256 of the manifest and the digest file as the check read them.
  std::optional<std::uint64_t> release;
  std::optional<verdict::PcrValue> manifestSha256;
  std::optional<verdict::PcrValue> digestsSha256;
};

}  // namespace keymgr::integrity

// VerifyManifestChecked is VerifyManifest for a measured boot run, which
// tells it |check|'s floor and takes the rest of |check| back.
int VerifyManifestChecked(int verbose, keymgr::integrity::BootCheck* check);
