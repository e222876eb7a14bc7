#include <openssl/evp.h>

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <numeric>
#include <string>

#include "support/sandbox.h"
#include "util/bytes.h"
#include "util/file_digest.h"

namespace {

std::string Output(const std::function<void()>& call) {
  testing::internal::CaptureStdout();
  call();
  return testing::internal::GetCapturedStdout();
}

// BytesToHex's failures leave the destination untouched. Its capacity is
// 8-bit, so 128 bytes or more can never fit.
TEST(BytesTest, PrintersMd5AndHex) {
  std::uint8_t b[256], md5[16];
  std::iota(b, b + 256, 0);
  EXPECT_EQ(
      Output([&] {
        PrintHexDump(b, 0, 1), PrintHexDump(b, 9, 0), PrintHexDump(b, 20, 1);
        PrintArray(b + 10, 2), PrintArray(b, -3), PrintRedactedArray(2);
      }),
      "\n00 01 02 03 04 05 06 07 08 \n"
      "00 01 02 03 04 05 06 07   08 09 0A 0B 0C 0D 0E 0F \n10 11 12 13 \n"
      "print_array: size[2] 0A 0B  \nprint_array: size[-3]  \nprint_array: size[2] ** **  \n");
  EXPECT_EQ(Md5OfString("", md5), 0);
  EXPECT_EQ(std::string(md5, md5 + 16),
            std::string("\xD4\x1D\x8C\xD9\x8F\x00\xB2\x04\xE9\x80\x09\x98\xEC\xF8\x42\x7E", 16));

  char dst[256] = "Q";
  const std::string kNull = "ERR: Null pointer detecter or zero length\n";
  const std::string kShort = "ERR: to short destination buffer";
  const auto fails = [&](const std::uint8_t* src, int n, char* to, int size, std::string out) {
    EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(src, n, to, size), -1); }), out) << n << size;
    EXPECT_STREQ(dst, "Q");
  };
  fails(nullptr, 2, dst, 5, kNull), fails(b, 0, dst, 5, kNull), fails(b, 2, nullptr, 5, kNull);
  fails(b, 2, dst, 0, kNull), fails(b, 2, dst, 4, kShort), fails(b, 128, dst, 255, kShort);
  dst[255] = 'Q';
  EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(b + 128, 127, dst, 255), 0); }), "");
  EXPECT_EQ(std::string(dst, 4) + std::string(dst + 250, 6), std::string("8081FDFE\0Q", 10));
}

// A file streams through several reads and exactly the size that stat gave is
// hashed: bytes lost to a shrink after that count as zeros, bytes added are
// left out. A stop abandons the file.
TEST(FileDigestTest, HashesTheStatSizeAcrossReads) {
  namespace t = keymgr::test;
  using keymgr::FileDigestResult;
  const std::string path = t::InRoot("/digest");
  const std::size_t chunk = keymgr::kFileReadChunk;
  std::string bytes(3 * chunk + 5, '\0');
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    bytes[i] = static_cast<char>(i * 7 + i / 251);
  }
  const auto sha = [](const std::string& data) {
    std::string out(32, '\0');
    EVP_Digest(data.data(), data.size(), reinterpret_cast<unsigned char*>(out.data()), nullptr,
               EVP_sha256(), nullptr);
    return out;
  };
  // Opens a file of |size| bytes, lets |change| alter it, then hashes it.
  std::atomic<bool> stop{false};
  const auto hash = [&](std::size_t size, const std::function<void()>& change) {
    t::ResetSandbox();
    t::WriteFile(path, bytes.substr(0, size));
    keymgr::FileToHash file;
    EXPECT_EQ(keymgr::OpenFileToHash(path.c_str(), file, true), FileDigestResult::kOk);
    change();
    keymgr::FileHasher hasher;
    std::array<std::uint8_t, keymgr::kFileDigestSize> digest{};
    const auto result = keymgr::HashOpenFile(hasher, file, digest, &stop);
    const int error = errno;
    EXPECT_EQ(file.fd, -1);
    return result == FileDigestResult::kOk ? std::string(digest.begin(), digest.end())
                                           : "failed " + std::to_string(error);
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
