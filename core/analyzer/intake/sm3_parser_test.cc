#include "core/analyzer/intake/sm3_parser.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "core/analyzer/intake/sm3_fields.h"
#include "framework/trace_capture.h"
#include "tests/support/sm3_lines.h"

namespace {

using q7test::AvLine;
using q7test::PageLine;

std::unique_ptr<CDPXTransaction> Page(std::string line) {
  return processHSM3Line(line.data());
}
std::unique_ptr<CDPXTransaction> Av(std::string line) {
  return processAVSM3Line(line.data());
}

// Every field lands in its slot; text is cut to the slot while the fields after it stay right.
TEST(PageLineTest, FieldsLandInTheirSlots) {
  auto t = Page(PageLine({{3, std::string(300, 'r')},
                          {7, "ignored"},
                          {8, "ignored"},
                          {23, "/shop/cart?x=1"},
                          {28, "404"},
                          {29, "33"},
                          {36, "17"},
                          {40, "www.example.org"},
                          {44, "top"},
                          {45, "My Shop"}}));
  ASSERT_TRUE(t);
  EXPECT_EQ(std::string(64, 'r'), t->getReserved1());
  EXPECT_STREQ("", t->getTransDate());
  EXPECT_STREQ("", t->getTransTimeString());
  EXPECT_EQ(1795000000, t->getTransTime());
  EXPECT_STREQ("10.1.2.3", t->getIPSourceAddress());
  EXPECT_EQ(120, t->getTotalResponseTime());
  EXPECT_STREQ("/shop/cart?x=1", t->getURL());
  EXPECT_STREQ("N/A", t->getReferrerURL());
  EXPECT_EQ(404, t->getRequestStatus());
  EXPECT_EQ(33, t->getServerTime());
  EXPECT_EQ(17, t->getNetworkTime());
  EXPECT_STREQ("www.example.org", t->getURLHostName());
  EXPECT_STREQ("top", t->getURLAnchor());
  EXPECT_STREQ("My Shop", t->getPageTitle());
  EXPECT_EQ(5, t->getTrueTransType());
}

// The last field is read from its first character only: "12" is method 1 on a page line, "250"
// is network time 2 on an object line, and "-5" there reads 0 without the negative-time trace.
TEST(LastFieldTest, ReadAsFirstCharacterOnly) {
  EXPECT_EQ(1, Page(PageLine({{46, "12"}}))->getiMethod());
  EXPECT_EQ(2, Av(AvLine({{31, "250"}}))->getNetworkTime());
  fw::TraceCapture capture("*=ERROR");
  EXPECT_EQ(0, Av(AvLine({{31, "-5"}}))->getNetworkTime());
  EXPECT_FALSE(capture.contains("negative"));
}

TEST(PageLineTest, NegativeNetworkTimeIsClampedWithTrace) {
  fw::TraceCapture capture("*=ERROR");
  auto t = Page(PageLine({{36, "-5"}}));
  EXPECT_EQ(0, t->getNetworkTime());
  EXPECT_TRUE(capture.contains("processHSM3Line Parsed in a negative networktime[-5]"));
  EXPECT_TRUE(capture.contains("processHSM3Line setting networktime to 0"));
  // The parser clamped already, so the constructor has nothing to say.
  EXPECT_FALSE(capture.contains("iNetworkTime"));
}

// A wrong caret count rejects the line before any field is read: one caret short or over, or a
// caret inside a value.
TEST(CaretCountTest, WrongCountsAreRejectedWithBelMarker) {
  fw::TraceCapture capture("*=ALL");
  const std::string good = PageLine();
  EXPECT_TRUE(Page(good));
  EXPECT_FALSE(Page(good.substr(0, good.rfind('^'))));  // 44 carets
  EXPECT_FALSE(Page(good + "^1"));                      // 46
  EXPECT_FALSE(Page(PageLine({{23, "/a^b"}})));
  EXPECT_EQ(3, capture.count("processHSM3Line \aERROR Wrong number of carets in this line"));
  EXPECT_FALSE(Av(AvLine() + "^0"));
  EXPECT_FALSE(Av(PageLine()));
  EXPECT_TRUE(capture.contains("processAVSM3Line \aERROR Wrong number of carets in this line"));
}

// The one-pass reader (every caret found at once, fields read from their positions) fills an
// entry byte for byte as the literal cursor-by-cursor reader does, on random lines of both
// layouts: fields empty, over their slot's width, with signs, blanks and non-digits in numbers,
// 16-digit and longer numbers, and last fields of zero to several characters.
TEST(FieldReaderTest, OnePassReaderAgreesWithTheLiteralOne) {
  std::srand(20261126);
  const std::string pieces[] = {"", "0", "7", "-", "+", " ", "\t", "12", "x", "/a/b.html",
                                "99999999999999999999", "1234567890123456", "-42", "3.5",
                                std::string(300, 'w'), "\xc3\xa9"};
  const auto randomField = [&] {
    std::string field;
    for (int n = std::rand() % 4; n > 0; --n) {
      field += pieces[static_cast<size_t>(std::rand()) % std::size(pieces)];
    }
    return field;
  };
  struct Layout {
    const SM3_FIELD_SLOT* slots;
    size_t fields;
    size_t entrySize;
  };
  const Layout layouts[] = {{SM3_HPAGE_LAYOUT, SM3_HPAGE_FIELDS, sizeof(SM3_HPAGE_ENTRY)},
                            {SM3_AV_LAYOUT, SM3_AV_FIELDS, sizeof(_SM3_AV_ENTRY)}};
  for (int round = 0; round < 4000; ++round) {
    const Layout& layout = layouts[round % 2];
    std::string line;
    for (size_t k = 0; k < layout.fields; ++k) {
      line += (k == 0 ? "" : "^") + randomField();
    }
    std::vector<const char*> carets(layout.fields);
    ASSERT_EQ(static_cast<int>(layout.fields) - 1,
              sm3_internal::FindCarets(line.c_str(), carets.data(), static_cast<int>(layout.fields)));
    std::vector<char> fast(layout.entrySize, 0);
    std::vector<char> literal(layout.entrySize, 0);
    sm3_internal::ReadFieldsAt(line.c_str(), carets.data(), layout.slots, layout.fields,
                               fast.data());
    std::string copy = line;
    sm3_internal::ReadFieldsLiteral(copy.data(), layout.slots, layout.fields, literal.data());
    ASSERT_TRUE(fast == literal) << "line " << round << ": " << line;
  }
  // Counting runs on past the positions it may store.
  const char* const text = "a^b^^c^d^";
  const char* few[2] = {};
  EXPECT_EQ(5, sm3_internal::FindCarets(text, few, 2));
  EXPECT_EQ(text + 1, few[0]);
  EXPECT_EQ(text + 3, few[1]);
}

// An object line keeps its shared fields, URL, status and network time; the two object-only
// integers and every page-only field are left out.
TEST(ObjectLineTest, ConvertsToPageEntry) {
  auto t = Av(AvLine({{15, "900"},
                      {23, "4242"},
                      {24, "/m/a.mp3"},
                      {28, "RTSP/1.0"},
                      {29, "503"},
                      {30, "128"},
                      {31, "9"}}));
  ASSERT_TRUE(t);
  EXPECT_EQ(900, t->getTotalResponseTime());
  EXPECT_STREQ("/m/a.mp3", t->getURL());
  EXPECT_STREQ("RTSP/1.0", t->getApplicationProtocol());
  EXPECT_EQ(503, t->getRequestStatus());
  EXPECT_EQ(9, t->getNetworkTime());
  EXPECT_EQ(0, t->getiMethod());
  EXPECT_STREQ("UNDEFINED", getMethodString(t->getiMethod()));
  EXPECT_STREQ("", t->getURLHostName());
  EXPECT_EQ(0, t->getServerTime());
  EXPECT_EQ(0, t->getReserved2());
  // With no host name the application is the server address.
  EXPECT_STREQ("192.0.2.20", t->getApplicationName());
}

// Lines that give no transaction are quoted whole below 7000 characters, cut to 7000 above.
TEST(CreateTransactionTest, FailuresAreQuotedAndIgnored) {
  fw::TraceCapture capture("*=ERROR");
  std::string bad = "a^b";
  EXPECT_FALSE(createDPXTransaction(bad.data(), 1));
  EXPECT_TRUE(capture.contains(
      "processSM3Line\aERROR: Failed to create a CDPXTransaction object from input "
      "pszSM3Line[a^b] of type[1]"));
  EXPECT_TRUE(capture.contains("processSM3Line  Line will be ignored"));

  std::string page = PageLine();
  EXPECT_FALSE(createDPXTransaction(page.data(), 7));
  EXPECT_TRUE(capture.contains("of type[7]"));
  EXPECT_TRUE(createDPXTransaction(page.data(), 2));

  capture.clear();
  std::string huge = std::string(6999, 'x') + std::string(3000, 'y');
  EXPECT_FALSE(createDPXTransaction(huge.data(), 3));
  EXPECT_TRUE(capture.contains("WAY TOO BIG input pszSM3Line (truncated)[" +
                               std::string(6999, 'x') + "y] of type[3]"));
}

// The dump writes one line a field under the flow class, skipping the two unread fields.
TEST(DumpTest, OneLinePerFieldAndMethodText) {
  fw::TraceCapture capture("*=ALL");
  SM3_HPAGE_ENTRY entry{};
  entry.iMethod = 9;
  entry.iTotalResponseTime = 77;
  dumpSM3Record(&entry);
  EXPECT_EQ(SM3_HPAGE_FIELDS - 2, static_cast<int>(capture.lines().size()));
  EXPECT_TRUE(capture.contains("Method                           [9:UNDEFINED]"));
  EXPECT_TRUE(capture.contains("Total responst time ms           [77]"));
  capture.clear();
  dumpSM3Record(nullptr);
  EXPECT_TRUE(capture.contains("ERROR: Input psm3 is NULL, can't dump the record"));
}

TEST(MethodTest, CodeTable) {
  const char* expected[] = {"UNDEFINED", "GET",    "POST",  "HEAD",    "PUT",
                            "OPTIONS",   "DELETE", "TRACE", "CONNECT", "UNDEFINED"};
  for (int code = 0; code <= 9; ++code) {
    EXPECT_STREQ(expected[code], getMethodString(code)) << code;
  }
  EXPECT_STREQ("UNDEFINED", getMethodString(-1));
}

}  // namespace
