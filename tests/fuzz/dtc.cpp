// The crypto services' entry points in any order, with any selector, index,
// option and length a caller could pass, over arrays large enough for every
// length the services accept. What a call reports must hold: a sized record
// reads back the bytes it took in, a hash is the SHA-256 of the plain input,
// an AES run is AES-256-CBC under the plain key and parameter, and a refused
// call writes nothing.
#include <fuzzer/FuzzedDataProvider.h>
#include <openssl/evp.h>

#include <array>
#include <cstdint>
#include <vector>

#include "crypto/dtc.h"
#include "support/files.h"

namespace {

using keymgr::test::Require;
using Bytes = std::vector<std::uint8_t>;

// The services accept at most 1024 bytes; the arrays leave room beyond that
// so that a length they should refuse still stays inside the array.
constexpr std::uint32_t kArraySize = 1100;
// Static, because the library's constant 1 may stay bound to one across runs.
std::array<std::array<std::uint8_t, kArraySize>, 3> g_arrays;
std::array<ProtectedKey, 3> g_records;

ProtectedKey* Constant(std::uint32_t index) {
  ProtectedKey* ref = nullptr;
  std::uint32_t length = 0;
  (void)VKT_DTC_GetConstant(index, &ref, &length);
  return ref;
}

// Capacity is how many bytes may be read or written behind |key|: a whole
// array of the harness, or the length of the library's own constants 2 and 3.
std::uint32_t Capacity(const ProtectedKey* key) {
  if (key == Constant(DTC_CONST_AES_PARAM) || key == Constant(DTC_CONST_DMSETUP_DIGEST)) {
    return key->length;
  }
  return key->bytes != nullptr ? kArraySize : 0;
}

// Plain reads |count| bytes of |key| through ProtectedKey_ByteAt.
Bytes Plain(const ProtectedKey* key, std::uint32_t count) {
  Bytes bytes(count);
  for (std::uint32_t i = 0; i < count; ++i) {
    bytes[i] = ProtectedKey_ByteAt(key, i);
  }
  return bytes;
}

Bytes Aes(bool encrypt, const Bytes& key, const Bytes& iv, const Bytes& in) {
  Bytes out(in.size() + 16);
  int moved = 0, last = 0;
  EVP_CIPHER_CTX* ctx = EVP_CIPHER_CTX_new();
  Require(ctx != nullptr &&
          EVP_CipherInit_ex(ctx, EVP_aes_256_cbc(), nullptr, key.data(), iv.data(), encrypt) == 1 &&
          EVP_CIPHER_CTX_set_padding(ctx, 0) == 1 &&
          EVP_CipherUpdate(ctx, out.data(), &moved, in.data(), static_cast<int>(in.size())) == 1 &&
          EVP_CipherFinal_ex(ctx, out.data() + moved, &last) == 1);
  EVP_CIPHER_CTX_free(ctx);
  out.resize(static_cast<std::size_t>(moved + last));
  return out;
}

struct Job {
  CryptoContainer container;
  bool aesReady = false, encrypt = false;
  Bytes key, iv;  // plain, as they were when the AES job was set up
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzedDataProvider in(data, size);
  for (auto& array : g_arrays) {
    const Bytes fill = in.ConsumeBytes<std::uint8_t>(64);
    for (std::size_t i = 0; i < array.size(); ++i) {
      array[i] = fill.empty() ? 0 : fill[i % fill.size()];
    }
  }
  g_records = {};
  const std::array<ProtectedKey*, 6> records = {&g_records[0],
                                                &g_records[1],
                                                &g_records[2],
                                                Constant(DTC_CONST_AES_KEY),
                                                Constant(DTC_CONST_AES_PARAM),
                                                Constant(DTC_CONST_DMSETUP_DIGEST)};
  (void)ProtectedKey_Attach(records[3], 0, g_arrays[0].data());  // nothing of an earlier run
  const auto record = [&] { return records[in.ConsumeIntegralInRange<std::size_t>(0, 5)]; };
  const auto selector = [&](std::uint32_t valid) {
    return in.ConsumeBool() ? valid : in.ConsumeIntegral<std::uint32_t>();
  };
  const auto length = [&] { return in.ConsumeIntegralInRange<std::uint32_t>(0, kArraySize); };
  std::vector<Job> jobs;
  // job picks one of the live containers, or none when there is none.
  const auto job = [&]() -> Job* {
    return jobs.empty() ? nullptr
                        : &jobs[in.ConsumeIntegralInRange<std::size_t>(0, jobs.size() - 1)];
  };
  for (int step = 0; step < 64 && in.remaining_bytes() > 0; ++step) {
    const auto before = g_arrays;
    std::uint32_t code = 0;
    switch (in.ConsumeIntegralInRange(0, 7)) {
      case 0: {
        const auto index = in.ConsumeIntegralInRange<std::uint32_t>(0, 4);
        ProtectedKey* ref = nullptr;
        std::uint32_t refLength = 0;
        code = VKT_DTC_GetConstant(index, &ref, &refLength);
        Require((code == 0) == (index >= 1 && index <= 3) && (ref != nullptr) == (code == 0));
        break;
      }
      case 1: {  // an attachment writes nothing, refused or not
        ProtectedKey* key = record();
        const auto array = in.ConsumeIntegralInRange<std::size_t>(0, 2);
        (void)ProtectedKey_Attach(key, selector(0), g_arrays[array].data());
        continue;
      }
      case 2: {
        ProtectedKey* key = record();
        const std::uint32_t count = length();
        if (count > Capacity(key)) {
          continue;
        }
        const Bytes plain = Plain(key, count);
        code = ProtectedKey_SetLength(key, count);
        Require(code != 0 || Plain(key, count) == plain);
        break;
      }
      case 3:
        if (jobs.size() < 4) {
          jobs.push_back(Job{VKT_DTC_CreateCryptoContainer()});
          Require(jobs.back().container != nullptr);
        }
        continue;
      case 4:
        if (Job* live = job()) {
          Require(VKT_DTC_DestroyCryptoContainer(live->container) == 0);
          jobs.erase(jobs.begin() + (live - jobs.data()));
        }
        continue;
      case 5: {
        Job* hash = job();
        const ProtectedKey* input = record();
        ProtectedKey* output = record();
        const std::uint32_t count = length();
        std::uint32_t produced = in.ConsumeIntegralInRange<std::uint32_t>(0, 40);
        if (hash == nullptr || count > Capacity(input) || Capacity(output) < 32) {
          continue;
        }
        const Bytes plain = Plain(input, count);
        const std::string expected =
            keymgr::test::Sha256({reinterpret_cast<const char*>(plain.data()), plain.size()});
        code = VKT_DTC_GetHash(hash->container, selector(DTC_HASH_SELECTOR), input, count, output,
                               &produced);
        Require(code != 0 ||
                (produced == 32 && Plain(output, 32) == Bytes(expected.begin(), expected.end())));
        break;
      }
      case 6: {
        Job* aes = job();
        if (aes == nullptr) {
          continue;
        }
        const std::uint32_t direction =
            selector(in.ConsumeBool() ? DTC_AES_ENCRYPT : DTC_AES_DECRYPT);
        const ProtectedKey* key = record();
        const ProtectedKey* param = record();
        code = VKT_DTC_AES_Init(aes->container, direction, selector(DTC_AES_MODE), key,
                                in.ConsumeBool() ? 32 : in.ConsumeIntegral<std::uint32_t>(), param);
        if (code == 0) {
          *aes = {aes->container, true, direction == DTC_AES_ENCRYPT, Plain(key, 32),
                  Plain(param, 16)};
        }
        break;
      }
      default: {
        Job* aes = job();
        const ProtectedKey* input = record();
        ProtectedKey* output = record();
        const std::uint32_t count = length();
        std::uint32_t produced = 0;
        if (aes == nullptr || count > Capacity(input) || count > Capacity(output)) {
          continue;
        }
        const Bytes plain = Plain(input, count);
        code = VKT_DTC_AES_Process(aes->container, input, count, output, &produced);
        Require(code != 0 || (aes->aesReady && produced == count &&
                              Plain(output, count) == Aes(aes->encrypt, aes->key, aes->iv, plain)));
        aes->aesReady = aes->aesReady && code != 0;
        break;
      }
    }
    Require(code == 0 || g_arrays == before);
  }
  for (const Job& live : jobs) {
    Require(VKT_DTC_DestroyCryptoContainer(live.container) == 0);
  }
  return 0;
}
