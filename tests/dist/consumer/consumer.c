/* A host of libkmm in C, built against the installed tree. It asks for an
 * option the module rejects, which needs neither a TPM nor an EEPROM. */
#include <kmm/kmm.h>
#include <stdio.h>

int main(void) {
  printf("kmm %d.%d\n", KMM_VERSION_MAJOR, KMM_VERSION_MINOR);
  fflush(stdout);
  return KeyManage(2, 0) == NULL ? 0 : 1;
}
