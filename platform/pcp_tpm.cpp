#include "platform/pcp.h"

int pcp_getRandomBytes(uint32_t, uint8_t*) {
  return 1;
}
int pcp_create_key(const uint8_t*, const uint8_t*, uint32_t, uint32_t) {
  return 1;
}
int pcp_delete_key(const uint8_t*, uint32_t) {
  return 1;
}
int pcp_encryptDataFragment(const char*, const char*, const uint8_t*, uint32_t, uint8_t*,
                            uint32_t*) {
  return 1;
}
int pcp_decryptDataFragment(const char*, const char*, const uint8_t*, uint32_t, uint8_t*,
                            uint32_t*) {
  return 1;
}
