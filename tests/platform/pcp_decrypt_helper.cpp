// pcp_decrypt_helper NAMEHEX PASSHEX FRAGMENTHEX opens a sealed fragment the
// way a later boot does, in a fresh process, and prints the plaintext as
// upper-case hex. Exit 0 on success, 1 when the key manager fails, 2 on usage.
#include <cstdio>
#include <cstring>
#include <vector>

#include "platform/pcp.h"

int main(int argc, char** argv) {
  if (argc != 4 || std::strlen(argv[3]) % 2 != 0) {
    return 2;
  }
  std::vector<uint8_t> fragment;
  for (const char* p = argv[3]; *p != '\0'; p += 2) {
    unsigned byte = 0;
    if (std::sscanf(p, "%2x", &byte) != 1) {
      return 2;
    }
    fragment.push_back(static_cast<uint8_t>(byte));
  }
  uint8_t plain[32];
  uint32_t plainSize = sizeof(plain);
  if (pcp_decryptDataFragment(argv[1], argv[2], fragment.data(),
                              static_cast<uint32_t>(fragment.size()), plain, &plainSize) != 0) {
    return 1;
  }
  for (uint32_t i = 0; i < plainSize; ++i) {
    std::printf("%02X", plain[i]);
  }
  return 0;
}
