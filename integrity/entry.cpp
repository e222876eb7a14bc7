// Reading the manifest's entries, as the device and the build host's tool do.
#include <cctype>
#include <cstring>

#include "integrity/manifest.h"

namespace keymgr::integrity {

// The widest entry the path buffer can hold with its terminator.
static_assert(kPathBufferSize == 100, "the entry format below reads 99 characters");
// White space, then an entry of up to 99 characters; the positions around
// the entry tell its length.
constexpr char kEntryFormat[] = " %n%99s%n";

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

bool IsCanonicalEntry(std::string_view entry) {
  if (!entry.starts_with('/')) {
    return false;
  }
  // Each slash starts a component, up to the next slash or the end.
  for (std::size_t at = 0; at != std::string_view::npos;) {
    const std::size_t next = entry.find('/', at + 1);
    const std::string_view name = entry.substr(at + 1, next - at - 1);
    if (name.empty() || name == "." || name == "..") {
      return false;
    }
    at = next;
  }
  return true;
}

}  // namespace keymgr::integrity
