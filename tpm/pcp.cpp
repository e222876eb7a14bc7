// The C entry points of the platform key manager and the connection they
// share while a caller holds it.
#include <optional>

#include "tpm/chain.h"
#include "tpm/keys.h"
#include "tpm/pcp.h"
#include "util/random.h"
#include "util/secure.h"

namespace {

using keymgr::Secret;
using keymgr::Status;
using namespace keymgr::tpm;

// Held is the connection that pcp_hold_connection holds for the calls that
// follow, opened by the first call that needs it. The C interface carries no
// handle, so the one hold of this single-threaded module lives here.
struct Held {
  bool holding = false;
  std::optional<Connection> connection;
  // Set when the held connection could not be opened or lost its TPM (a
  // command left unanswered past its deadline, a transport that failed).
  // Until the hold ends every call fails at once, so that a TPM that stops
  // answering costs one deadline per held call, not one per command.
  bool lost = false;
};
Held g_held;

// OnTpm runs |op| on the held connection, or on one of its own that closes
// when the call ends, opened with the build's options. SIGPIPE stays blocked
// while the TPM is used.
template <class Op>
int OnTpm(Op op) {
  if (g_held.holding && g_held.lost) {
    return 1;
  }
  SigpipeBlock sigpipe;
  std::optional<Connection> own;
  std::optional<Connection>& slot = g_held.holding ? g_held.connection : own;
  if (!slot) {
    slot.emplace();
    if (!Connect(*slot, BuildOptions()).ok()) {
      slot.reset();
      g_held.lost = g_held.holding;
      return 1;
    }
  }
  const Status status = op(*slot);
  if (slot->broken) {
    slot.reset();
    g_held.lost = g_held.holding;
  }
  return status.ok() ? 0 : 1;
}

}  // namespace

void pcp_hold_connection(void) {
  g_held.holding = true;
  g_held.lost = false;
}

void pcp_release_connection(void) {
  SigpipeBlock sigpipe;
  g_held = Held();
}

int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  if (count == 0) {
    return 0;
  }
  if (dst == nullptr || count > kMaxRandom) {
    return 1;
  }
  // The TPM's bytes are mixed with the kernel's, and either serves alone when
  // the other cannot be had: a TPM that fails or falls silent never leaves a
  // key at a fixed value, and one whose generator is weak gives nothing away.
  // The kernel is waited for only when the TPM did not answer.
  Secret<kMaxRandom> fromTpm;
  Secret<kMaxRandom> fromKernel;
  const bool tpmAnswered =
      OnTpm([&](Connection& tpm) { return DrawRandom(tpm, count, fromTpm.data()); }) == 0;
  const bool kernelAnswered = keymgr::KernelRandom(
      fromKernel.data(), count, tpmAnswered ? keymgr::KernelWait::kNo : keymgr::KernelWait::kYes);
  if (!tpmAnswered && !kernelAnswered) {
    return 1;
  }
  for (uint32_t i = 0; i < count; ++i) {
    dst[i] =
        static_cast<uint8_t>((tpmAnswered ? fromTpm[i] : 0) ^ (kernelAnswered ? fromKernel[i] : 0));
  }
  return 0;
}

int pcp_getEntropyBytes(uint32_t count, uint8_t* dst, uint32_t* drawn) {
  return OnTpm([&](Connection& tpm) { return DrawEntropy(tpm, count, dst, drawn); });
}

int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t /*flags*/) {
  return OnTpm([&](Connection& tpm) { return CreateKey(tpm, nameDigest, passwordDigest, bits); });
}

int pcp_delete_key(const uint8_t* nameDigest, uint32_t /*flags*/) {
  return OnTpm([&](Connection& tpm) { return DeleteKey(tpm, nameDigest); });
}

int pcp_evict_stale_keys(const uint8_t* keepNameDigest) {
  return OnTpm([&](Connection& tpm) { return EvictStaleKeys(tpm, keepNameDigest); });
}

int pcp_list_keys(uint32_t* handles, uint32_t capacity, uint32_t* count) {
  if ((handles == nullptr && capacity != 0) || count == nullptr) {
    return 1;
  }
  return OnTpm([&](Connection& tpm) {
    return ListOwnKeys(tpm, std::span<uint32_t>(handles, capacity), count);
  });
}

uint32_t pcp_key_handle(const char* nameHex) {
  return nameHex != nullptr ? HandleOfName(nameHex) : 0;
}

int pcp_encryptDataFragment(const char* nameHex, const char* /*passHex*/, const uint8_t* data,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return OnTpm([&](Connection& tpm) { return Seal(tpm, nameHex, data, length, out, outSize); });
}

int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return OnTpm([&](Connection& tpm) {
    return Unseal(tpm, nameHex, passHex, fragment, length, out, outSize);
  });
}

int pcp_extend_pcr(uint32_t pcr, const uint8_t* digest) {
  if (digest == nullptr) {
    return 1;
  }
  return OnTpm([&](Connection& tpm) {
    return ExtendPcr(tpm, pcr, std::span<const uint8_t, 32>(digest, 32));
  });
}

int pcp_seal_pcr(void) {
  return BuildOptions().sealPcr;
}

int pcp_persist_srk(void) {
  return OnTpm([](Connection& tpm) { return PersistSrk(tpm); });
}
