#include "core/analyzer/pattern_overlap.h"

#include <gtest/gtest.h>

#include <memory>
#include <random>
#include <string>
#include <vector>

#include "core/analyzer/intake/common.h"

namespace {

// Overlap, with any witness checked against the real matcher.
bool Overlap(const char* a, const char* b) {
  std::string witness;
  const bool result = patternsOverlap(a, b, &witness);
  if (result) {
    EXPECT_TRUE(CCommon::patternMatches(a, witness.c_str())) << a << " / " << witness;
    EXPECT_TRUE(CCommon::patternMatches(b, witness.c_str())) << b << " / " << witness;
  }
  EXPECT_EQ(result, patternsOverlap(b, a)) << "not symmetric: " << a << " / " << b;
  return result;
}

TEST(OverlapTest, ExactCases) {
  EXPECT_TRUE(Overlap("*", "/index.html"));
  EXPECT_TRUE(Overlap("*", "*"));
  EXPECT_TRUE(Overlap("*.jsp", "/shop/*"));
  EXPECT_FALSE(Overlap("*.jsp", "*.gif"));
  EXPECT_FALSE(Overlap("ab*ab", "ab"));  // the end may not reuse the start
  EXPECT_TRUE(Overlap("ab*ab", "abab"));
  EXPECT_TRUE(Overlap("*.JSP", "*.jsp"));
  EXPECT_TRUE(Overlap("a*", "*b"));
  EXPECT_FALSE(Overlap("a*", "b*"));
  EXPECT_FALSE(Overlap("a*b", "b*a"));
  EXPECT_TRUE(Overlap("*a*b*", "*b*a*"));
  EXPECT_FALSE(Overlap("*aba*ba", "aba"));
  EXPECT_TRUE(Overlap("a**b", "ab"));
}

// Patterns the matcher never accepts overlap nothing, not even "*".
TEST(OverlapTest, PatternsThatMatchNothingOverlapNothing) {
  for (const char* never : {"", "**", "***"}) {
    EXPECT_FALSE(Overlap(never, "*")) << never;
    EXPECT_FALSE(Overlap(never, never)) << never;
  }
  EXPECT_FALSE(patternsOverlap(nullptr, "*"));
}

// The answer follows the matcher's folding and its byte-sized steps over non-ASCII text.
TEST(OverlapTest, FollowsTheMatcherOnNonAsciiText) {
  EXPECT_TRUE(Overlap("*STRASSE",
                      "/stra\xc3\x9f"
                      "e"));                                         // sharp s folds to "ss"
  EXPECT_TRUE(Overlap("\xc3\x89T\xc3\x89*", "*\xc3\xa9t\xc3\xa9"));  // ÉTÉ* / *été
  EXPECT_TRUE(Overlap("\xe2\x84\xaa*", "k"));                        // KELVIN SIGN / k
  // "é" is 2 bytes but one unit: after "é" the matcher looks one unit too far on.
  ASSERT_FALSE(CCommon::patternMatches("\xc3\xa9*\xc3\xa9", "\xc3\xa9\xc3\xa9"));
  EXPECT_FALSE(Overlap("\xc3\xa9*\xc3\xa9", "\xc3\xa9\xc3\xa9"));
  EXPECT_TRUE(Overlap("\xc3\xa9*\xc3\xa9", "\xc3\xa9\xc3\xa9\xc3\xa9"));
  EXPECT_FALSE(Overlap("\xc3\xa9*x*", "\xc3\xa9x"));
  // ΐ is 2 bytes but folds to 3 units, so the next part may begin inside it; the end part must
  // still end the text.
  EXPECT_FALSE(Overlap("\xce\x90\xce\x90*\xcc\x88", "\xce\x90\xce\x90"));
  EXPECT_TRUE(Overlap("\xce\x90\xce\x90*\xcc\x88", "*"));
}

// Random patterns from `tokens`, up to maxTokens of them.
std::vector<std::string> RandomPatterns(const std::vector<std::string>& tokens, int maxTokens,
                                        int count, unsigned seed) {
  std::mt19937 random(seed);
  std::vector<std::string> out;
  for (int i = 0; i < count; ++i) {
    std::string pattern;
    const int n = static_cast<int>(random() % (maxTokens + 1));
    for (int j = 0; j < n; ++j) {
      pattern += tokens[random() % tokens.size()];
    }
    out.push_back(pattern);
  }
  return out;
}

// Every text of at most maxLength tokens.
std::vector<std::string> AllTexts(const std::vector<std::string>& tokens, int maxLength) {
  std::vector<std::string> out{""};
  for (size_t from = 0, length = 0; length < static_cast<size_t>(maxLength); ++length) {
    const size_t to = out.size();
    for (size_t i = from; i < to; ++i) {
      for (const std::string& t : tokens) {
        out.push_back(out[i] + t);
      }
    }
    from = to;
  }
  return out;
}

struct ListDeleter {
  void operator()(_PARSE_INFO* list) const { CCommon::freeParseInfo(list); }
};

// Which of texts each pattern matches, through the real matcher.
std::vector<std::vector<bool>> MatchTable(const std::vector<std::string>& patterns,
                                          const std::vector<std::string>& texts) {
  std::vector<std::vector<bool>> table;
  for (const std::string& p : patterns) {
    std::unique_ptr<_PARSE_INFO, ListDeleter> list(CCommon::getParseInfo(p.c_str()));
    std::vector<bool> row;
    for (const std::string& t : texts) {
      row.push_back(CCommon::patternMatches(p.c_str(), t.c_str(), list.get()));
    }
    table.push_back(std::move(row));
  }
  return table;
}

bool SomeTextMatchesBoth(const std::vector<bool>& a, const std::vector<bool>& b) {
  for (size_t i = 0; i < a.size(); ++i) {
    if (a[i] && b[i]) {
      return true;
    }
  }
  return false;
}

// ASCII: a shortest common text is never longer than the two patterns together, so texts up to
// that length settle every pair exactly.
TEST(OverlapPropertyTest, AgreesWithBruteForceOnAscii) {
  const std::vector<std::string> patterns = RandomPatterns({"a", "b", "A", "*"}, 5, 80, 7);
  const std::vector<std::string> texts = AllTexts({"a", "b"}, 10);
  const std::vector<std::vector<bool>> table = MatchTable(patterns, texts);
  for (size_t i = 0; i < patterns.size(); ++i) {
    for (size_t j = i; j < patterns.size(); ++j) {
      EXPECT_EQ(SomeTextMatchesBoth(table[i], table[j]),
                Overlap(patterns[i].c_str(), patterns[j].c_str()))
          << "[" << patterns[i] << "] / [" << patterns[j] << "]";
    }
  }
}

// Non-ASCII: folding that changes lengths (ß, ΐ) and parts whose bytes outnumber their units.
// Every common text found by brute force must be found, and every "yes" comes with a witness.
TEST(OverlapPropertyTest, AgreesWithBruteForceOnNonAscii) {
  const std::vector<std::string> patterns = RandomPatterns(
      {"a", "s", "\xc3\x9f", "\xc3\xa9", "\xc3\x89", "\xce\x90", "\xcc\x88", "*", "*"}, 4, 80, 11);
  const std::vector<std::string> texts =
      AllTexts({"a", "s", "\xc3\xa9", "\xce\x90", "\xce\xb9\xcc\x88\xcc\x81"}, 4);
  const std::vector<std::vector<bool>> table = MatchTable(patterns, texts);
  for (size_t i = 0; i < patterns.size(); ++i) {
    for (size_t j = i; j < patterns.size(); ++j) {
      const bool overlap = Overlap(patterns[i].c_str(), patterns[j].c_str());
      if (SomeTextMatchesBoth(table[i], table[j])) {
        EXPECT_TRUE(overlap) << "[" << patterns[i] << "] / [" << patterns[j] << "]";
      }
    }
  }
}

}  // namespace
