// pcp_decrypt_helper NAMEHEX PASSHEX FRAGMENT_FILE opens a sealed fragment
// the way a later boot does, in a fresh process, and prints the plaintext as
// "%02X " groups. Exit 0 on success, 1 when the key manager fails, 2 on usage.
#include <cstdio>

#include "platform/pcp.h"

int main(int argc, char** argv) {
  std::FILE* file = argc == 4 ? std::fopen(argv[3], "rb") : nullptr;
  if (file == nullptr) {
    return 2;
  }
  uint8_t fragment[PCP_FRAGMENT_SIZE];
  size_t length = std::fread(fragment, 1, sizeof(fragment), file);
  std::fclose(file);
  uint8_t plain[32];
  uint32_t plainSize = sizeof(plain);
  if (pcp_decryptDataFragment(argv[1], argv[2], fragment, static_cast<uint32_t>(length), plain,
                              &plainSize) != 0) {
    return 1;
  }
  for (uint32_t i = 0; i < plainSize; ++i) {
    std::printf("%02X ", plain[i]);
  }
  return 0;
}
