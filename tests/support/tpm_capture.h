// The TPM commands in a capture of tpm2-tss's packet-capture transport, and
// what they cost a discrete TPM.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace keymgr::test {

// TpmCost sums up the commands of a flow: all of them, and the asymmetric
// operations among them (key generation, ECDH for a salted session, RSA).
struct TpmCost {
  int commands = 0;
  int asymmetric = 0;
  int primaries = 0;    // TPM2_CreatePrimary
  int rsaKeys = 0;      // TPM2_Create / TPM2_CreateLoaded
  int rsaEncrypts = 0;  // TPM2_RSA_Encrypt
  std::string codes;    // the command codes in order, as hex
};

// CaptureCost reads the pcapng file at |path| that the transport wrote and
// sums up the commands sent to the TPM (TCP port 2321).
TpmCost CaptureCost(const std::string& path);

}  // namespace keymgr::test
