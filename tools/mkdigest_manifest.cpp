#include "tools/mkdigest_manifest.h"

#include <cstdio>

#include "integrity/manifest.h"
#include "util/owned.h"

namespace keymgr::tools {

namespace {

using integrity::EntryRead;

// Refusal tells why the device would read |entry|, one that is not
// canonical, otherwise than the build host.
std::string Refusal(const std::string& entry) {
  if (!entry.starts_with('/')) {
    return entry + ": a relative entry, which the device takes from its working directory";
  }
  if (entry.ends_with('/')) {
    return entry + ": ends with a slash, which the device opens only as a folder";
  }
  return entry + ": not in normal form (an empty, \".\" or \"..\" component)";
}

}  // namespace

std::string ReadSignableManifest(std::span<const std::uint8_t> manifest,
                                 std::vector<std::string>& entries) {
  entries.clear();
  // fmemopen takes no empty buffer; an empty manifest has no entry either way.
  const File stream(manifest.empty() ? nullptr
                                     : ::fmemopen(const_cast<std::uint8_t*>(manifest.data()),
                                                  manifest.size(), "r"));
  integrity::EntryBuffer entry{};
  EntryRead read = manifest.empty() ? EntryRead::kEnd : EntryRead::kReadError;
  while (stream && (read = integrity::ReadEntry(stream.get(), entry)) == EntryRead::kEntry) {
    entries.emplace_back(entry.data());
    if (!integrity::IsCanonicalEntry(entries.back())) {
      return Refusal(entries.back());
    }
    entry.fill(0);
  }
  if (read != EntryRead::kEnd) {
    return "an entry is too long, holds a NUL byte, or cannot be read";
  }
  return entries.empty() ? "no entries: a device would check nothing and say BN=OK" : "";
}

}  // namespace keymgr::tools
