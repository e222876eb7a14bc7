// Byte printing and hexadecimal helpers. All output goes through DebugPrint.
#pragma once

#include <cstdint>

// PrintHexDump prints |length| bytes as "%02X ", with a two-blank gap after
// the 8th and a line feed after the 16th byte of each row when |grouped| is
// non-zero, and always a final line feed.
void PrintHexDump(const std::uint8_t* bytes, std::uint32_t length, int grouped);

// PrintArray prints "print_array: size[N] ", the bytes as "%02X ", then " \n".
// A size of 0 or less prints no bytes.
void PrintArray(const std::uint8_t* bytes, std::int32_t size);

// PrintRedactedArray prints what PrintArray would for |size| bytes, each
// byte shown as "**": the line keeps its shape and gives nothing away.
void PrintRedactedArray(std::int32_t size);

// BytesToHex writes the upper-case hex text of |length| bytes of |src| and a
// NUL into |dst|, which holds |dstSize| bytes. Returns 0, or -1 with a message
// and |dst| untouched on a null pointer, a zero size or a short |dst|.
[[nodiscard]] int BytesToHex(const std::uint8_t* src, std::uint8_t length, char* dst,
                             std::uint8_t dstSize);
