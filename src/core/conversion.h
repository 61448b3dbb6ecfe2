#pragma once
// Checked printf conversions behind the number, character and pointer formatters. A
// caller's conversion text is validated before snprintf sees it: literal text and "%%"
// around exactly one conversion that suits the value's type. Length modifiers are replaced
// by the ones the value needs; a pointer always prints its full address. A text that is
// not accepted, a failed conversion and output that does not fit the buffer all throw
// InvalidFormatStringException with the conversion text as given.

#include <cstdint>

namespace Pelmora::Internal {

// Each returns the number of bytes placed in `buffer` (zero-terminated, `size` bytes).
int Convert(const char* option, char value, char* buffer, int size);
int Convert(const char* option, int32_t value, char* buffer, int size);
int Convert(const char* option, uint32_t value, char* buffer, int size);
int Convert(const char* option, int64_t value, char* buffer, int size);
int Convert(const char* option, uint64_t value, char* buffer, int size);
int Convert(const char* option, double value, char* buffer, int size);
int Convert(const char* option, const void* value, char* buffer, int size);

}  // namespace Pelmora::Internal
