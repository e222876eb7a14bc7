#include <gtest/gtest.h>
#include <kmm/dtc.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

using Bytes = std::vector<std::uint8_t>;

Bytes FromHex(std::string_view hex) {
  Bytes out;
  for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
    out.push_back(
        static_cast<std::uint8_t>(std::stoul(std::string(hex.substr(i, 2)), nullptr, 16)));
  }
  return out;
}

// Slot is a caller-owned array with the record attached to it.
struct Slot {
  std::array<std::uint8_t, 64> bytes{};
  ProtectedKey pk{};
  explicit Slot(const Bytes& plain = {}) {
    std::copy(plain.begin(), plain.end(), bytes.begin());
    ProtectedKey_Attach(&pk, 0, bytes.data());
  }
};

Slot Sized(const Bytes& plain) {
  Slot s(plain);
  ProtectedKey_SetLength(&s.pk, static_cast<std::uint32_t>(plain.size()));
  return s;
}

Bytes Read(const ProtectedKey* pk, std::uint32_t n) {
  Bytes out;
  for (std::uint32_t i = 0; i < n; ++i) {
    out.push_back(ProtectedKey_ByteAt(pk, i));
  }
  return out;
}

Bytes Raw(const Slot& s, std::size_t n) {
  return Bytes(s.bytes.begin(), s.bytes.begin() + static_cast<std::ptrdiff_t>(n));
}

std::uint32_t Hash(const ProtectedKey* in, std::uint32_t n, ProtectedKey* out, std::uint32_t* len,
                   std::uint32_t selector = DTC_HASH_SELECTOR) {
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  std::uint32_t rc = VKT_DTC_GetHash(c, selector, in, n, out, len);
  VKT_DTC_DestroyCryptoContainer(c);
  return rc;
}

std::uint32_t Aes(std::uint32_t direction, const ProtectedKey* key, const ProtectedKey* iv,
                  const ProtectedKey* in, std::uint32_t n, ProtectedKey* out, std::uint32_t* len) {
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  std::uint32_t rc = VKT_DTC_AES_Init(c, direction, DTC_AES_MODE, key, 32, iv);
  if (rc == 0) {
    rc = VKT_DTC_AES_Process(c, in, n, out, len);
  }
  VKT_DTC_DestroyCryptoContainer(c);
  return rc;
}

TEST(DtcHash, PublishedVectorsThroughProtectedKeys) {
  const std::pair<std::string, std::string> vectors[] = {
      {"abc", "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
      {"", "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"},
      {"abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq",
       "248d6a61d20638b8e5c026930c3e6039a33ce45964ff2167f6ecedd419db06c1"}};
  for (const auto& [message, digest] : vectors) {
    Slot in = Sized(Bytes(message.begin(), message.end()));
    Slot out;
    std::uint32_t len = 64;  // a larger capacity is fine; 32 comes back
    ASSERT_EQ(Hash(&in.pk, static_cast<std::uint32_t>(message.size()), &out.pk, &len), 0u);
    EXPECT_EQ(len, 32u);
    EXPECT_EQ(Read(&out.pk, 32), FromHex(digest)) << message;
    EXPECT_NE(Raw(out, 32), FromHex(digest)) << "digest left in plain form";
  }
}

TEST(DtcHash, RejectsBadCallsWithoutTouchingTheOutput) {
  Slot in = Sized(Bytes(44, 0x5A));
  Slot out(Bytes(32, 0xEE));
  std::uint32_t len = 31;
  EXPECT_EQ(Hash(&in.pk, 44, &out.pk, &len), DTC_E_SMALL_OUTPUT);
  EXPECT_EQ(len, 31u);
  len = 32;
  EXPECT_NE(Hash(&in.pk, 44, &out.pk, &len, DTC_HASH_SELECTOR + 1), 0u);
  EXPECT_NE(Hash(&in.pk, 44, &out.pk, nullptr), 0u);
  EXPECT_NE(Hash(nullptr, 44, &out.pk, &len), 0u);
  EXPECT_NE(VKT_DTC_GetHash(nullptr, DTC_HASH_SELECTOR, &in.pk, 44, &out.pk, &len), 0u);
  EXPECT_EQ(Raw(out, 32), Bytes(32, 0xEE));
  EXPECT_EQ(len, 32u);
  // A container serves one job only.
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  EXPECT_EQ(VKT_DTC_GetHash(c, DTC_HASH_SELECTOR, &in.pk, 44, &out.pk, &len), 0u);
  EXPECT_NE(VKT_DTC_GetHash(c, DTC_HASH_SELECTOR, &in.pk, 44, &out.pk, &len), 0u);
  EXPECT_EQ(VKT_DTC_DestroyCryptoContainer(c), 0u);
  EXPECT_NE(VKT_DTC_DestroyCryptoContainer(nullptr), 0u);
}

const char kNistKey[] = "603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4";
const char kNistPlain[] =
    "6bc1bee22e409f96e93d7e117393172aae2d8a571e03ac9c9eb76fac45af8e51"
    "30c81c46a35ce411e5fbc1191a0a52eff69f2445df4f9b17ad2b417be66c3710";
const char kNistCipher[] =
    "f58c4c04d6e5f1ba779eabfb5f7bfbd69cfc4e967edb808d679f777bc6702c7d"
    "39f23369a9d9bacfa530e26304231461b2eb05e2c39be9fcda6c19078c6a9d1b";

TEST(DtcAes, NistCbcVectorsBothWays) {
  // The parameter record is the IV, so a caller's record carries the
  // vectors' IV; the key goes through the library's key record.
  ProtectedKey* key = nullptr;
  std::uint32_t keyLength = 0;
  VKT_DTC_GetConstant(DTC_CONST_AES_KEY, &key, &keyLength);
  ASSERT_EQ(keyLength, 32u);
  Bytes keyBytes = FromHex(kNistKey);
  ProtectedKey_Attach(key, 0, keyBytes.data());
  ProtectedKey_SetLength(key, keyLength);
  EXPECT_NE(keyBytes, FromHex(kNistKey)) << "key left in plain form";
  Slot iv = Sized(FromHex("000102030405060708090a0b0c0d0e0f"));

  Slot plain = Sized(FromHex(kNistPlain));
  Slot sealed;
  std::uint32_t len = 0;
  ASSERT_EQ(Aes(DTC_AES_ENCRYPT, key, &iv.pk, &plain.pk, 64, &sealed.pk, &len), 0u);
  EXPECT_EQ(len, 64u);
  EXPECT_EQ(Read(&sealed.pk, 64), FromHex(kNistCipher));

  Slot cipher = Sized(FromHex(kNistCipher));
  Slot opened;
  ASSERT_EQ(Aes(DTC_AES_DECRYPT, key, &iv.pk, &cipher.pk, 64, &opened.pk, &len), 0u);
  EXPECT_EQ(Read(&opened.pk, 64), FromHex(kNistPlain));
  EXPECT_NE(Raw(opened, 64), FromHex(kNistPlain));
}

TEST(DtcAes, SealMatchesOpensslCommandAndUnsealsAllBytes) {
  keymgr::test::ResetSandbox();
  Bytes oneOffKey(32), secret(48);
  for (std::size_t i = 0; i < 48; ++i) {
    secret[i] = static_cast<std::uint8_t>(std::rand());
    if (i < 32) {
      oneOffKey[i] = static_cast<std::uint8_t>(std::rand());
    }
  }
  ProtectedKey *key = nullptr, *param = nullptr;
  std::uint32_t keyLength = 0, paramLength = 0;
  VKT_DTC_GetConstant(DTC_CONST_AES_KEY, &key, &keyLength);
  VKT_DTC_GetConstant(DTC_CONST_AES_PARAM, &param, &paramLength);
  ASSERT_EQ(paramLength, 16u);
  Bytes keyArray = oneOffKey;
  ProtectedKey_Attach(key, 0, keyArray.data());
  ProtectedKey_SetLength(key, keyLength);

  // As when sealing the store key: the record is sized 32 but 48 bytes go in.
  Slot secretSlot = Sized(Bytes(secret.begin(), secret.begin() + 32));
  std::memcpy(secretSlot.bytes.data() + 32, secret.data() + 32, 16);
  Slot store;
  std::uint32_t len = 0xDEADBEEF;
  ASSERT_EQ(Aes(DTC_AES_ENCRYPT, key, param, &secretSlot.pk, 48, &store.pk, &len), 0u);
  ASSERT_EQ(len, 48u);

  std::string in = keymgr::test::InRoot("/aes.in"), out = keymgr::test::InRoot("/aes.out");
  keymgr::test::WriteFile(in, std::string(secret.begin(), secret.end()));
  auto hex = [](const Bytes& b) {
    std::string s;
    for (auto v : b) {
      char t[3];
      std::snprintf(t, sizeof t, "%02x", v);
      s += t;
    }
    return s;
  };
  auto run =
      keymgr::test::Run({"/usr/bin/openssl", "enc", "-aes-256-cbc", "-nopad", "-K", hex(oneOffKey),
                         "-iv", hex(Read(param, 16)), "-in", in, "-out", out});
  ASSERT_EQ(run.status, 0) << run.err;
  std::string expected = keymgr::test::ReadFile(out).value_or("");
  EXPECT_EQ(Read(&store.pk, 48), Bytes(expected.begin(), expected.end()));

  Slot opened;
  len = 0;
  ASSERT_EQ(Aes(DTC_AES_DECRYPT, key, param, &store.pk, 48, &opened.pk, &len), 0u);
  EXPECT_EQ(len, 48u);
  EXPECT_EQ(Read(&opened.pk, 48), secret);
}

TEST(DtcAes, RejectsBadCalls) {
  Slot key = Sized(Bytes(32, 7)), iv = Sized(Bytes(16, 9)), in = Sized(Bytes(48, 1));
  Slot shortKey = Sized(Bytes(16, 7));
  auto init = [&](std::uint32_t dir, std::uint32_t mode, const ProtectedKey* k, std::uint32_t kl) {
    CryptoContainer c = VKT_DTC_CreateCryptoContainer();
    std::uint32_t rc = VKT_DTC_AES_Init(c, dir, mode, k, kl, &iv.pk);
    VKT_DTC_DestroyCryptoContainer(c);
    return rc;
  };
  EXPECT_NE(init(1111, DTC_AES_MODE, &key.pk, 32), 0u);
  EXPECT_NE(init(DTC_AES_ENCRYPT, DTC_AES_MODE + 1, &key.pk, 32), 0u);
  EXPECT_NE(init(DTC_AES_ENCRYPT, DTC_AES_MODE, &key.pk, 16), 0u);
  EXPECT_NE(init(DTC_AES_ENCRYPT, DTC_AES_MODE, &shortKey.pk, 16), 0u);
  EXPECT_NE(init(DTC_AES_ENCRYPT, DTC_AES_MODE, nullptr, 32), 0u);

  Slot out(Bytes(48, 0xEE));
  std::uint32_t len = 5;
  for (std::uint32_t n : {0u, 17u, 47u, 4096u}) {
    EXPECT_NE(Aes(DTC_AES_ENCRYPT, &key.pk, &iv.pk, &in.pk, n, &out.pk, &len), 0u) << n;
  }
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  EXPECT_NE(VKT_DTC_AES_Process(c, &in.pk, 48, &out.pk, &len), 0u) << "run before set-up";
  VKT_DTC_DestroyCryptoContainer(c);
  EXPECT_EQ(len, 5u);
  EXPECT_EQ(Raw(out, 48), Bytes(48, 0xEE));
}

TEST(DtcProtectedKey, MasksBytesAndReadsThemBack) {
  Bytes plain(44);
  for (std::size_t i = 0; i < plain.size(); ++i) {
    plain[i] = static_cast<std::uint8_t>(i * 7 + 1);
  }
  Slot a = Sized(plain), b = Sized(plain);
  EXPECT_EQ(Read(&a.pk, 44), plain);
  EXPECT_NE(Raw(a, 44), plain);
  EXPECT_NE(Raw(a, 44), Raw(b, 44)) << "equal keys must not share a mask";
  ProtectedKey copy;
  std::memcpy(&copy, &a.pk, sizeof copy);
  EXPECT_EQ(Read(&copy, 44), plain);
  // Past the sized length the array's own bytes come back.
  a.bytes[50] = 0x42;
  EXPECT_EQ(ProtectedKey_ByteAt(&a.pk, 50), 0x42);
  // Re-sizing keeps the key bytes and takes in the raw ones after them.
  ProtectedKey_SetLength(&a.pk, 51);
  EXPECT_EQ(ProtectedKey_ByteAt(&a.pk, 50), 0x42);
  EXPECT_EQ(Read(&a.pk, 44), plain);
  EXPECT_NE(a.bytes[50], 0x42);

  ProtectedKey refused{};
  EXPECT_NE(ProtectedKey_Attach(&refused, 1, b.bytes.data()), 0u);
  EXPECT_EQ(ProtectedKey_ByteAt(&refused, 0), 0);
  EXPECT_EQ(ProtectedKey_ByteAt(nullptr, 0), 0);
}

TEST(DtcConstants, FixedValuesAlwaysHandedOut) {
  ProtectedKey* ref = nullptr;
  std::uint32_t length = 99;
  EXPECT_NE(VKT_DTC_GetConstant(4, &ref, &length), 0u);
  EXPECT_EQ(ref, nullptr);
  EXPECT_EQ(length, 0u);
  const std::uint32_t lengths[] = {32, 16, 32};
  for (std::uint32_t index = 1; index <= 3; ++index) {
    ASSERT_EQ(VKT_DTC_GetConstant(index, &ref, &length), 0u);
    EXPECT_NE(ref, nullptr);
    EXPECT_EQ(length, lengths[index - 1]);
  }
  // Constant 3 is the configured digest, held masked, and cannot be re-bound.
  const Bytes configured = FromHex(KEYMGR_DMSETUP_SHA256);
  EXPECT_EQ(Read(ref, 32), configured);
  EXPECT_NE(Bytes(ref->bytes, ref->bytes + 32), configured);
  std::uint8_t other[32] = {};
  EXPECT_NE(ProtectedKey_Attach(ref, 0, other), 0u);
  EXPECT_EQ(Read(ref, 32), configured);
}

}  // namespace
