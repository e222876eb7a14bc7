#include "cli/measure.h"

#include <fcntl.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <optional>

#include "crypto/file_digest.h"
#include "integrity/signature.h"
#include "tpm/pcp.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"
#include "util/status.h"
#include "verdict/event_log.h"

namespace keymgr::cli {

namespace {

// FileDigest is the SHA-256 of the file at |path|, when it can be hashed.
std::optional<verdict::PcrValue> FileDigest(const char* path) {
  verdict::PcrValue digest{};
  if (!ComputeFileDigest(path, digest).ok()) {
    return std::nullopt;
  }
  return digest;
}

// Release is the counter of keymgr.sig, when a signed build reads one.
std::optional<std::uint64_t> Release() {
#if KEYMGR_SIGNED_BUILD
  std::array<std::uint8_t, integrity::kSignatureFileSize> bytes{};
  integrity::SignatureFile signature;
  const File file = OpenFile(kSignaturePath, "r");
  if (file && std::fread(bytes.data(), 1, bytes.size(), file.get()) == bytes.size() &&
      integrity::DecodeSignatureFile(bytes, &signature).ok()) {
    return signature.counter;
  }
#endif
  return std::nullopt;
}

}  // namespace

void MeasureVerdict(unsigned pcr, verdict::Verdict verdict) {
  verdict::Event event;
  event.pcr = pcr;
  event.digest = verdict::VerdictDigest(verdict);
  event.verdict = verdict;
  const bool extended = pcp_extend_pcr(pcr, event.digest.data()) == 0;
  if (!extended) {
    LogRefused("extend of the boot verdict");
  }
  // The record of the event. What it names beside the verdict is for a
  // verifier; only the verdict is measured.
  if (verdict != verdict::Verdict::kNone) {
    event.manifestSha256 = FileDigest(kManifestPath);
    event.digestsSha256 = FileDigest(kDigestFilePath);
    event.release = Release();
  }
  std::array<char, verdict::kEventLineSize + 1> line{};
  const std::size_t length =
      verdict::EncodeEvent(event, std::span(line).first(verdict::kEventLineSize));
  line[length] = '\n';
  // The log lies beside the status log and is kept with the same care. A
  // failed extend leaves it empty, so that it never claims an event the PCR
  // does not hold.
  const Descriptor log =
      OpenRegular(kEventLogPath, O_WRONLY | O_CREAT | O_TRUNC, nullptr, Look::kOwnName);
  if (!log || (extended && length > 0 && !WriteAll(log.get(), line.data(), length + 1))) {
    LogErrno(!log ? "open" : "write");
  }
}

}  // namespace keymgr::cli
