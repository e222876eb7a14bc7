// EEPROM library over the image file at KEYMGR_EEPROM_PATH: byte i of the
// file is EEPROM byte i. Every call takes 0 as its first argument (the
// device's EEPROM) and returns the number of bytes moved, or a negative value
// when nothing was read or written.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
#define EEPROM_NODISCARD [[nodiscard]]
extern "C" {
#else
#define EEPROM_NODISCARD
#endif

EEPROM_NODISCARD int ReadEEPROM(int device, uint32_t offset, uint32_t length, void* dst);
EEPROM_NODISCARD int ReadEEPROM_msok(int device, uint32_t offset, uint32_t length, void* dst);
// WriteSectionEEPROM also fails when [offset, offset+length) does not lie
// inside the section [sectionStart, sectionStart+sectionLength).
EEPROM_NODISCARD int WriteSectionEEPROM(int device, uint32_t offset, uint32_t length,
                                        const void* src, uint32_t sectionStart,
                                        uint32_t sectionLength);
// WriteEEPROM_Bytes_Sema holds an exclusive lock on the image while it
// writes. It waits for the lock three seconds at most, then fails.
EEPROM_NODISCARD int WriteEEPROM_Bytes_Sema(int device, uint32_t offset, uint32_t length,
                                            const void* src);

#ifdef __cplusplus
}
#endif
