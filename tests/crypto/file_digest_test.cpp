#include "crypto/file_digest.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>

#include "support/sandbox.h"

namespace {

// A file streams through several reads and exactly the size that stat gave is
// hashed: bytes lost to a shrink after that count as zeros, bytes added are
// left out. A stop abandons the file.
TEST(FileDigestTest, HashesTheStatSizeAcrossReads) {
  namespace t = keymgr::test;
  const std::string path = t::InRoot("/digest");
  const std::size_t chunk = keymgr::kFileReadChunk;
  std::string bytes(3 * chunk + 5, '\0');
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    bytes[i] = static_cast<char>(i * 7 + i / 251);
  }
  const auto sha = t::Sha256;
  // Opens a file of |size| bytes, lets |change| alter it, then hashes it.
  std::atomic<bool> stop{false};
  const auto hash = [&](std::size_t size, const std::function<void()>& change) {
    t::ResetSandbox();
    t::WriteFile(path, bytes.substr(0, size));
    keymgr::FileToHash file;
    EXPECT_TRUE(keymgr::OpenFileToHash(path.c_str(), file, true).ok());
    change();
    keymgr::FileHasher hasher;
    std::array<std::uint8_t, keymgr::crypto::kSha256Size> digest{};
    const keymgr::Status result = keymgr::HashOpenFile(hasher, file, digest, &stop);
    EXPECT_FALSE(file.fd) << "closed once hashed";
    return result.ok() ? std::string(digest.begin(), digest.end())
                       : "failed " + std::to_string(result.code());
  };
  for (std::size_t size : {std::size_t{0}, std::size_t{1}, chunk, chunk + 1, bytes.size()}) {
    EXPECT_EQ(hash(size, [] {}), sha(bytes.substr(0, size))) << size;
  }
  EXPECT_EQ(hash(bytes.size(), [&] { std::filesystem::resize_file(path, chunk + 7); }),
            sha(bytes.substr(0, chunk + 7) + std::string(bytes.size() - chunk - 7, '\0')));
  EXPECT_EQ(hash(chunk + 1, [&] { std::ofstream(path, std::ios::app) << "more"; }),
            sha(bytes.substr(0, chunk + 1)));
  EXPECT_EQ(hash(bytes.size(), [&] { stop = true; }), "failed " + std::to_string(ECANCELED));
}

}  // namespace
