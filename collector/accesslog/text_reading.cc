#include "collector/accesslog/text_reading.h"

#include <fmt/core.h>

#include <limits>
#include <utility>

namespace accesslog {

std::string Shown(char c) {
  const auto u = static_cast<unsigned char>(c);
  if (u >= 0x20 && u < 0x7f) {
    return std::string(1, c);
  }
  return fmt::format("\\x{:02x}", u);
}

bool Fail(std::string* reason, std::string text) {
  if (reason != nullptr) {
    *reason = std::move(text);
  }
  return false;
}

Number ParseUnsigned(std::string_view text, uint64_t max, uint64_t* out) {
  if (text.empty()) {
    return Number::kNotNumber;
  }
  uint64_t value = 0;
  for (char c : text) {
    if (!IsDigit(c)) {
      return Number::kNotNumber;
    }
    const uint64_t digit = static_cast<uint64_t>(c - '0');
    if (value > (max - digit) / 10) {
      return Number::kOutOfRange;
    }
    value = value * 10 + digit;
  }
  *out = value;
  return Number::kOk;
}

Number ParseDecimal(std::string_view text, int scale, int64_t* out) {
  const size_t dot = text.find('.');
  const std::string_view whole = text.substr(0, dot);
  uint64_t value = 0;
  constexpr uint64_t kMax = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
  const Number n = ParseUnsigned(whole, kMax, &value);
  if (n != Number::kOk) {
    return n;
  }
  std::string_view fraction;
  if (dot != std::string_view::npos) {
    fraction = text.substr(dot + 1);
    if (fraction.empty()) {
      return Number::kNotNumber;
    }
  }
  for (int i = 0; i < scale; ++i) {
    if (value > kMax / 10) {
      return Number::kOutOfRange;
    }
    value *= 10;
  }
  uint64_t part = 0;
  uint64_t unit = 1;
  for (int i = scale - 1; i > 0; --i) {
    unit *= 10;
  }
  for (size_t i = 0; i < fraction.size(); ++i) {
    if (!IsDigit(fraction[i])) {
      return Number::kNotNumber;
    }
    if (static_cast<int>(i) < scale) {
      part += static_cast<uint64_t>(fraction[i] - '0') * unit;
      unit /= 10;
    }
  }
  if (value > kMax - part) {
    return Number::kOutOfRange;
  }
  *out = static_cast<int64_t>(value + part);
  return Number::kOk;
}

bool NumberFail(Number n, std::string_view name, std::string* reason) {
  return Fail(reason, n == Number::kNotNumber ? fmt::format("{} is not a number", name)
                                              : fmt::format("{} out of range", name));
}

bool ReadDigits(const char*& p, const char* end, int min_digits, int max_digits, int* value) {
  int digits = 0;
  int v = 0;
  while (digits < max_digits && p < end && IsDigit(*p)) {
    v = v * 10 + (*p - '0');
    ++p;
    ++digits;
  }
  *value = v;
  return digits >= min_digits;
}

bool ReadZone(const char*& p, const char* end, int* seconds) {
  if (p < end && (*p == 'Z' || *p == 'z')) {
    ++p;
    *seconds = 0;
    return true;
  }
  if (p == end || (*p != '+' && *p != '-')) {
    return false;
  }
  const int sign = (*p == '-') ? -1 : 1;
  ++p;
  int hours = 0;
  int minutes = 0;
  if (!ReadDigits(p, end, 2, 2, &hours)) {
    return false;
  }
  if (p < end && *p == ':') {
    ++p;
  }
  if (!ReadDigits(p, end, 2, 2, &minutes) || hours > 23 || minutes > 59) {
    return false;
  }
  *seconds = sign * (hours * 3600 + minutes * 60);
  return true;
}

}  // namespace accesslog
