// The exposition writer: label values from traffic can never break a line, and values are
// written as Prometheus reads them.

#include "framework/prometheus_text.h"

#include <gtest/gtest.h>

#include <limits>

namespace fw {
namespace {

TEST(PrometheusTextTest, EscapesLabelsAndReplacesBadBytes) {
  EXPECT_EQ("plain /path?q=1", PrometheusText::escapeLabel("plain /path?q=1"));
  EXPECT_EQ("a\\\\b\\\"c\\nd", PrometheusText::escapeLabel("a\\b\"c\nd"));
  EXPECT_EQ("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80",
            PrometheusText::escapeLabel("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80"));
  // A lone continuation byte, a cut sequence, an overlong form and a surrogate: every byte that
  // is not part of a whole character becomes one ?.
  EXPECT_EQ("?x", PrometheusText::escapeLabel("\x80x"));
  EXPECT_EQ("ab??", PrometheusText::escapeLabel("ab\xE2\x82"));  // each byte of it
  EXPECT_EQ("??", PrometheusText::escapeLabel("\xC0\xAF"));
  EXPECT_EQ("???", PrometheusText::escapeLabel("\xED\xA0\x80"));
  EXPECT_EQ(std::string("a?b", 3), PrometheusText::escapeLabel(std::string("a\xFF"
                                                                           "b",
                                                                           3)));
}

TEST(PrometheusTextTest, FormatsValuesAndLines) {
  EXPECT_EQ("0", PrometheusText::formatValue(0));
  EXPECT_EQ("12345678901", PrometheusText::formatValue(12345678901.0));
  EXPECT_EQ("0.25", PrometheusText::formatValue(0.25));
  EXPECT_EQ("+Inf", PrometheusText::formatValue(std::numeric_limits<double>::infinity()));
  EXPECT_EQ("NaN", PrometheusText::formatValue(std::numeric_limits<double>::quiet_NaN()));

  PrometheusText out;
  out.family("q7_x_total", "counter", "Things.");
  out.sample("q7_x_total", {}, 3);
  out.sample("q7_x_total", {{"a", "1"}, {"b", "\""}}, 4);
  out.sample("q7_x_bucket", {{"a", "1"}}, {"le", "+Inf"}, 5);
  out.sample("q7_y", {}, {"le", "1"}, 6);
  EXPECT_EQ(
      "# HELP q7_x_total Things.\n# TYPE q7_x_total counter\nq7_x_total 3\n"
      "q7_x_total{a=\"1\",b=\"\\\"\"} 4\nq7_x_bucket{a=\"1\",le=\"+Inf\"} 5\nq7_y{le=\"1\"} 6\n",
      out.text());
}

}  // namespace
}  // namespace fw
