#include "policy/file.h"

#include <algorithm>
#include <cstring>

#include "util/endian.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"

namespace keymgr::policy {

namespace {

constexpr std::uint8_t kMagic[4] = {'K', 'M', 'P', 'L'};

}  // namespace

void EncodePolicyFile(const PolicyFile& file, std::span<std::uint8_t, kPolicyFileSize> out) {
  std::memcpy(out.data(), kMagic, sizeof(kMagic));
  StoreBig32(out.data() + 4, kPolicyFileVersion);
  StoreBig64(out.data() + 8, file.release);
  StoreBig32(out.data() + 16, file.pcrs);
  std::copy(file.keyPolicy.begin(), file.keyPolicy.end(), out.begin() + 20);
  std::copy(file.counterPolicy.begin(), file.counterPolicy.end(), out.begin() + 52);
  std::copy(file.keySignature.begin(), file.keySignature.end(), out.begin() + 84);
  std::copy(file.counterSignature.begin(), file.counterSignature.end(),
            out.begin() + 84 + kRsaSignatureSize);
}

Status ReadPolicyFile(PolicyFile* file) {
  const File stream = OpenFile(kPolicyPath, "r");
  HeapBytes bytes;
  std::size_t size = 0;
  if (!stream || !ReadWhole(stream.get(), kPolicyFileSize, bytes, &size)) {
    return ErrnoFailure(kPolicyPath);
  }
  return DecodePolicyFile({bytes.get(), size}, file);
}

Status DecodePolicyFile(std::span<const std::uint8_t> bytes, PolicyFile* file) {
  if (bytes.size() != kPolicyFileSize || std::memcmp(bytes.data(), kMagic, sizeof(kMagic)) != 0) {
    return Refused("not a policy file");
  }
  if (LoadBig32(bytes.data() + 4) != kPolicyFileVersion) {
    return Refused("policy file of another format version");
  }
  file->release = LoadBig64(bytes.data() + 8);
  file->pcrs = LoadBig32(bytes.data() + 16);
  if (file->pcrs == 0 || (file->pcrs & ~kAllPcrs) != 0) {
    return Refused("policy file selects no PCR, or one past 23");
  }
  const auto at = [&](std::size_t offset, auto& field) {
    std::copy_n(bytes.begin() + static_cast<std::ptrdiff_t>(offset), field.size(), field.begin());
  };
  at(20, file->keyPolicy);
  at(52, file->counterPolicy);
  at(84, file->keySignature);
  at(84 + kRsaSignatureSize, file->counterSignature);
  return Status();
}

}  // namespace keymgr::policy
