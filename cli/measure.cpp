#include "cli/measure.h"

#include <fcntl.h>

#include <array>
#include <cstdint>
#include <cstdio>

#include "crypto/file_digest.h"
#include "integrity/signature.h"
#include "tpm/pcp.h"
#include "util/hex.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"
#include "util/status.h"

namespace keymgr::cli {

namespace {

// FileField appends ,"NAME":"SHA-256 of PATH" to |content| when the file
// can be hashed.
void FileField(const char* name, const char* path, char* content, std::size_t size,
               std::size_t* used) {
  std::array<std::uint8_t, crypto::kSha256Size> digest{};
  if (*used < size && ComputeFileDigest(path, digest).ok()) {
    *used += static_cast<std::size_t>(std::snprintf(content + *used, size - *used, ",\"%s\":\"%s\"",
                                                    name, HexText(digest, HexCase::kLower).data()));
  }
}

// ReleaseField appends ,"release":N, the counter of keymgr.sig, when a
// signed build reads one.
void ReleaseField(char* content, std::size_t size, std::size_t* used) {
#if KEYMGR_SIGNED_BUILD
  std::array<std::uint8_t, integrity::kSignatureFileSize> bytes{};
  integrity::SignatureFile signature;
  const File file = OpenFile(kSignaturePath, "r");
  if (*used < size && file &&
      std::fread(bytes.data(), 1, bytes.size(), file.get()) == bytes.size() &&
      integrity::DecodeSignatureFile(bytes, &signature).ok()) {
    *used +=
        static_cast<std::size_t>(std::snprintf(content + *used, size - *used, ",\"release\":%llu",
                                               static_cast<unsigned long long>(signature.counter)));
  }
#else
  (void)content;
  (void)size;
  (void)used;
#endif
}

}  // namespace

void MeasureVerdict(unsigned pcr, verdict::Verdict verdict) {
  const verdict::PcrValue digest = verdict::VerdictDigest(verdict);
  const bool extended = pcp_extend_pcr(pcr, digest.data()) == 0;
  if (!extended) {
    LogRefused("extend of the boot verdict");
  }
  // The record of the event: the TCG canonical event log's JSON form, one
  // record a line. What it names beside the verdict is for a verifier; only
  // the verdict is measured.
  char content[512];
  std::size_t used = static_cast<std::size_t>(std::snprintf(
      content, sizeof(content), "{\"verdict\":\"%s\"", verdict::VerdictName(verdict)));
  if (verdict != verdict::Verdict::kNone) {
    FileField("manifest_sha256", kManifestPath, content, sizeof(content), &used);
    FileField("digests_sha256", kDigestFilePath, content, sizeof(content), &used);
    ReleaseField(content, sizeof(content), &used);
  }
  char line[768];
  const int length =
      std::snprintf(line, sizeof(line),
                    "{\"recnum\":0,\"pcr\":%u,\"digests\":[{\"hashAlg\":\"sha256\","
                    "\"digest\":\"%s\"}],\"content_type\":\"keymgr\",\"content\":%s}}\n",
                    pcr, HexText(digest, HexCase::kLower).data(), content);
  // The log lies beside the status log and is kept with the same care. A
  // failed extend leaves it empty, so that it never claims an event the PCR
  // does not hold.
  const Descriptor log =
      OpenRegular(kEventLogPath, O_WRONLY | O_CREAT | O_TRUNC, nullptr, Look::kOwnName);
  if (!log ||
      (extended && length > 0 && !WriteAll(log.get(), line, static_cast<std::size_t>(length)))) {
    LogErrno(!log ? "open" : "write");
  }
}

}  // namespace keymgr::cli
