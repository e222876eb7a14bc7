// kmm-host: an example host of the key-management module.
//   kmm-host OPTION [LOG_FLAG]   KeyManage(OPTION, LOG_FLAG); exit 0 when a
//                                context came back, 1 when none did
//   kmm-host dmsetup             CheckDmsetupDigest; exit 0 on a match
//   kmm-host srk                 KmmPersistSrk; exit 0 when the SRK is persistent
//   kmm-host keys                KmmListKeys: the handle of each key of this
//                                system in the TPM, one a line, " named" after
//                                the one keymgr.hddkeyid names; exit 1 when
//                                the TPM cannot be searched
#include <kmm/kmm.h>

#include <cstdint>
#include <cstdio>

#include "tools/host_args.h"

namespace {

constexpr int kUsageStatus = 2;

int Usage() {
  (void)std::fprintf(
      stderr,
      "usage: kmm-host OPTION [LOG_FLAG] | kmm-host dmsetup | kmm-host srk | kmm-host keys\n");
  return kUsageStatus;
}

int ListKeys() {
  // A TPM's persistent memory holds a few dozen objects at most.
  std::uint32_t handles[64];
  std::uint32_t named = 0;
  const int count = KmmListKeys(handles, 64, &named);
  if (count < 0 || count > 64) {
    (void)std::fprintf(stderr, "kmm-host: the TPM's keys cannot be listed\n");
    return 1;
  }
  for (int i = 0; i < count; ++i) {
    std::printf("0x%08X%s\n", handles[i], handles[i] == named ? " named" : "");
  }
  return std::fflush(stdout) == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  using Action = keymgr::tools::HostArgs::Action;
  const keymgr::tools::HostArgs args = keymgr::tools::ParseHostArgs(argc, argv);
  if (args.action == Action::kDmsetup) {
    int result = CheckDmsetupDigest();
    (void)std::fflush(stdout);
    return result == 0 ? 0 : 1;
  }
  if (args.action == Action::kSrk) {
    return KmmPersistSrk() == 0 ? 0 : 1;
  }
  if (args.action == Action::kKeys) {
    return ListKeys();
  }
  if (args.action == Action::kUsage) {
    return Usage();
  }
  // A regeneration's seed key comes from random(); without fresh seeding
  // the secret key could be guessed, so that run does not go ahead. A boot
  // proof draws nothing random and seeds nothing: early in boot it would
  // wait for the kernel's pool.
  if (args.option == KMM_OPTION_REGENERATE && KmmSeedRandom() < 0) {
    (void)std::fprintf(stderr, "kmm-host: no random source to seed the key generation\n");
    return 1;
  }
  KeyContext* context = KeyManage(args.option, args.logFlag);
  (void)std::fflush(stdout);
  return context != nullptr ? 0 : 1;
}
