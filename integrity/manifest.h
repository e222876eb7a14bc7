// The file-integrity manifest: building the digest file, checking one file
// and checking the whole list at boot.
#pragma once

// HashManifest rewrites the digest file from the files the manifest lists.
// Returns 1 when either file could not be opened, else 0.
int HashManifest();

// VerifyManifestFile checks the first manifest entry equal to |path| and
// prints both digests. A null or unlisted path prints nothing.
void VerifyManifestFile(const char* path);

// VerifyManifest checks every listed file, stopping at the first failure,
// and writes BN=OK or BN=FAIL to the boot status log. |verbose| 1 prints the
// per-file lines. Returns 1 when either file could not be opened, else 0.
int VerifyManifest(int verbose);
