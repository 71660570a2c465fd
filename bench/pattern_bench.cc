// Cost of one CCommon::patternMatches call with a compiled list, as the analyzer pays it for
// every pattern on every transaction: ASCII texts (the fast path) and non-ASCII texts (ICU).

#include <benchmark/benchmark.h>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/pattern_match_internal.h"

namespace {

struct Case {
  const char* pattern;
  const char* text;
};

const Case kCases[] = {
    {"*.jsp", "/shop/catalog/items/Index.JSP"},
    {"/shop/*", "/shop/catalog/items/index.jsp?id=42&session=abcdef0123456789"},
    {"*catalog*", "/shop/catalog/items/index.jsp?id=42&session=abcdef0123456789"},
    {"/shop/*/items/*.jsp", "/shop/catalog/items/index.jsp"},
    {"www.example.com", "WWW.Example.COM"},
    {"*.jsp",
     "/boutique/caf\xc3\xa9/cr\xc3\xa8me-br\xc3\xbbl\xc3\xa9"
     "e/Index.JSP"},
    {"*stra\xc3\x9f"
     "e*",
     "/karten/Hauptstra\xc3\x9f"
     "e/12/ansicht"},
};

void BM_PatternMatches(benchmark::State& state, const Case& c) {
  _PARSE_INFO* list = CCommon::getParseInfo(c.pattern);
  for (auto _ : state) {
    benchmark::DoNotOptimize(CCommon::patternMatches(c.pattern, c.text, list));
  }
  CCommon::freeParseInfo(list);
}

// The same ASCII cases forced through ICU, to show what the fast path saves.
void BM_PatternMatchesIcuOnly(benchmark::State& state, const Case& c) {
  _PARSE_INFO* list = CCommon::getParseInfo(c.pattern);
  for (auto _ : state) {
    benchmark::DoNotOptimize(pattern_internal::matchIcu(list, c.text));
  }
  CCommon::freeParseInfo(list);
}

// Parsing on the spot, as a caller without a compiled list pays it.
void BM_PatternMatchesUncompiled(benchmark::State& state, const Case& c) {
  for (auto _ : state) {
    benchmark::DoNotOptimize(CCommon::patternMatches(c.pattern, c.text));
  }
}

BENCHMARK_CAPTURE(BM_PatternMatches, ascii_endswith, kCases[0]);
BENCHMARK_CAPTURE(BM_PatternMatches, ascii_startswith, kCases[1]);
BENCHMARK_CAPTURE(BM_PatternMatches, ascii_contains, kCases[2]);
BENCHMARK_CAPTURE(BM_PatternMatches, ascii_three_parts, kCases[3]);
BENCHMARK_CAPTURE(BM_PatternMatches, ascii_nowild, kCases[4]);
BENCHMARK_CAPTURE(BM_PatternMatches, nonascii_text, kCases[5]);
BENCHMARK_CAPTURE(BM_PatternMatches, nonascii_both, kCases[6]);
BENCHMARK_CAPTURE(BM_PatternMatchesIcuOnly, ascii_endswith, kCases[0]);
BENCHMARK_CAPTURE(BM_PatternMatchesIcuOnly, ascii_contains, kCases[2]);
BENCHMARK_CAPTURE(BM_PatternMatchesUncompiled, ascii_endswith, kCases[0]);

}  // namespace
