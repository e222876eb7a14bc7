#include "platform/eeprom.h"

int ReadEEPROM(int, uint32_t, uint32_t, void*) {
  return -1;
}
int ReadEEPROM_msok(int, uint32_t, uint32_t, void*) {
  return -1;
}
int WriteSectionEEPROM(int, uint32_t, uint32_t, const void*, uint32_t, uint32_t) {
  return -1;
}
int WriteEEPROM_Bytes_Sema(int, uint32_t, uint32_t, const void*) {
  return -1;
}
