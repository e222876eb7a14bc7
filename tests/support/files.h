// Files and bytes, for the tests and the fuzz harnesses alike.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace keymgr::test {

// WriteFile creates the folders above |path| and writes |bytes| there.
void WriteFile(const std::string& path, std::string_view bytes);
std::optional<std::string> ReadFile(const std::string& path);

// Sha256 is the digest of |bytes| by OpenSSL's one-shot call, which none of
// the code under test uses.
std::string Sha256(std::string_view bytes);

// KeyAuth is what the key manager makes of the first 20 bytes of a key file
// (zeros for what is missing) to name a TPM key or authorize it: the MD5 of
// their upper-case hex text.
std::string KeyAuth(std::string bytes);

// Require ends the process when |holds| is false: a fuzz harness's check.
void Require(bool holds);

// FromHex gives the bytes that pairs of hex digits spell.
std::string FromHex(std::string_view hex);

// Hex renders bytes as upper-case "%02X " groups, the way the programs print.
// LowerHex renders them as lower-case digits alone, as tpm2-tools and
// keymgr-eventlog write and take digests.
std::string Hex(std::string_view bytes);
std::string LowerHex(std::string_view bytes);

}  // namespace keymgr::test
