// kmm-host: an example host of the key-management module.
//   kmm-host OPTION [LOG_FLAG]   KeyManage(OPTION, LOG_FLAG); exit 0 when a
//                                context came back, 1 when none did
//   kmm-host dmsetup             CheckDmsetupDigest; exit 0 on a match
//   kmm-host srk                 KmmPersistSrk; exit 0 when the SRK is persistent
#include <kmm/kmm.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

constexpr int kUsageStatus = 2;

int Usage() {
  std::fprintf(stderr, "usage: kmm-host OPTION [LOG_FLAG] | kmm-host dmsetup | kmm-host srk\n");
  return kUsageStatus;
}

// ParseInt accepts a whole decimal int, sign allowed, and nothing else.
bool ParseInt(const char* text, int* value) {
  if (text == nullptr || *text == '\0') {
    return false;
  }
  char* end = nullptr;
  errno = 0;
  long parsed = std::strtol(text, &end, 10);
  if (errno != 0 || *end != '\0' || parsed < INT_MIN || parsed > INT_MAX) {
    return false;
  }
  *value = static_cast<int>(parsed);
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && std::strcmp(argv[1], "dmsetup") == 0) {
    int result = CheckDmsetupDigest();
    std::fflush(stdout);
    return result == 0 ? 0 : 1;
  }
  if (argc == 2 && std::strcmp(argv[1], "srk") == 0) {
    return KmmPersistSrk() == 0 ? 0 : 1;
  }
  int option = 0;
  int logFlag = 0;
  if (argc < 2 || argc > 3 || !ParseInt(argv[1], &option) ||
      (argc == 3 && !ParseInt(argv[2], &logFlag))) {
    return Usage();
  }
  // A regeneration's seed key comes from random(); without fresh seeding
  // the secret key could be guessed, so that run does not go ahead.
  if (KmmSeedRandom() < 0 && option == KMM_OPTION_REGENERATE) {
    std::fprintf(stderr, "kmm-host: no random source to seed the key generation\n");
    return 1;
  }
  KeyContext* context = KeyManage(option, logFlag);
  std::fflush(stdout);
  return context != nullptr ? 0 : 1;
}
