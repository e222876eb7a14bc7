// The C entry points of the platform key manager and the connection they
// share while a caller holds it.
#include <optional>

#include "tpm/keys.h"
#include "tpm/pcp.h"
#include "util/random.h"
#include "util/secure.h"

namespace {

using keymgr::Secret;
using keymgr::Status;
using namespace keymgr::tpm;

// The connection held by pcp_hold_connection, opened by the first call that
// needs it.
bool g_holding = false;
std::optional<Connection> g_held;
// Set when the held connection could not be opened or lost its TPM (a
// command left unanswered past its deadline, a transport that failed).
// Until the hold ends every call fails at once, so that a TPM that stops
// answering costs one deadline per held call, not one per command.
bool g_heldLost = false;

// OnTpm runs |op| on the held connection, or on one of its own that closes
// when the call ends. SIGPIPE stays blocked while the TPM is used.
template <class Op>
int OnTpm(Op op) {
  if (g_holding && g_heldLost) {
    return 1;
  }
  SigpipeBlock sigpipe;
  std::optional<Connection> own;
  std::optional<Connection>& slot = g_holding ? g_held : own;
  if (!slot) {
    slot.emplace();
    if (!Connect(*slot).ok()) {
      slot.reset();
      g_heldLost = g_holding;
      return 1;
    }
  }
  const Status status = op(*slot);
  if (slot->broken) {
    slot.reset();
    g_heldLost = g_holding;
  }
  return status.ok() ? 0 : 1;
}

}  // namespace

void pcp_hold_connection(void) {
  g_holding = true;
  g_heldLost = false;
}

void pcp_release_connection(void) {
  SigpipeBlock sigpipe;
  g_held.reset();
  g_holding = false;
  g_heldLost = false;
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

void pcp_set_transport_for_testing(const char* tcti, int deadlineMs) {
  SetTransport(tcti, deadlineMs);
}

void pcp_set_seal_pcr_for_testing(int pcr) {
  SetSealPcr(pcr);
}

int pcp_persist_srk(void) {
  return OnTpm([](Connection& tpm) { return PersistSrk(tpm); });
}
