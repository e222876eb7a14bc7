#include "integrity/manifest.h"

int HashManifest() {
  return 1;
}
void VerifyManifestFile(const char*) {}
int VerifyManifest(int) {
  return 1;
}
