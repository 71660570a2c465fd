#include "core/analyzer/intake/common.h"

#include <stdlib.h>
#include <string.h>

#include <cstdint>

long decimalFieldValue(const char* text) {
  // strtol's reading in the C locale, without its locale and overflow machinery: a field holds
  // at most 16 characters, so the value always fits in a long.
  const char* p = text;
  while (*p == ' ' || (*p >= '\t' && *p <= '\r')) {
    ++p;
  }
  const bool negative = *p == '-';
  if (*p == '-' || *p == '+') {
    ++p;
  }
  unsigned long value = 0;
  for (; *p >= '0' && *p <= '9'; ++p) {
    value = value * 10 + static_cast<unsigned long>(*p - '0');
  }
  return negative ? -static_cast<long>(value) : static_cast<long>(value);
}

unsigned int ahextoi(const char* text) {
  if (text == nullptr) {
    return 0;
  }
  unsigned int value = 0;
  unsigned int power = 1;
  for (size_t i = strlen(text); i-- > 0;) {
    const char c = text[i];
    unsigned int digit = 0;
    if (c >= '0' && c <= '9') {
      digit = c - '0';
    } else if (c >= 'a' && c <= 'f') {
      digit = c - 'a' + 10;
    } else if (c >= 'A' && c <= 'F') {
      digit = c - 'A' + 10;
    }
    // A stray character still takes its power: "1g" is 0x10.
    value += digit * power;
    power *= 16;
  }
  return value;
}

int CCommon::countCarets(char* text) {
  if (text == nullptr) {
    return 0;
  }
  // Runs over every record line: count eight bytes at a time. A byte of x is zero exactly where
  // the text holds a caret, and the expression sets the top bit of exactly those bytes.
  const size_t length = strlen(text);
  constexpr uint64_t kOnes7 = 0x7F7F7F7F7F7F7F7FULL;
  constexpr uint64_t kCarets = 0x5E5E5E5E5E5E5E5EULL;
  static_assert(CARET == 0x5E);
  int count = 0;
  size_t i = 0;
  for (; i + 8 <= length; i += 8) {
    uint64_t word;
    memcpy(&word, text + i, sizeof(word));
    const uint64_t x = word ^ kCarets;
    const uint64_t tops = ~(((x & kOnes7) + kOnes7) | x | kOnes7);
    // One bit per caret byte, summed into the top byte (without a popcount instruction, which
    // the baseline x86-64 target lacks and would make a library call).
    count += static_cast<int>(((tops >> 7) * 0x0101010101010101ULL) >> 56);
  }
  for (; i < length; ++i) {
    count += (text[i] == CARET);
  }
  return count;
}

char* CCommon::skipField(char* text) {
  if (text == nullptr) {
    return nullptr;
  }
  char* caret = strchr(text, CARET);
  return caret != nullptr ? caret + 1 : text + strlen(text);
}

void CCommon::getNextField(char** cursor, char* dest, int size) {
  if (size <= 0 || dest == nullptr) {
    return;
  }
  dest[0] = '\0';
  if (cursor == nullptr || *cursor == nullptr) {
    return;
  }
  char* start = *cursor;
  char* caret = strchr(start, CARET);
  if (caret == nullptr) {
    // The last field of a line has no caret behind it and is read as one character: method
    // codes are single digits, and line parsers depend on exactly this.
    if (*start != '\0' && size > 1) {
      dest[0] = *start;
      dest[1] = '\0';
    }
    if (*start != '\0') {
      *cursor = start + 1;
    }
    return;
  }
  size_t length = static_cast<size_t>(caret - start);
  if (length > static_cast<size_t>(size - 1)) {
    length = size - 1;  // cut silently; the cursor still moves past the whole field
  }
  memcpy(dest, start, length);
  dest[length] = '\0';
  *cursor = caret + 1;
}

int CCommon::getNextInteger(char** cursor) {
  char field[17];
  getNextField(cursor, field, sizeof(field));
  return static_cast<int>(decimalFieldValue(field));
}

int CCommon::findEOLChars(char* text) {
  if (text == nullptr) {
    return 0;
  }
  return static_cast<int>(strspn(text, COMMON_EOL_CHARS));
}

void CCommon::getNextValuesWithSeparator(char** cursor, char separator, int hex,
                                         unsigned int* first, unsigned int* second) {
  char field[1024];
  getNextField(cursor, field, sizeof(field));
  char* after = strchr(field, separator);
  if (after != nullptr) {
    *after++ = '\0';
  }
  auto convert = [hex](const char* part) -> unsigned int {
    return hex == 1 ? ahextoi(part) : static_cast<unsigned int>(strtol(part, nullptr, 10));
  };
  *first = convert(field);
  *second = after != nullptr ? convert(after) : 0;
}

void CCommon::getNextTiming(char** cursor, unsigned int* seconds, unsigned int* fraction) {
  getNextValuesWithSeparator(cursor, '.', 0, seconds, fraction);
  // The collector writes thousandths after the point ("12.5" is 12 s and 5 ms), so the digits
  // are scaled as a count, not read as a decimal fraction.
  *fraction *= 1000000u;
}

void CCommon::getNextHexPair(char** cursor, unsigned int* first, unsigned int* second) {
  getNextValuesWithSeparator(cursor, '-', 1, first, second);
}

void CCommon::stripToSubnet(const char* address, char* out, int parts) {
  if (parts <= 0 || address == nullptr || address[0] == '\0') {
    strcpy(out, "*");
    return;
  }
  strcpy(out, address);
  char* p = out;
  for (int i = 0; i < parts; ++p, ++i) {
    p = strchr(p, '.');
    if (p == nullptr) {
      return;  // fewer dots than parts: the whole address stays
    }
  }
  p[0] = '*';
  p[1] = '\0';
}
