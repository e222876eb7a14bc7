#include "crypto_faults.h"

#include <kmm/dtc.h>

namespace keymgr::test {

CryptoFaults& Crypto() {
  static CryptoFaults faults;
  return faults;
}

namespace {
// Hit counts the call and returns its fault when this is the armed one.
const CryptoFault* Hit(CryptoCall call) {
  auto i = static_cast<int>(call);
  int n = ++Crypto().calls[i];
  const CryptoFault& f = Crypto().faults[i];
  return f.at == n ? &f : nullptr;
}

uint32_t Finish(const CryptoFault* f, uint32_t code, uint32_t* outLength) {
  if (f != nullptr && code == 0) {
    *outLength = f->length;
  }
  return code;
}
}  // namespace

}  // namespace keymgr::test

using keymgr::test::Crypto;
using keymgr::test::CryptoCall;
using keymgr::test::Hit;

extern "C" {

CryptoContainer __real_VKT_DTC_CreateCryptoContainer(void);
uint32_t __real_VKT_DTC_DestroyCryptoContainer(CryptoContainer);
uint32_t __real_VKT_DTC_GetHash(CryptoContainer, uint32_t, const ProtectedKey*, uint32_t,
                                ProtectedKey*, uint32_t*);
uint32_t __real_VKT_DTC_AES_Init(CryptoContainer, uint32_t, uint32_t, const ProtectedKey*, uint32_t,
                                 const ProtectedKey*);
uint32_t __real_VKT_DTC_AES_Process(CryptoContainer, const ProtectedKey*, uint32_t, ProtectedKey*,
                                    uint32_t*);

CryptoContainer __wrap_VKT_DTC_CreateCryptoContainer(void) {
  if (Hit(CryptoCall::kCreate) != nullptr) {
    return nullptr;
  }
  CryptoContainer c = __real_VKT_DTC_CreateCryptoContainer();
  Crypto().created += c != nullptr ? 1 : 0;
  return c;
}

uint32_t __wrap_VKT_DTC_DestroyCryptoContainer(CryptoContainer c) {
  ++Crypto().destroyed;
  return __real_VKT_DTC_DestroyCryptoContainer(c);
}

uint32_t __wrap_VKT_DTC_GetHash(CryptoContainer c, uint32_t selector, const ProtectedKey* in,
                                uint32_t inLength, ProtectedKey* out, uint32_t* outLength) {
  const auto* f = Hit(CryptoCall::kHash);
  if (f != nullptr && f->code != 0) {
    return f->code;
  }
  return keymgr::test::Finish(f, __real_VKT_DTC_GetHash(c, selector, in, inLength, out, outLength),
                              outLength);
}

uint32_t __wrap_VKT_DTC_AES_Init(CryptoContainer c, uint32_t direction, uint32_t mode,
                                 const ProtectedKey* key, uint32_t keyLength,
                                 const ProtectedKey* param) {
  const auto* f = Hit(CryptoCall::kAesInit);
  if (f != nullptr && f->code != 0) {
    return f->code;
  }
  return __real_VKT_DTC_AES_Init(c, direction, mode, key, keyLength, param);
}

uint32_t __wrap_VKT_DTC_AES_Process(CryptoContainer c, const ProtectedKey* in, uint32_t inLength,
                                    ProtectedKey* out, uint32_t* outLength) {
  const auto* f = Hit(CryptoCall::kAesProcess);
  if (f != nullptr && f->code != 0) {
    return f->code;
  }
  return keymgr::test::Finish(f, __real_VKT_DTC_AES_Process(c, in, inLength, out, outLength),
                              outLength);
}

}  // extern "C"
