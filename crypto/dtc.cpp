#include <kmm/dtc.h>

uint32_t VKT_DTC_GetConstant(uint32_t, ProtectedKey**, uint32_t*) {
  return DTC_E_BACKEND;
}
CryptoContainer VKT_DTC_CreateCryptoContainer(void) {
  return nullptr;
}
uint32_t VKT_DTC_DestroyCryptoContainer(CryptoContainer) {
  return 0;
}
uint32_t VKT_DTC_GetHash(CryptoContainer, uint32_t, const ProtectedKey*, uint32_t, ProtectedKey*,
                         uint32_t*) {
  return DTC_E_BACKEND;
}
uint32_t VKT_DTC_AES_Init(CryptoContainer, uint32_t, uint32_t, const ProtectedKey*, uint32_t,
                          const ProtectedKey*) {
  return DTC_E_BACKEND;
}
uint32_t VKT_DTC_AES_Process(CryptoContainer, const ProtectedKey*, uint32_t, ProtectedKey*,
                             uint32_t*) {
  return DTC_E_BACKEND;
}
uint32_t ProtectedKey_Attach(ProtectedKey*, uint32_t, uint8_t*) {
  return 0;
}
uint32_t ProtectedKey_SetLength(ProtectedKey*, uint32_t) {
  return 0;
}
uint8_t ProtectedKey_ByteAt(const ProtectedKey*, uint32_t) {
  return 0;
}
