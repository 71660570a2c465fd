#pragma once

// PrometheusText: writes metrics in the Prometheus text exposition format (version 0.0.4): a
// family's HELP and TYPE lines, then its samples with their labels escaped. Label values are
// taken as they come (names from traffic included): backslash, double quote and newline are
// escaped and bytes that are not UTF-8 become '?', so that no value can break the format.
//
// Thread safety: none; one writer per reply.

#include <initializer_list>
#include <string>
#include <string_view>
#include <utility>

namespace fw {

class PrometheusText {
 public:
  using Label = std::pair<std::string_view, std::string_view>;

  // "# HELP name help" and "# TYPE name type" (counter, gauge, histogram).
  void family(std::string_view name, std::string_view type, std::string_view help);
  // "name{labels} value", the labels in the order given.
  void sample(std::string_view name, std::initializer_list<Label> labels, double value);
  // The same with one more label after them (a histogram's le).
  void sample(std::string_view name, std::initializer_list<Label> labels, Label extra,
              double value);

  // A value as the format writes it: integers without a fraction, "+Inf", "NaN".
  static std::string formatValue(double value);
  // A label value escaped for the format (without its quotes).
  static std::string escapeLabel(std::string_view value);

  const std::string& text() const { return text_; }
  std::string take() { return std::move(text_); }

 private:
  void appendLabel(const Label& label, bool first);
  void line(std::string_view name, std::initializer_list<Label> labels, const Label* extra,
            double value);

  std::string text_;
};

}  // namespace fw
