// tpm_proxy LISTEN UPSTREAM LOG: a counter on the TPM socket. It accepts
// connections on the unix socket LISTEN, relays each command to the swtpm
// socket UPSTREAM, and appends a line to LOG for every command: its code and
// its first handle (for TPM2_StartAuthSession, the salting key), both in hex.
#include <unistd.h>

#include <cstdio>

#include "tpm_proxy.h"

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: tpm_proxy LISTEN UPSTREAM LOG\n");
    return 2;
  }
  std::FILE* log = std::fopen(argv[3], "a");
  if (log == nullptr) {
    std::perror("tpm_proxy: log");
    return 1;
  }
  const keymgr::test::TpmProxy proxy(argv[1], argv[2], log);
  for (;;) {
    pause();
  }
}
