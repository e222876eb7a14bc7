// pcp_decrypt_helper NAMEHEX PASSHEX FRAGMENT opens a sealed fragment, given
// as "%02X " groups, in a process of its own, as a later boot does, and
// writes the plaintext to stdout. Exit 1 when that fails.
#include <cstdio>
#include <cstdlib>

#include "platform/pcp.h"

int main(int argc, char** argv) {
  uint8_t fragment[PCP_FRAGMENT_SIZE], plain[32];
  uint32_t length = 0, size = sizeof(plain);
  for (char* at = argc == 4 ? argv[3] : nullptr; at && *at && length < sizeof(fragment);) {
    fragment[length++] = static_cast<uint8_t>(std::strtoul(at, &at, 16));
  }
  if (argc != 4 || pcp_decryptDataFragment(argv[1], argv[2], fragment, length, plain, &size) != 0) {
    return 1;
  }
  std::fwrite(plain, 1, size, stdout);
}
