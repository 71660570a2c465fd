#include <gtest/gtest.h>
#include <stdio.h>

#include <random>
#include <string>
#include <utility>
#include <vector>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/pattern_match_internal.h"

namespace {

// "TYPE:text" per element, so a whole list compares in one expectation.
std::vector<std::string> Parse(const char* pattern) {
  std::vector<std::string> out;
  _PARSE_INFO* list = CCommon::getParseInfo(pattern);
  EXPECT_EQ(0, validateParseInfo(list, true)) << pattern;
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next) {
    out.push_back(std::string(getMatchTypeString(e->matchType)) + ":" + e->text);
  }
  CCommon::freeParseInfo(list);
  return out;
}

using L = std::vector<std::string>;

TEST(ParseInfoTest, SegmentsAndTypes) {
  EXPECT_EQ((L{"NOWILD:abc"}), Parse("abc"));
  EXPECT_EQ((L{"STARTSWITH:abc"}), Parse("abc*"));
  EXPECT_EQ((L{"ENDSWITH:abc"}), Parse("*abc"));
  EXPECT_EQ((L{"CONTAINS:abc"}), Parse("*abc*"));
  EXPECT_EQ((L{"STARTSWITH:a", "CONTAINS:b", "ENDSWITH:c"}), Parse("a*b*c"));
  EXPECT_EQ((L{"ENDSWITH:abc"}), Parse("***abc"));
  EXPECT_EQ((L{"STARTSWITH:a", "ENDSWITH:b"}), Parse("a**b"));
  EXPECT_EQ((L{"ENDSWITH:"}), Parse("*"));  // only ever matched through the "*" shortcut
  EXPECT_EQ((L{}), Parse("**"));
  EXPECT_EQ((L{}), Parse(""));
  EXPECT_EQ(nullptr, CCommon::getParseInfo(nullptr));
}

TEST(ParseInfoTest, CountersBalanceAndLengthsAreBytes) {
  const long allocs = getParseInfoAllocCount();
  const long frees = getParseInfoFreeCount();
  _PARSE_INFO* list = CCommon::getParseInfo(
      "Stra\xc3\x9f"
      "e*x*");
  ASSERT_NE(nullptr, list);
  EXPECT_EQ(7, list->length);
  EXPECT_EQ(4, getParseInfoAllocCount() - allocs);  // two elements, two texts
  CCommon::freeParseInfo(list);
  EXPECT_EQ(4, getParseInfoFreeCount() - frees);
  CCommon::patternMatches("a*b", "ab");  // parsed and freed on the spot
  EXPECT_EQ(getParseInfoAllocCount() - allocs, getParseInfoFreeCount() - frees);
}

TEST(ParseInfoTest, ValidateCountsEachFault) {
  char a[] = "a", b[] = "b", c[] = "c";
  auto element = [](int type, char* text, int length, _PARSE_INFO* next) {
    _PARSE_INFO e;
    e.matchType = type;
    e.text = text;
    e.length = length;
    e.next = next;
    return e;
  };
  _PARSE_INFO third = element(ENDSWITH, c, 1, nullptr);
  _PARSE_INFO second = element(STARTSWITH, b, 1, &third);  // STARTSWITH not first
  _PARSE_INFO first = element(NOWILD, a, 2, &second);      // NOWILD not alone, wrong length
  EXPECT_EQ(3, validateParseInfo(&first, false));
  third.matchType = 7;
  third.text = nullptr;
  EXPECT_EQ(2, validateParseInfo(&third, false));
  EXPECT_STREQ("INVALID", getMatchTypeString(7));
  EXPECT_STREQ("CONTAINS", getMatchTypeString(CONTAINS));
  EXPECT_EQ(0, validateParseInfo(nullptr, false));
}

TEST(ParseInfoTest, DumpFormat) {
  _PARSE_INFO* list = CCommon::getParseInfo("ab*");
  testing::internal::CaptureStdout();
  dumpParseInfo(list);
  const std::string out = testing::internal::GetCapturedStdout();
  char head[64];
  snprintf(head, sizeof(head), "Dumping PARSE_INFO phead[%p]\n\n", static_cast<void*>(list));
  EXPECT_EQ(std::string(head) +
                "match type  [STARTSWITH]\nParse string[ab]\nString len  [2]\n"
                "Dumping PARSE_INFO END\n",
            out);
  CCommon::freeParseInfo(list);
}

bool Matches(const char* pattern, const char* text) {
  return CCommon::patternMatches(pattern, text);
}

TEST(PatternMatchTest, Wildcards) {
  // Pattern and text.
  using Case = std::pair<const char*, const char*>;
  const Case kMatching[] = {
      {"*", ""},
      {"*", "anything"},
      {"***abc", "xxabc"},
      {"a**b", "a-b"},
      {"a**b", "ab"},
      {"ab*ab", "abab"},
      {"a*", "a"},
      {"*.JSP", "/x/index.jsp"},
      {"/APP/*", "/app/x"},
      {"*b*d*", "abcde"},
      {"*ab*ab", "xabab"},
  };
  for (const auto& [pattern, text] : kMatching) {
    EXPECT_TRUE(Matches(pattern, text)) << pattern << " / " << text;
  }
  const Case kNotMatching[] = {
      {"", ""},
      {"", "abc"},
      {"**", "anything"},
      {"***abc", "abcx"},
      {"ab*ab", "ab"},  // the end must not overlap the start
      {"abc", "abcd"},
      {"*d*b*", "abcde"},   // CONTAINS parts in order
      {"*aba*ba", "xaba"},  // ENDSWITH begins before the position
  };
  for (const auto& [pattern, text] : kNotMatching) {
    EXPECT_FALSE(Matches(pattern, text)) << pattern << " / " << text;
  }
  EXPECT_FALSE(Matches(nullptr, "x"));
  EXPECT_FALSE(Matches("*", nullptr));
}

TEST(PatternMatchTest, NonAsciiFoldsCase) {
  EXPECT_TRUE(Matches("*STRASSE*",
                      "/Stra\xc3\x9f"
                      "e/1"));                                     // sharp s folds to "ss"
  EXPECT_TRUE(Matches("\xc3\x89T\xc3\x89", "\xc3\xa9t\xc3\xa9"));  // ÉTÉ / été
  EXPECT_TRUE(Matches("\xef\xac\x80*", "FFx"));     // the ligature ﬀ folds to ASCII "ff"
  EXPECT_TRUE(Matches("\xe2\x84\xaa*", "kelvin"));  // KELVIN SIGN folds to "k"
  // The position moves by the element's bytes: "é" is 2 bytes but 1 unit, so the CONTAINS
  // search starts one unit late.
  EXPECT_FALSE(Matches("\xc3\xa9*x*", "\xc3\xa9x"));
}

// A compiled list gives the same answer as parsing on the spot, and is reusable.
TEST(PatternMatchTest, PrecompiledList) {
  _PARSE_INFO* list = CCommon::getParseInfo("*.jsp");
  EXPECT_TRUE(CCommon::patternMatches("*.jsp", "/A.JSP", list));
  EXPECT_FALSE(CCommon::patternMatches("*.jsp", "/a.jspx", list));
  EXPECT_TRUE(CCommon::patternMatches("*", "/a.jspx", list));  // "*" wins before the list
  EXPECT_FALSE(CCommon::patternMatches(nullptr, "/a.jsp", list));
  CCommon::freeParseInfo(list);
}

// The ASCII fast path must agree with ICU folding everywhere: random patterns and texts from an
// alphabet that mixes cases, '*', and characters whose folding is special.
TEST(PatternMatchTest, FastPathAgreesWithIcu) {
  const std::vector<std::string> alphabet = {
      "a",
      "A",
      "b",
      "B",
      "k",
      "K",
      "s",
      "S",
      ".",
      "/",
      "-",
      "f",
      "F",
      "\xc3\x9f",      // ß -> ss
      "\xe2\x84\xaa",  // KELVIN SIGN -> k
      "\xc5\xbf",      // long s -> s
      "\xef\xac\x80",  // ﬀ -> ff
      "\xc3\x89",      // É
      "\xc4\xb0",      // İ -> i + combining dot
      "\xff",          // invalid UTF-8
  };
  std::mt19937 rng(42);
  auto randomText = [&](bool ascii, bool stars) {
    std::string s;
    const int length = static_cast<int>(rng() % 9);
    for (int i = 0; i < length; ++i) {
      if (stars && rng() % 4 == 0) {
        s += '*';
        continue;
      }
      const size_t limit = ascii ? 13 : alphabet.size();
      s += alphabet[rng() % limit];
    }
    return s;
  };
  int agreements = 0;
  for (int i = 0; i < 20000; ++i) {
    const std::string pattern = randomText(rng() % 2 == 0, true);
    const std::string text = randomText(rng() % 2 == 0, false);
    _PARSE_INFO* list = CCommon::getParseInfo(pattern.c_str());
    if (list == nullptr) {
      continue;
    }
    const bool fast = CCommon::patternMatches(pattern.c_str(), text.c_str(), list);
    const bool icu = pattern == "*" || pattern_internal::matchIcu(list, text.c_str());
    EXPECT_EQ(icu, fast) << "pattern [" << pattern << "] text [" << text << "]";
    agreements += fast;
    CCommon::freeParseInfo(list);
  }
  EXPECT_GT(agreements, 500);  // the comparison saw plenty of matches, not only misses
}

}  // namespace
