// pcp_bench [N] runs each key manager operation N times (default 7) against
// the build's TPM and prints the median time of each in milliseconds.
// pcp_bench --tcti prints the build's TPM transport.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "tpm/pcp.h"
#include "util/bytes.h"

namespace {

struct Key {
  char nameHex[41];
  char passHex[41];
  uint8_t nameDigest[16];
  uint8_t passDigest[16];
  uint8_t sealed[284];
};

double Median(std::vector<double> samples) {
  std::sort(samples.begin(), samples.end());
  size_t mid = samples.size() / 2;
  return samples.size() % 2 != 0 ? samples[mid] : (samples[mid - 1] + samples[mid]) / 2;
}

// Time runs |op| and adds its duration in milliseconds to |samples|; a
// failed operation ends the benchmark.
template <typename Op>
void Time(const char* what, std::vector<double>& samples, Op op) {
  auto start = std::chrono::steady_clock::now();
  int rc = op();
  auto end = std::chrono::steady_clock::now();
  if (rc != 0) {
    std::fprintf(stderr, "%s failed\n", what);
    std::exit(1);
  }
  samples.push_back(std::chrono::duration<double, std::milli>(end - start).count());
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1 && std::strcmp(argv[1], "--tcti") == 0) {
    std::printf("%s\n", KEYMGR_TCTI);
    return 0;
  }
  int rounds = argc > 1 ? std::atoi(argv[1]) : 7;
  if (rounds < 1 || rounds > 1000) {
    std::fprintf(stderr, "usage: %s [N]|--tcti\n", argv[0]);
    return 2;
  }
  std::vector<Key> keys(static_cast<size_t>(rounds));
  std::vector<double> random, create, encrypt, decrypt, remove;
  uint8_t ook[32];
  for (Key& key : keys) {
    uint8_t raw[20];
    Time("getRandom 32", random, [&] { return pcp_getRandomBytes(32, ook); });
    // Any bytes make a name and a password; the timing is the point here.
    (void)pcp_getRandomBytes(20, raw);
    (void)BytesToHex(raw, 20, key.nameHex, 41);
    (void)pcp_getRandomBytes(20, raw);
    (void)BytesToHex(raw, 20, key.passHex, 41);
    Md5OfString(key.nameHex, key.nameDigest);
    Md5OfString(key.passHex, key.passDigest);
    Time("create 2048", create,
         [&] { return pcp_create_key(key.nameDigest, key.passDigest, 2048, 0); });
  }
  for (Key& key : keys) {
    uint32_t size = sizeof(key.sealed);
    Time("encrypt", encrypt, [&] {
      return pcp_encryptDataFragment(key.nameHex, key.passHex, ook, 32, key.sealed, &size);
    });
  }
  for (Key& key : keys) {
    uint8_t plain[32];
    uint32_t size = sizeof(plain);
    Time("decrypt", decrypt, [&] {
      return pcp_decryptDataFragment(key.nameHex, key.passHex, key.sealed, 268, plain, &size);
    });
  }
  for (Key& key : keys) {
    Time("delete", remove, [&] { return pcp_delete_key(key.nameDigest, 0); });
  }
  std::printf("median of %d runs, ms\n", rounds);
  std::printf("getRandom 32   %9.2f\n", Median(random));
  std::printf("create 2048    %9.2f\n", Median(create));
  std::printf("encrypt        %9.2f\n", Median(encrypt));
  std::printf("decrypt        %9.2f\n", Median(decrypt));
  std::printf("delete         %9.2f\n", Median(remove));
  return 0;
}
