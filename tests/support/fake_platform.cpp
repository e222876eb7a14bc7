#include "support/fake_platform.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "crypto/hash.h"
#include "eeprom/eeprom.h"
#include "tpm/pcp.h"

namespace keymgr::test {

namespace {

std::string Digest(const std::uint8_t* digest) {
  return {reinterpret_cast<const char*>(digest), 16};
}

std::string Md5(const char* text) {
  std::uint8_t digest[16];
  (void)Md5OfString(text, digest);
  return Digest(digest);
}

int Transfer(int device, std::uint32_t offset, std::uint32_t length, void* dst, const void* src) {
  FakeEeprom::Fault& fault = Eeprom().fault;
  if (device != eeprom::kDevice) {
    return -22;
  }
  if (fault.count > 0 && offset < fault.end && offset + length > fault.begin) {
    --fault.count;
    return -5;
  }
  std::memcpy(dst, src, length);
  return static_cast<int>(length);
}

// Fails tells whether this call of |op| is one to fail.
bool Fails(PcpOp op) {
  const unsigned call = KeyManager().calls[op]++;
  return call < 32 && ((KeyManager().fail[op] >> call) & 1) != 0;
}

}  // namespace

void FakeEeprom::Reset() {
  *this = {};
  image.fill(0xFF);
}

FakeEeprom& Eeprom() {
  static FakeEeprom eeprom;
  return eeprom;
}

FakeKeyManager& KeyManager() {
  static FakeKeyManager keyManager;
  return keyManager;
}

}  // namespace keymgr::test

using namespace keymgr::test;

extern "C" {

int ReadEEPROM(int device, uint32_t offset, uint32_t length, void* dst) {
  return Transfer(device, offset, length, dst, Eeprom().image.data() + offset);
}
int ReadEEPROM_msok(int device, uint32_t offset, uint32_t length, void* dst) {
  return ReadEEPROM(device, offset, length, dst);
}
int WriteEEPROM_Bytes_Sema(int device, uint32_t offset, uint32_t length, const void* src) {
  return Transfer(device, offset, length, Eeprom().image.data() + offset, src);
}
int WriteSectionEEPROM(int device, uint32_t offset, uint32_t length, const void* src,
                       uint32_t sectionStart, uint32_t sectionLength) {
  Eeprom().lastSection = {sectionStart, sectionLength};
  return WriteEEPROM_Bytes_Sema(device, offset, length, src);
}

void pcp_hold_connection(void) {}
void pcp_release_connection(void) {}
int pcp_persist_srk(void) {
  return 0;
}
int pcp_extend_pcr(uint32_t, const uint8_t*) {
  return 0;
}
int pcp_getEntropyBytes(uint32_t count, uint8_t* dst, uint32_t* drawn) {
  *drawn = count < 32 ? count : 32;
  return pcp_getRandomBytes(*drawn, dst);
}
int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  if (Fails(kRandom)) {
    return 1;
  }
  std::generate_n(dst, count, std::rand);
  return 0;
}
int pcp_create_key(const uint8_t* name, const uint8_t* password, uint32_t bits, uint32_t) {
  return Fails(kCreateKey) || bits != 2048 ||
         !KeyManager().keys.emplace(Digest(name), Digest(password)).second;
}
int pcp_delete_key(const uint8_t* name, uint32_t) {
  return KeyManager().keys.erase(Digest(name)) != 1;
}
int pcp_evict_stale_keys(const uint8_t* keep) {
  std::erase_if(KeyManager().keys,
                [&](const auto& key) { return keep == nullptr || key.first != Digest(keep); });
  return 0;
}
int pcp_list_keys(uint32_t* handles, uint32_t capacity, uint32_t* count) {
  *count = 0;
  for (const auto& key : KeyManager().keys) {
    if (*count < capacity) {
      handles[*count] = static_cast<std::uint8_t>(key.first[0]);
    }
    ++*count;
  }
  return 0;
}
int pcp_seal_pcr(void) {
  return -1;
}
uint32_t pcp_key_handle(const char* nameHex) {
  return static_cast<std::uint8_t>(Md5(nameHex)[0]);
}
int pcp_encryptDataFragment(const char* nameHex, const char*, const uint8_t* data, uint32_t length,
                            uint8_t* out, uint32_t* outSize) {
  if (Fails(kEncrypt) || KeyManager().keys.count(Md5(nameHex)) == 0 ||
      *outSize < PCP_FRAGMENT_SIZE) {
    return 1;
  }
  std::memset(out, 0, PCP_FRAGMENT_SIZE);
  std::memcpy(out, data, length);
  *outSize = PCP_FRAGMENT_SIZE;
  return 0;
}
int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  const auto key = KeyManager().keys.find(Md5(nameHex));
  if (Fails(kDecrypt) || key == KeyManager().keys.end() || key->second != Md5(passHex) ||
      length != PCP_FRAGMENT_SIZE) {
    return 1;
  }
  std::memcpy(out, fragment, *outSize);
  return 0;
}

}  // extern "C"
