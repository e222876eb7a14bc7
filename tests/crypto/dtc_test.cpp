// The crypto module's calls over caller records, and the file hasher.
#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <utility>

#include "crypto/dtc.h"
#include "crypto/file_digest.h"
#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

using Bytes = std::string;

using keymgr::test::FromHex;

// The key and plain text of SP 800-38A F.2.5.
const Bytes kKey = FromHex("603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4");
const Bytes kPlain = FromHex(
    "6bc1bee22e409f96e93d7e117393172aae2d8a571e03ac9c9eb76fac45af8e51"
    "30c81c46a35ce411e5fbc1191a0a52eff69f2445df4f9b17ad2b417be66c3710");

// A caller's array with a record attached and sized to |plain|.
struct Slot {
  uint8_t bytes[64] = {};
  ProtectedKey pk{};
  explicit Slot(const Bytes& plain = {}) {
    std::memcpy(bytes, plain.data(), plain.size());
    EXPECT_EQ(ProtectedKey_Attach(&pk, 0, bytes), 0u);
    EXPECT_EQ(ProtectedKey_SetLength(&pk, static_cast<uint32_t>(plain.size())), 0u);
  }
};

Bytes Read(const ProtectedKey* pk, uint32_t n) {
  Bytes out;
  for (uint32_t i = 0; i < n; ++i) {
    out += static_cast<char>(ProtectedKey_ByteAt(pk, i));
  }
  return out;
}

// One job in a container of its own: a hash with |op| as the selector when
// there is no |key|, else AES in direction |op|.
uint32_t Job(uint32_t op, const ProtectedKey* in, uint32_t n, ProtectedKey* out, uint32_t* len,
             const ProtectedKey* key = nullptr, const ProtectedKey* iv = nullptr,
             uint32_t keyLength = 32, uint32_t mode = DTC_AES_MODE) {
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  uint32_t rc = key == nullptr ? VKT_DTC_GetHash(c, op, in, n, out, len)
                               : VKT_DTC_AES_Init(c, op, mode, key, keyLength, iv);
  rc = rc != 0 || key == nullptr ? rc : VKT_DTC_AES_Process(c, in, n, out, len);
  EXPECT_EQ(VKT_DTC_DestroyCryptoContainer(c), 0u);
  return rc;
}

// The built-in constants as release 2.3 has them, which every later build
// must keep to open the key material that devices hold: constant 1 the
// 32-byte slot of the one-off key, bound to nothing until the module binds
// it; constant 2 the IV, pinned with an encipherment under it; constant 3
// the disk-mapper tool's digest that the build was given.
TEST(Dtc, BuiltInConstantsAreRelease23s) {
  ProtectedKey *key = nullptr, *iv = nullptr, *dmsetup = nullptr;
  uint32_t keyLength = 0, ivLength = 0, dmsetupLength = 0;
  ASSERT_EQ(VKT_DTC_GetConstant(DTC_CONST_AES_KEY, &key, &keyLength), 0u);
  ASSERT_EQ(VKT_DTC_GetConstant(DTC_CONST_AES_PARAM, &iv, &ivLength), 0u);
  ASSERT_EQ(VKT_DTC_GetConstant(DTC_CONST_DMSETUP_DIGEST, &dmsetup, &dmsetupLength), 0u);
  EXPECT_EQ(keyLength, 32u);
  EXPECT_EQ(Read(iv, ivLength), FromHex("34055aba7572c461318b84e9206148c7"));
  EXPECT_EQ(Read(dmsetup, dmsetupLength), FromHex(KEYMGR_DMSETUP_SHA256));
  for (uint32_t index : {0u, 4u}) {
    EXPECT_EQ(VKT_DTC_GetConstant(index, &key, &keyLength), DTC_E_BAD_SELECTOR);
    EXPECT_EQ(key, nullptr);
  }
  ASSERT_EQ(VKT_DTC_GetConstant(DTC_CONST_AES_KEY, &key, &keyLength), 0u);
  Slot plain(kPlain), sealed;
  uint32_t len = 64;
  EXPECT_EQ(Job(DTC_AES_ENCRYPT, &plain.pk, 48, &sealed.pk, &len, key, iv), DTC_E_KEY_NOT_BOUND);
  Slot bound(kKey);
  ASSERT_EQ(Job(DTC_AES_ENCRYPT, &plain.pk, 48, &sealed.pk, &len, &bound.pk, iv), 0u);
  EXPECT_EQ(Read(&sealed.pk, len), FromHex("ae1b631f0b8b22956aba1eada5a249551bbc7448497ad15f"
                                           "6c8ee8e81904631ea49b76ff2342ae32d5c25b85ef455b0a"));
  // The fixed constants cannot be re-bound or written.
  EXPECT_EQ(ProtectedKey_Attach(iv, 0, sealed.bytes), DTC_E_BAD_STATE);
  EXPECT_EQ(Job(DTC_HASH_SELECTOR, &plain.pk, 48, dmsetup, &len), DTC_E_BAD_STATE);
}

// MD5, SHA-256 and AES decryption meet known answers end to end in the
// release 2.3 test of tests/kmm, AES encryption above.
TEST(Crypto, MaskedRecordsAndRefusals) {
  Slot iv(FromHex("000102030405060708090a0b0c0d0e0f")), a(kPlain), b(kPlain), key(kKey);
  // A hash given more room than it needs gives 32 bytes.
  Slot abc("abc"), digest;
  uint32_t len = 64;
  ASSERT_EQ(Job(DTC_HASH_SELECTOR, &abc.pk, 3, &digest.pk, &len), 0u);
  EXPECT_EQ(Read(&digest.pk, len), keymgr::test::Sha256("abc"));

  // A record sized 32 gives the 16 plain bytes after it to a 48-byte run, as
  // the secret-key area is sealed.
  Slot part(kPlain.substr(0, 32)), sealed;
  std::memcpy(&part.bytes[32], &kPlain[32], 16);
  ASSERT_EQ(Job(DTC_AES_ENCRYPT, &part.pk, 48, &sealed.pk, &len, &key.pk, &iv.pk), 0u);
  EXPECT_EQ(Read(&sealed.pk, len), FromHex("f58c4c04d6e5f1ba779eabfb5f7bfbd69cfc4e967edb808d"
                                           "679f777bc6702c7d39f23369a9d9bacfa530e26304231461"));

  // Sized records hold no plain bytes, and a bitwise copy reads the same.
  ProtectedKey copy;
  std::memcpy(&copy, &a.pk, sizeof copy);
  EXPECT_EQ(Read(&copy, 64), kPlain);
  for (std::size_t i = 0; i < 64; i += 4) {
    EXPECT_NE(Bytes(&a.bytes[i], &a.bytes[i + 4]), kPlain.substr(i, 4)) << "plain at " << i;
  }
  EXPECT_NE(std::memcmp(a.bytes, b.bytes, 64), 0) << "equal keys must not share a mask";

  // And refuses what no caller may ask with its code, writing nothing.
  const Bytes untouched(reinterpret_cast<char*>(b.bytes), 64);
  uint32_t small = 31;
  len = 32;
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  const uint32_t early = VKT_DTC_AES_Process(c, &a.pk, 48, &b.pk, &len);
  Slot once;  // one run per set-up
  const uint32_t init = VKT_DTC_AES_Init(c, DTC_AES_ENCRYPT, DTC_AES_MODE, &key.pk, 32, &iv.pk);
  const uint32_t first = VKT_DTC_AES_Process(c, &a.pk, 16, &once.pk, &len);
  const std::pair<uint32_t, uint32_t> refusals[] = {
      {Job(DTC_HASH_SELECTOR, &a.pk, 48, &b.pk, &small), DTC_E_SMALL_OUTPUT},
      {Job(DTC_HASH_SELECTOR + 1, &a.pk, 48, &b.pk, &len), DTC_E_BAD_SELECTOR},
      {VKT_DTC_GetHash(nullptr, DTC_HASH_SELECTOR, &a.pk, 48, &b.pk, &len), DTC_E_NULL_ARGUMENT},
      {Job(1111, &a.pk, 48, &b.pk, &len, &key.pk, &iv.pk), DTC_E_BAD_SELECTOR},
      {Job(DTC_AES_ENCRYPT, &a.pk, 48, &b.pk, &len, &key.pk, &iv.pk, 32, 1205), DTC_E_BAD_SELECTOR},
      {Job(DTC_AES_ENCRYPT, &a.pk, 48, &b.pk, &len, &key.pk, &iv.pk, 16), DTC_E_BAD_LENGTH},
      {Job(DTC_AES_ENCRYPT, &a.pk, 0, &b.pk, &len, &key.pk, &iv.pk), DTC_E_BAD_LENGTH},
      {Job(DTC_AES_ENCRYPT, &a.pk, 47, &b.pk, &len, &key.pk, &iv.pk), DTC_E_BAD_LENGTH},
      {Job(DTC_AES_ENCRYPT, &a.pk, 4096, &b.pk, &len, &key.pk, &iv.pk), DTC_E_BAD_LENGTH},
      {ProtectedKey_Attach(&b.pk, 1, b.bytes), DTC_E_BAD_SELECTOR},
      {early, DTC_E_BAD_STATE},
      {init | first, 0},
      {VKT_DTC_AES_Process(c, &a.pk, 48, &b.pk, &len), DTC_E_BAD_STATE},
      {VKT_DTC_DestroyCryptoContainer(c), 0},
  };
  for (std::size_t i = 0; i < std::size(refusals); ++i) {
    EXPECT_EQ(refusals[i].first, refusals[i].second) << "refusal " << i;
  }
  EXPECT_EQ(Bytes(reinterpret_cast<char*>(b.bytes), 64), untouched);
}

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
    EXPECT_EQ(hash(size, [] {}), t::Sha256(bytes.substr(0, size))) << size;
  }
  EXPECT_EQ(hash(bytes.size(), [&] { std::filesystem::resize_file(path, chunk + 7); }),
            t::Sha256(bytes.substr(0, chunk + 7) + std::string(bytes.size() - chunk - 7, '\0')));
  EXPECT_EQ(hash(chunk + 1, [&] { std::ofstream(path, std::ios::app) << "more"; }),
            t::Sha256(bytes.substr(0, chunk + 1)));
  EXPECT_EQ(hash(bytes.size(), [&] { stop = true; }), "failed " + std::to_string(ECANCELED));
}

}  // namespace
