// keymgr-mkdigest's reading of a manifest against the device's, over any
// bytes: mkdigest accepts exactly the manifests that the device's reader,
// from the manifest file, reads to their end into at least one entry, each
// an absolute path that is its own lexical normal form; and what it accepts
// are the entries the device reads.
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "integrity/manifest.h"
#include "support/files.h"
#include "tools/mkdigest_manifest.h"
#include "util/owned.h"
#include "util/paths.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace integrity = keymgr::integrity;
  using keymgr::test::Require;
  std::vector<std::string> signable;
  const bool accepted = keymgr::tools::ReadSignableManifest({data, size}, signable).empty();

  static const std::string path = std::string(keymgr::kManifestPath) + "-mkdigest";
  keymgr::test::WriteFile(path, {reinterpret_cast<const char*>(data), size});
  const keymgr::File file(std::fopen(path.c_str(), "r"));
  Require(static_cast<bool>(file));
  std::vector<std::string> read;
  bool normal = true;
  integrity::EntryBuffer entry{};
  integrity::EntryRead result = integrity::EntryRead::kEntry;
  while ((result = integrity::ReadEntry(file.get(), entry)) == integrity::EntryRead::kEntry) {
    const std::string& name = read.emplace_back(entry.data());
    normal = normal && name.starts_with('/') && !name.ends_with('/') &&
             std::filesystem::path(name).lexically_normal().string() == name;
    entry.fill(0);
  }
  Require(accepted == (result == integrity::EntryRead::kEnd && !read.empty() && normal));
  Require(!accepted || signable == read);
  return 0;
}
