// The boot status log and the security-feature test that guards it.
#pragma once

// Status codes of WriteBootStatus.
inline constexpr unsigned int kBootStatusBnOk = 0;
inline constexpr unsigned int kBootStatusBnFail = 1;
inline constexpr unsigned int kBootStatusDtOk = 2;
inline constexpr unsigned int kBootStatusDtFail = 3;

// CheckSecurityFeature reads the SFE CONF word from EEPROM, prints the
// SFE_003 line (or a read-error line) and returns 1 when SFE_003 is set.
unsigned int CheckSecurityFeature();

// WriteBootStatus writes the line of |code| to the boot status log and echoes
// it. Codes 0 and 1 start the log anew; every other code is appended, and
// only when SFE_003 is set.
void WriteBootStatus(unsigned int code);
