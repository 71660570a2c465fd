#include "core/analyzer/intake/common.h"

#include <dirent.h>
#include <gtest/gtest.h>
#include <string.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "tests/support/scratch_dir.h"

namespace {

// Reads every field of line with getNextField into slots of the given width.
std::vector<std::string> Fields(std::string line, int width, int count) {
  std::vector<std::string> out;
  char* cursor = line.data();
  std::vector<char> buffer(width);
  for (int i = 0; i < count; ++i) {
    CCommon::getNextField(&cursor, buffer.data(), width);
    out.emplace_back(buffer.data());
  }
  return out;
}

// Fields are cut to their slot yet the cursor passes the whole field; the last field, with no
// caret behind it, is read as its first character only.
TEST(FieldTest, CutFieldsAndLastFieldFirstCharacter) {
  EXPECT_EQ((std::vector<std::string>{"ab", "", "12345", "2"}), Fields("ab^^1234567^250", 6, 4));
  EXPECT_EQ((std::vector<std::string>{"x", "", ""}), Fields("x^", 8, 3));
  char line[] = "1^-7^ 42^x9^12";
  char* cursor = line;
  EXPECT_EQ(1, CCommon::getNextInteger(&cursor));
  EXPECT_EQ(-7, CCommon::getNextInteger(&cursor));
  EXPECT_EQ(42, CCommon::getNextInteger(&cursor));
  EXPECT_EQ(0, CCommon::getNextInteger(&cursor));
  EXPECT_EQ(1, CCommon::getNextInteger(&cursor));  // "12" read as "1"
  EXPECT_EQ('2', *cursor);
}

TEST(FieldTest, CaretsSkipAndLineEnds) {
  char line[] = "a^b^^c\r\n\r\nd";
  EXPECT_EQ(3, CCommon::countCarets(line));
  EXPECT_EQ(0, CCommon::countCarets(nullptr));
  EXPECT_EQ(line + 2, CCommon::skipField(line));
  char* end = line + 5;
  EXPECT_EQ(line + strlen(line), CCommon::skipField(end));
  EXPECT_EQ(4, CCommon::findEOLChars(line + 6));
  EXPECT_EQ(0, CCommon::findEOLChars(line));
}

TEST(ValuePairTest, TimingsAndHexPairs) {
  char line[] = "12.345^12.5^7^1f-A0^ff^3-^9.8";
  char* cursor = line;
  unsigned int a = 99, b = 99;
  CCommon::getNextTiming(&cursor, &a, &b);
  EXPECT_EQ(12u, a);
  EXPECT_EQ(345000000u, b);
  CCommon::getNextTiming(&cursor, &a, &b);
  EXPECT_EQ(5000000u, b);  // thousandths counted, not a decimal fraction
  CCommon::getNextTiming(&cursor, &a, &b);
  EXPECT_EQ(7u, a);
  EXPECT_EQ(0u, b);
  CCommon::getNextHexPair(&cursor, &a, &b);
  EXPECT_EQ(31u, a);
  EXPECT_EQ(160u, b);
  CCommon::getNextHexPair(&cursor, &a, &b);
  EXPECT_EQ(255u, a);
  EXPECT_EQ(0u, b);
  CCommon::getNextHexPair(&cursor, &a, &b);
  EXPECT_EQ(3u, a);
  EXPECT_EQ(0u, b);
  CCommon::getNextValuesWithSeparator(&cursor, '.', 0, &a, &b);  // last field: "9" only
  EXPECT_EQ(9u, a);
  EXPECT_EQ(0u, b);
}

TEST(AhextoiTest, DigitsAndStrayCharacters) {
  EXPECT_EQ(0u, ahextoi(nullptr));
  EXPECT_EQ(0u, ahextoi(""));
  EXPECT_EQ(0xDEADBEEFu, ahextoi("deadBEEF"));
  EXPECT_EQ(16u, ahextoi("1g"));  // a stray character is a 0 digit that still takes its power
  EXPECT_EQ(0x101u, ahextoi("1x1"));
}

TEST(StripToSubnetTest, KeepsLeadingParts) {
  char out[64];
  const std::pair<int, const char*> cases[] = {{3, "10.1.2.*"}, {1, "10.*"},     {0, "*"},
                                               {-1, "*"},       {4, "10.1.2.3"}, {9, "10.1.2.3"}};
  for (const auto& [parts, expected] : cases) {
    CCommon::stripToSubnet("10.1.2.3", out, parts);
    EXPECT_STREQ(expected, out) << parts;
  }
  CCommon::stripToSubnet("", out, 2);
  EXPECT_STREQ("*", out);
}

TEST(NewerFileTest, Rules) {
  EXPECT_TRUE(CCommon::newerFile("b.sm3", "a.sm3"));  // same length: byte-wise
  EXPECT_FALSE(CCommon::newerFile("a.sm3", "b.sm3"));
  EXPECT_FALSE(CCommon::newerFile("day1-0001.sm3", "day1.sm3"));  // renamed file is older
  EXPECT_TRUE(CCommon::newerFile("day1.sm3", "day1-0001.sm3"));
  EXPECT_TRUE(CCommon::newerFile("day2.sm3", "day10.sm3"));  // stems byte-wise, not numerically
  EXPECT_TRUE(CCommon::newerFile("zz", "aaa.sm3"));          // no '.': byte-wise
  EXPECT_TRUE(CCommon::newerFile("f.sm3x", "f.sm3"));        // equal stems: longer suffix
  EXPECT_FALSE(CCommon::newerFile("f.sm3", "f.sm3x"));
  EXPECT_TRUE(CCommon::newerFile("ab.x", "a.xyz"));  // stem "ab" after its prefix "a"
  // The first '.' of a path may sit in the directory: "/d.x/aa.sm3" has stem "/d".
  EXPECT_TRUE(CCommon::newerFile("/d.x/a.sm3x", "/d.x/b.sm3"));
}

_FILE_INFO_LL* MakeList(const std::vector<std::string>& names) {
  _FILE_INFO_LL* head = nullptr;
  for (auto it = names.rbegin(); it != names.rend(); ++it) {
    auto* node = new _FILE_INFO_LL;
    snprintf(node->fileName, sizeof(node->fileName), "%s", it->c_str());
    node->next = head;
    head = node;
  }
  return head;
}

std::vector<std::string> Names(const _FILE_INFO_LL* list) {
  std::vector<std::string> out;
  for (; list != nullptr; list = list->next) {
    out.emplace_back(list->fileName);
  }
  return out;
}

// The result is a permutation of the input in which no node is newer than its successor.
TEST(SortFilesByNameTest, RandomListsComeOutOldestFirst) {
  std::mt19937 rng(7);
  const std::vector<std::string> pool = {"a.sm3",    "b.sm3",     "day1.sm3", "day1-0001.sm3",
                                         "day2.sm3", "day10.sm3", "x",        "f.sm3x",
                                         "f.sm3",    "d-2.sm3",   "zz.s",     "day1-0002.sm3"};
  for (int round = 0; round < 200; ++round) {
    std::vector<std::string> names;
    const int count = static_cast<int>(rng() % 8);
    for (int i = 0; i < count; ++i) {
      names.push_back(pool[rng() % pool.size()]);
    }
    _FILE_INFO_LL* list = CCommon::sortFilesByName(MakeList(names));
    std::vector<std::string> sorted = Names(list);
    CCommon::deleteFoundFiles(list);
    ASSERT_EQ(names.size(), sorted.size());
    for (size_t i = 0; i + 1 < sorted.size(); ++i) {
      EXPECT_FALSE(CCommon::newerFile(sorted[i].c_str(), sorted[i + 1].c_str()))
          << sorted[i] << " before " << sorted[i + 1];
    }
    std::vector<std::string> a = sorted, b = names;
    std::sort(a.begin(), a.end());
    std::sort(b.begin(), b.end());
    EXPECT_EQ(b, a);
  }
  EXPECT_EQ(nullptr, CCommon::sortFilesByName(nullptr));
}

TEST(SortFilesByNameTest, RenamedFilesFirst) {
  _FILE_INFO_LL* list =
      CCommon::sortFilesByName(MakeList({"day2.sm3", "day1.sm3", "day1-0001.sm3"}));
  EXPECT_EQ((std::vector<std::string>{"day1-0001.sm3", "day1.sm3", "day2.sm3"}), Names(list));
  CCommon::deleteFoundFiles(list);
}

// The list is in the reverse of readdir's order, holds only matching names with the directory
// in front, and matching ignores case.
TEST(FindFilesTest, ReverseReadingOrderOfMatches) {
  q7test::ScratchDir dir;
  for (const char* name : {"a.sm3", "b.SM3", "c.txt", "d.sm3"}) {
    dir.write(name, "x");
  }
  std::vector<std::string> readOrder;
  if (DIR* d = opendir(dir.path().c_str())) {
    while (const dirent* e = readdir(d)) {
      std::string name = e->d_name;
      if (name.size() > 4 &&
          (name.substr(name.size() - 4) == ".sm3" || name.substr(name.size() - 4) == ".SM3")) {
        readOrder.insert(readOrder.begin(), dir.file(name));
      }
    }
    closedir(d);
  }
  std::string directory = dir.path();
  _FILE_INFO_LL* list = CCommon::findFiles(directory.c_str(), "*.sm3");
  EXPECT_EQ(readOrder, Names(list));
  EXPECT_EQ(3u, readOrder.size());
  CCommon::deleteFoundFiles(list);

  EXPECT_EQ(nullptr, CCommon::findFiles(directory.c_str(), "*.none"));
  EXPECT_EQ(nullptr, CCommon::findFiles(dir.file("missing").c_str(), "*"));
  const std::string longDir(4090, 'd');
  EXPECT_EQ(nullptr, CCommon::findFiles(longDir.c_str(), "*.sm3"));
}

}  // namespace

namespace {

// The integer reader agrees with strtol on every field a line can hold (16 characters at most).
TEST(FieldTest, DecimalFieldValueAgreesWithStrtol) {
  const std::string alphabet = "0123456789 \t\v+-x.9";
  std::mt19937 rng(11);
  for (int round = 0; round < 50000; ++round) {
    std::string field;
    const size_t length = rng() % 17;
    for (size_t i = 0; i < length; ++i) {
      field += alphabet[rng() % alphabet.size()];
    }
    ASSERT_EQ(strtol(field.c_str(), nullptr, 10), decimalFieldValue(field.c_str())) << field;
  }
  EXPECT_EQ(-9999999999999999L, decimalFieldValue("-9999999999999999"));
}

}  // namespace

namespace {

// The word-at-a-time caret count agrees with a plain count on texts of every length and mix,
// bytes with the top bit set included.
TEST(FieldTest, CaretCountAgreesWithPlainCount) {
  const std::string alphabet = "^^^abc^\x7f\x80\xde\xfe~]_";
  std::mt19937 rng(5);
  for (int round = 0; round < 20000; ++round) {
    std::string text;
    const size_t length = rng() % 70;
    for (size_t i = 0; i < length; ++i) {
      text += alphabet[rng() % alphabet.size()];
    }
    ASSERT_EQ(std::count(text.begin(), text.end(), '^'), CCommon::countCarets(text.data())) << text;
  }
}

}  // namespace
