// Text of numbers and dates, shared by Value::appendText and the JSON writer. Each function writes
// at most kMaxScalarText characters and returns the first place after them; nothing allocates.
#pragma once

#include <cstddef>
#include <cstdint>

#include "propertylist/CborReader.h"

namespace vx {

inline constexpr std::size_t kMaxScalarText = 48;

char* writeInteger(char* out, int64_t value);
char* writeUnsigned(char* out, uint64_t value);
// Shortest text that reads back as the same value. Integral values up to 2^64 have plain digits, so
// that 3 and 3.0 have the same text; -0 is 0. "nan", "inf", "-inf" for those.
char* writeFloating(char* out, float value);
char* writeFloating(char* out, double value);
// "2026-11-21T03:46:00Z", with up to nine digits of a fraction when there is one. The year is 0000
// to 9999; a date outside of it is written as its number of seconds.
char* writeDate(char* out, double secondsSince1970);
// The head of an integer, floating number or date, as the functions above do.
char* writeNumber(char* out, const cbor::Head& head);

}  // namespace vx
