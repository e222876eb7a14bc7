// The storage parent of the keys and the sessions that carry secrets.
#include <time.h>

#include <algorithm>
#include <array>
#include <cstring>

#include "crypto/hash.h"
#include "eeprom/eeprom.h"
#include "eeprom/eeprom_map.h"
#include "tpm/chain.h"
#include "tpm/commands.h"
#include "util/random.h"

namespace keymgr::tpm {

namespace {

// The storage template of TCG's provisioning guidance: ECC P-256, AES-128
// CFB, no policy, an all-zero unique field. Created with it, the primary is
// the same key as the persistent SRK.
TPM2B_PUBLIC SrkTemplate() {
  TPM2B_PUBLIC templ{};
  TPMT_PUBLIC& area = templ.publicArea;
  area.type = TPM2_ALG_ECC;
  area.nameAlg = TPM2_ALG_SHA256;
  area.objectAttributes = TPMA_OBJECT_RESTRICTED | TPMA_OBJECT_DECRYPT | TPMA_OBJECT_FIXEDTPM |
                          TPMA_OBJECT_FIXEDPARENT | TPMA_OBJECT_SENSITIVEDATAORIGIN |
                          TPMA_OBJECT_USERWITHAUTH | TPMA_OBJECT_NODA;
  TPMS_ECC_PARMS& ecc = area.parameters.eccDetail;
  ecc.symmetric.algorithm = TPM2_ALG_AES;
  ecc.symmetric.keyBits.aes = 128;
  ecc.symmetric.mode.aes = TPM2_ALG_CFB;
  ecc.scheme.scheme = TPM2_ALG_NULL;
  ecc.curveID = TPM2_ECC_NIST_P256;
  ecc.kdf.scheme = TPM2_ALG_NULL;
  area.unique.ecc.x.size = 32;
  area.unique.ecc.y.size = 32;
  return templ;
}

// IsStandardSrk tells whether |area| was made from the storage template.
bool IsStandardSrk(const TPMT_PUBLIC& area) {
  const TPMT_PUBLIC expected = SrkTemplate().publicArea;
  const TPMS_ECC_PARMS& ecc = area.parameters.eccDetail;
  const TPMS_ECC_PARMS& want = expected.parameters.eccDetail;
  return area.type == expected.type && area.nameAlg == expected.nameAlg &&
         area.objectAttributes == expected.objectAttributes && area.authPolicy.size == 0 &&
         ecc.symmetric.algorithm == want.symmetric.algorithm &&
         ecc.symmetric.keyBits.aes == want.symmetric.keyBits.aes &&
         ecc.symmetric.mode.aes == want.symmetric.mode.aes &&
         ecc.scheme.scheme == want.scheme.scheme && ecc.curveID == want.curveID &&
         ecc.kdf.scheme == want.kdf.scheme;
}

Status CreateSrkPrimary(Connection& tpm) {
  ESYS_TR primary = ESYS_TR_NONE;
  Status status = CreatePrimary(tpm, SrkTemplate(), &primary);
  if (status.ok()) {
    tpm.primary.reset(tpm.Object(primary));
  }
  return status;
}

// OpenSrk finds the standard SRK at kSrkHandle, when it is there.
Status OpenSrk(Connection& tpm) {
  TPM2B_PUBLIC area{};
  if (Status status = ReadPublic(tpm, kSrkHandle, &area); !status.ok()) {
    return status;
  }
  if (!IsStandardSrk(area.publicArea)) {
    return Refused("not the standard SRK");
  }
  ESYS_TR srk = ESYS_TR_NONE;
  Status status = OpenPersistent(tpm, kSrkHandle, &srk);
  if (status.ok()) {
    tpm.srk.reset(tpm.Object(srk));
  }
  return status;
}

}  // namespace

Status UseParent(Connection& tpm) {
  if (tpm.primary || tpm.srk) {
    return Status();
  }
  // Without the SRK, or with something else at its handle, the same key is
  // made from the template.
  if (OpenSrk(tpm).ok()) {
    return Status();
  }
  return tpm.broken ? Refused("TPM connection lost") : CreateSrkPrimary(tpm);
}

namespace {

using Pin = std::array<std::uint8_t, eeprom::kStorageKeyPinLength>;

// ParentName gives the SHA-256 part of the parent's name.
Status ParentName(Connection& tpm, Pin* name) {
  Output<TPM2B_NAME> full;
  if (Status status =
          Check("Esys_TR_GetName", Esys_TR_GetName(tpm.ctx(), tpm.Parent(), full.out()));
      !status.ok()) {
    return status;
  }
  if (full.get()->size != 2 + name->size()) {
    return Refused("storage key name");
  }
  std::copy_n(full.get()->name + 2, name->size(), name->begin());
  return Status();
}

bool Blank(const Pin& pin) {
  return std::all_of(pin.begin(), pin.end(), [](std::uint8_t b) { return b == 0xFF; }) ||
         std::all_of(pin.begin(), pin.end(), [](std::uint8_t b) { return b == 0x00; });
}

}  // namespace

Status UsePinnedParent(Connection& tpm) {
  Pin pin{};
  const bool readable = ReadEEPROM_msok(eeprom::kDevice, eeprom::kStorageKeyPinOffset,
                                        eeprom::kStorageKeyPinLength, pin.data()) >= 0;
  const bool pinned = readable && !Blank(pin);
  // A pinned SRK needs no look at its template: its name is the proof.
  if (pinned && !tpm.primary && !tpm.srk) {
    ESYS_TR srk = ESYS_TR_NONE;
    if (OpenPersistent(tpm, kSrkHandle, &srk).ok()) {
      tpm.srk.reset(tpm.Object(srk));
    }
  }
  Pin name{};
  if (Status status = UseParent(tpm); !status.ok()) {
    return status;
  }
  if (Status status = ParentName(tpm, &name); !status.ok()) {
    return status;
  }
  // Something else at the SRK's handle may stand in front of the pinned key,
  // which is then the primary made from the template.
  if (pinned && name != pin && tpm.srk && !tpm.primary) {
    tpm.srk.reset();
    if (Status status = CreateSrkPrimary(tpm); !status.ok()) {
      return status;
    }
    if (Status status = ParentName(tpm, &name); !status.ok()) {
      return status;
    }
  }
  if (pinned && name != pin) {
    return Refused("storage key is not the pinned one");
  }
  return pinned || !readable ? Status() : PinParent(tpm);
}

Status PinParent(Connection& tpm) {
  Pin name{};
  if (Status status = ParentName(tpm, &name); !status.ok()) {
    return status;
  }
  return WriteEEPROM_Bytes_Sema(eeprom::kDevice, eeprom::kStorageKeyPinOffset,
                                eeprom::kStorageKeyPinLength, name.data()) >= 0
             ? Status()
             : Refused("storage key pin write");
}

Status StartSession(Connection& tpm, ESYS_TR tpmKey, ESYS_TR bind, ESYS_TR* session, TPM2_SE type) {
  TPMT_SYM_DEF symmetric{};
  symmetric.algorithm = TPM2_ALG_AES;
  symmetric.keyBits.aes = 128;
  symmetric.mode.aes = TPM2_ALG_CFB;
  // Left to ESAPI, the nonce would come from OpenSSL's generator, which
  // waits for the kernel's pool. The TPM's nonce makes the session fresh;
  // this one need only differ from run to run, which the clock ensures
  // while the pool is not ready.
  TPM2B_NONCE nonce{};
  nonce.size = crypto::kSha256Size;
  if (!KernelRandom(nonce.buffer, nonce.size, KernelWait::kNo)) {
    timespec clocks[2]{};
    clock_gettime(CLOCK_REALTIME, &clocks[0]);
    clock_gettime(CLOCK_MONOTONIC, &clocks[1]);
    crypto::Sha256 sha;
    (void)sha.Update(clocks, sizeof(clocks));
    (void)sha.Final(std::span<std::uint8_t, crypto::kSha256Size>(nonce.buffer, nonce.size));
  }
  return StartAuthSession(tpm, tpmKey, bind, nonce, type, symmetric, session);
}

Status UseSaltedSession(Connection& tpm, TPMA_SESSION attributes) {
  if (!tpm.session) {
    if (Status status = UseParent(tpm); !status.ok()) {
      return status;
    }
    ESYS_TR session = ESYS_TR_NONE;
    if (Status status = StartSession(tpm, tpm.Parent(), ESYS_TR_NONE, &session); !status.ok()) {
      return status;
    }
    tpm.session.reset(tpm.Object(session));
  }
  // The session stays loaded after each command, so that it is flushed with
  // the connection on every path, failed commands included.
  return Check("Esys_TRSess_SetAttributes",
               Esys_TRSess_SetAttributes(tpm.ctx(), tpm.session.get().tr,
                                         TPMA_SESSION_CONTINUESESSION | attributes, 0xff));
}

Status PersistSrk(Connection& tpm) {
  if (OpenSrk(tpm).ok()) {
    return Status();
  }
  if (Status status = CreateSrkPrimary(tpm); !status.ok()) {
    return status;
  }
  // The primary stays this connection's parent: it is the same key.
  TPM2_HANDLE primary = 0;
  if (Status status = Check("Esys_TR_GetTpmHandle",
                            Esys_TR_GetTpmHandle(tpm.ctx(), tpm.primary.get().tr, &primary));
      !status.ok()) {
    return status;
  }
  return EvictControl(tpm, primary, kSrkHandle);
}

}  // namespace keymgr::tpm
