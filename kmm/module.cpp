// The module entry and its one key context.
#include <sys/prctl.h>

#include <cstddef>
#include <cstring>

#include "kmm/internal.h"
#include "tpm/pcp.h"
#include "util/debug_print.h"
#include "util/secure.h"
#include "util/status.h"
#include "verdict/event_file.h"

using namespace keymgr::kmm;

// Hosts read the context by field, so its layout up to the status word is
// fixed; the records after it follow in declaration order.
static_assert(sizeof(KmmSeedKey) == kSeedKeySize);
static_assert(offsetof(KmmSeedKey, seedTime) == 8 && offsetof(KmmSeedKey, seedRandom) == 12);
static_assert(offsetof(KeyContext, oneOffKey) == 0);
static_assert(sizeof(KeyContext::oneOffKey) == kOneOffKeySize);
static_assert(offsetof(KeyContext, seedKey) == 32);
static_assert(offsetof(KeyContext, secretKeyBytes) == 76);
static_assert(sizeof(KeyContext::secretKeyBytes) == kSealedKeySize);
static_assert(offsetof(KeyContext, storeKeyBytes) == 124);
static_assert(sizeof(KeyContext::storeKeyBytes) == kSealedKeySize);
static_assert(offsetof(KeyContext, reserved) == 172 && sizeof(KeyContext::reserved) == 476);
static_assert(offsetof(KeyContext, statusWord) == 648 && sizeof(KeyContext::statusWord) == 2);
static_assert(offsetof(KeyContext, statusWord) < offsetof(KeyContext, oneOffKeyRef) &&
              offsetof(KeyContext, oneOffKeyRef) < offsetof(KeyContext, oneOffKeyRefLength) &&
              offsetof(KeyContext, oneOffKeyRefLength) < offsetof(KeyContext, seedKeyPK) &&
              offsetof(KeyContext, seedKeyPK) < offsetof(KeyContext, seedKeyLength) &&
              offsetof(KeyContext, seedKeyLength) < offsetof(KeyContext, secretKeyPK) &&
              offsetof(KeyContext, secretKeyPK) < offsetof(KeyContext, secretKeyLength) &&
              offsetof(KeyContext, secretKeyLength) < offsetof(KeyContext, storeKeyPK) &&
              offsetof(KeyContext, storeKeyPK) < offsetof(KeyContext, storeKeyLength) &&
              offsetof(KeyContext, storeKeyLength) < offsetof(KeyContext, cipherParamRef) &&
              offsetof(KeyContext, cipherParamRef) < offsetof(KeyContext, cipherParamLength));

namespace {
// The module's one context. Its address is what a successful entry returns.
KeyContext g_keyContext;

// CloseBoot ends what a boot may open when keys are sealed to it: the
// verdict PCR takes the separator after the first proof, whatever its
// outcome, so that nothing later in the boot (another proof, another
// process, a TPM resumed from its saved state) finds the good value there.
// A host keeps the context it got. The event log records the separator.
void CloseBoot() {
  const int pcr = pcp_seal_pcr();
  if (pcr < 0) {
    return;
  }
  const auto event = keymgr::verdict::SeparatorEvent(0, static_cast<std::uint32_t>(pcr));
  if (pcp_extend_pcr(static_cast<std::uint32_t>(pcr), event.digest.data()) != 0) {
    keymgr::LogRefused("extend of the separator");
    return;
  }
  if (!keymgr::verdict::AppendEvent(event).ok()) {
    keymgr::LogRefused("event log");
  }
}
}  // namespace

extern "C" KeyContext* KeyManage(int32_t option, int logFlag) {
  // Every entry starts from nothing, even one that is then rejected.
  std::memset(&g_keyContext, 0, sizeof(g_keyContext));
  // From here until the process ends it holds key material: the flow's, then
  // the context it returns (masked, but under a key that is in memory too),
  // and what tpm2-tss frees without wiping. A core dump would carry all of
  // it, so the kernel writes none.
  (void)::prctl(PR_SET_DUMPABLE, 0);
  // The flow's TPM calls share one connection, and nothing of the TPM stays
  // held once the entry returns.
  pcp_hold_connection();
  keymgr::ScopeExit release([] { pcp_release_connection(); });
  if (option == KMM_OPTION_NORMAL_BOOT) {
    const int proved = NormalBoot(&g_keyContext, logFlag);
    CloseBoot();
    if (proved != 0) {
      DebugPrint("Normal Boot Error!!\n");
      return nullptr;
    }
  } else if (option == KMM_OPTION_REGENERATE) {
    int failed = RegenerateKey(&g_keyContext) != 0 ? 1 : 0;
    if (failed == 1) {
      DebugPrint("Regenerate Key Error!!\n");
      return nullptr;
    }
  } else {
    DebugPrint("Key manage option invalid(%d)!!\n", option);
    return nullptr;
  }
  return &g_keyContext;
}
