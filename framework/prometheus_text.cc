#include "framework/prometheus_text.h"

#include <fmt/format.h>

#include <cmath>

namespace fw {
namespace {

// The length of the UTF-8 sequence starting at text[i], or 0 when it is not one.
size_t Utf8Length(std::string_view text, size_t i) {
  const auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
  const unsigned char lead = byte(i);
  size_t n = 0;
  if (lead < 0x80) {
    return 1;
  } else if (lead >= 0xC2 && lead <= 0xDF) {
    n = 2;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    n = 3;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    n = 4;
  } else {
    return 0;
  }
  if (i + n > text.size()) {
    return 0;
  }
  for (size_t k = 1; k < n; ++k) {
    if ((byte(i + k) & 0xC0) != 0x80) {
      return 0;
    }
  }
  // Overlong forms, surrogates and code points past U+10FFFF.
  const unsigned char second = byte(i + 1);
  if ((lead == 0xE0 && second < 0xA0) || (lead == 0xED && second > 0x9F) ||
      (lead == 0xF0 && second < 0x90) || (lead == 0xF4 && second > 0x8F)) {
    return 0;
  }
  return n;
}

}  // namespace

std::string PrometheusText::escapeLabel(std::string_view value) {
  std::string out;
  out.reserve(value.size());
  for (size_t i = 0; i < value.size();) {
    const char c = value[i];
    const size_t n = Utf8Length(value, i);
    if (n == 0) {
      out.push_back('?');
      ++i;
    } else if (c == '\\') {
      out += "\\\\";
      ++i;
    } else if (c == '"') {
      out += "\\\"";
      ++i;
    } else if (c == '\n') {
      out += "\\n";
      ++i;
    } else {
      out.append(value.substr(i, n));
      i += n;
    }
  }
  return out;
}

std::string PrometheusText::formatValue(double value) {
  if (std::isnan(value)) {
    return "NaN";
  }
  if (std::isinf(value)) {
    return value > 0 ? "+Inf" : "-Inf";
  }
  if (value == std::floor(value) && std::fabs(value) < 1e15) {
    return fmt::format("{}", static_cast<long long>(value));
  }
  return fmt::format("{}", value);
}

void PrometheusText::family(std::string_view name, std::string_view type, std::string_view help) {
  fmt::format_to(std::back_inserter(text_), "# HELP {} {}\n# TYPE {} {}\n", name, help, name, type);
}

void PrometheusText::appendLabel(const Label& label, bool first) {
  text_ += first ? '{' : ',';
  text_.append(label.first);
  text_ += "=\"";
  text_ += escapeLabel(label.second);
  text_ += '"';
}

void PrometheusText::line(std::string_view name, std::initializer_list<Label> labels,
                          const Label* extra, double value) {
  text_.append(name);
  bool first = true;
  for (const Label& label : labels) {
    appendLabel(label, first);
    first = false;
  }
  if (extra != nullptr) {
    appendLabel(*extra, first);
    first = false;
  }
  if (!first) {
    text_ += '}';
  }
  text_ += ' ';
  text_ += formatValue(value);
  text_ += '\n';
}

void PrometheusText::sample(std::string_view name, std::initializer_list<Label> labels,
                            double value) {
  line(name, labels, nullptr, value);
}

void PrometheusText::sample(std::string_view name, std::initializer_list<Label> labels, Label extra,
                            double value) {
  line(name, labels, &extra, value);
}

}  // namespace fw
