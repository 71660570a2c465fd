#pragma once

// Small readers shared by the access-log parsers (LogFormat, TimeFormat): digits, decimals and
// zone offsets read in place from a line, and the short reasons they give when a line does not
// fit. Nothing here allocates except a reason's text.
//
// Thread safety: stateless functions.

#include <cstdint>
#include <string>
#include <string_view>

namespace accesslog {

enum class Number { kOk, kNotNumber, kOutOfRange };

inline bool IsDigit(char c) {
  return c >= '0' && c <= '9';
}
inline bool IsBlank(char c) {
  return c == ' ' || c == '\t';
}

// A character shown in a reason: printable as itself, anything else as \xHH.
std::string Shown(char c);

// Sets *reason (when non-null) to text; returns false, for "return Fail(...)".
bool Fail(std::string* reason, std::string text);

// Decimal digits only, at most max.
Number ParseUnsigned(std::string_view text, uint64_t max, uint64_t* out);

// "I" or "I.F" in some unit, as an integer count of 10^-scale of that unit. Fraction digits
// beyond the scale are dropped.
Number ParseDecimal(std::string_view text, int scale, int64_t* out);

// "<name> is not a number" or "<name> out of range" into *reason; false.
bool NumberFail(Number n, std::string_view name, std::string* reason);

// Reads min_digits..max_digits digits at p (advancing it) into *value; false with fewer.
bool ReadDigits(const char*& p, const char* end, int min_digits, int max_digits, int* value);

// A zone offset at p ("+0200", "-07:00", "Z") as seconds east of UTC; false if there is none.
bool ReadZone(const char*& p, const char* end, int* seconds);

}  // namespace accesslog
