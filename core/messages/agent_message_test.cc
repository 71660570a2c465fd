// Agent messages: lookup and formatting through compiled bundles, the record's fields, the list
// of the last 1000, and the agent-messages event row.

#include "core/messages/agent_message.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/clock.h"
#include "framework/events.h"
#include "framework/trace_capture.h"

namespace {

constexpr time_t kSentAt = 1700000000;

std::string Column(const char* column, std::size_t width) {
  return std::string(column, width);
}

class AgentMessageTest : public ::testing::Test {
 protected:
  void SetUp() override {
    AgentMessage::resetForTesting();
    fw::ResetEventsForTesting();
    fw::SetClockForTesting([] { return kSentAt; });
  }
  void TearDown() override {
    fw::SetClockForTesting({});
    AgentMessage::resetForTesting();
    fw::ResetEventsForTesting();
  }

  // The one message sent since SetUp.
  static AgentMessage OnlyMessage() {
    const std::vector<AgentMessage> messages = AgentMessage::recentMessages();
    EXPECT_EQ(1u, messages.size());
    return messages.empty() ? AgentMessage{} : messages.front();
  }

  static void SendEcho(const std::string& text, const char* origin, const char* location) {
    icu::Formattable arg(icu::UnicodeString::fromUTF8(text));
    AgentMessage::sendMessage("ECHO", 1, origin, location, &arg, 1);
  }
};

// A message of the agent's own bundle: identifier, substituted text, origin and location, and
// the event row with every column blank-padded.
TEST_F(AgentMessageTest, RealBundleFormatsAndPublishes) {
  AgentMessage::setResourceBundle(Q7_MESSAGE_BUNDLE_DIR);
  const int line = __LINE__ + 1;
  AgentMessage::sendMessage("TRANSPATTERN_OVERLAP_WARNING", 2, {"shop", "all", "shop"});
  const AgentMessage message = OnlyMessage();
  EXPECT_STREQ("KQ7RT0004W", message.messageId);
  EXPECT_STREQ(
      "WARNING: Transaction Pattern situation[shop] overlaps with situation[all] and "
      "transactions that match both will goto situation[shop]",
      message.text);
  EXPECT_EQ(2, message.severity);
  EXPECT_EQ(kSentAt, message.time);
  EXPECT_STREQ("WebAgent", message.origin);
  EXPECT_EQ("agent_message_test.cc, TestBody, line " + std::to_string(line),
            std::string(message.location));

  const std::vector<fw::EventRow> events = fw::ListEventRows("Q7AGNTMSGS");
  ASSERT_EQ(1u, events.size());
  ASSERT_EQ(sizeof(kq7_q7agntmsgs_data_t), events[0].bytes.size());
  kq7_q7agntmsgs_data_t row;
  std::memcpy(&row, events[0].bytes.data(), sizeof(row));
  const std::string node = fw::OriginNodeName();
  EXPECT_EQ(node + std::string(32 - node.size(), ' '), Column(row.originnode, 32));
  char stamp[16];
  TimeSince70ToMordel(kSentAt, stamp);
  EXPECT_EQ(Column(stamp, 16), Column(row.msgdattime, 16));
  EXPECT_EQ(Column(stamp, 16), Column(row.sdate_time, 16));
  EXPECT_EQ(2, row.severity);
  EXPECT_EQ("WebAgent" + std::string(24, ' '), Column(row.component, 32));
  EXPECT_EQ("KQ7RT0004W" + std::string(22, ' '), Column(row.msgid, 32));
  const std::string text = message.text;
  EXPECT_EQ(text + std::string(1024 - text.size(), ' '), Column(row.msgtext, 1024));
  EXPECT_EQ(' ', row.msgsource[511]);

  // A sample of the table serves the same row.
  int count = 0;
  std::unique_ptr<kq7_q7agntmsgs_data_t[]> rows(getAgentMessageRows(3, &count));
  ASSERT_EQ(1, count);
  EXPECT_EQ(0, std::memcmp(&rows[0], &row, sizeof(row)));
  EXPECT_EQ(nullptr, getAgentMessageRows(1, &count));
  EXPECT_EQ(0, count);
}

// Every message of the agent's bundle exists and starts with an identifier and a blank.
TEST_F(AgentMessageTest, RealBundleHasEveryKey) {
  AgentMessage::setResourceBundle(Q7_MESSAGE_BUNDLE_DIR);
  fw::TraceCapture capture;
  for (const char* key : {"RT_AGENT_STARTED", "RT_AGENT_CLIENT_PATTERN_ERROR",
                          "RT_AGENT_TRANSACTION_PATTERN_ERROR", "TRANSPATTERN_OVERLAP_WARNING",
                          "CLIENTPATTERN_OVERLAP_WARNING", "OLD_TRANSACTIONS_WARNING"}) {
    AgentMessage::sendMessage(key, 4, {"a", "b", "c"});
    const AgentMessage message = AgentMessage::recentMessages().back();
    EXPECT_EQ(10u, std::strlen(message.messageId)) << key;
    EXPECT_STRNE("", message.text) << key;
  }
  EXPECT_FALSE(capture.contains("Could not"));
  EXPECT_FALSE(capture.contains("Failed to format"));
}

// Arguments of every kind are substituted and the text stays UTF-8; one cut to the text field
// ends on a character boundary.
TEST_F(AgentMessageTest, FormatsArgumentsAsUtf8) {
  AgentMessage::setResourceBundle(Q7_TEST_BUNDLE_DIR);
  icu::Formattable args[] = {icu::UnicodeString::fromUTF8("Zoë"), icu::Formattable(42.4)};
  AgentMessage::sendMessage("GREETING", 3, args, 2, "/a/b/c.cc", "f", 7);
  AgentMessage message = OnlyMessage();
  EXPECT_STREQ("KQ7TEST03I", message.messageId);
  EXPECT_STREQ("Grüße an Zoë: 42 Einträge", message.text);
  EXPECT_STREQ("c.cc, f, line 7", message.location);

  // 1021 ASCII bytes, then a 2-byte character that does not fit the 1023 bytes of text.
  SendEcho(std::string(1021, 'x') + "éé", "o", "l");
  message = AgentMessage::recentMessages().back();
  EXPECT_EQ(std::string(1021, 'x') + "é", std::string(message.text));
}

// Short texts, long origins and locations: each field keeps what fits.
TEST_F(AgentMessageTest, FieldsAreCutToTheirSizes) {
  AgentMessage::setResourceBundle(Q7_TEST_BUNDLE_DIR);
  AgentMessage::sendMessage("SHORT", 1, std::vector<std::string>{});
  AgentMessage message = OnlyMessage();
  EXPECT_STREQ("KQ7TEST01I", message.messageId);
  EXPECT_STREQ("", message.text);

  SendEcho("t", std::string(40, 'o').c_str(), std::string(600, 'l').c_str());
  message = AgentMessage::recentMessages().back();
  EXPECT_EQ(std::string(32, 'o'), message.origin);
  EXPECT_EQ(std::string(512, 'l'), message.location);
  EXPECT_STREQ("t", message.text);
}

// A missing key or a broken pattern is traced and the message still goes out, with no text.
TEST_F(AgentMessageTest, MissingKeyAndBrokenPatternSendEmptyText) {
  AgentMessage::setResourceBundle(Q7_TEST_BUNDLE_DIR);
  fw::TraceCapture capture;
  AgentMessage::sendMessage("NO_SUCH_KEY", 5, {"x"});
  AgentMessage::sendMessage("BROKEN", 5, {"x"});
  EXPECT_TRUE(capture.contains("Could not find message for key NO_SUCH_KEY"));
  EXPECT_TRUE(capture.contains("Failed to format message for key BROKEN"));
  const std::vector<AgentMessage> messages = AgentMessage::recentMessages();
  ASSERT_EQ(2u, messages.size());
  for (const AgentMessage& message : messages) {
    EXPECT_STREQ("", message.messageId);
    EXPECT_STREQ("", message.text);
    EXPECT_EQ(5, message.severity);
  }
  EXPECT_EQ(2u, fw::ListEventRows("Q7AGNTMSGS").size());
}

// Without a bundle nothing is sent; a bundle that cannot be opened is traced and leaves none.
TEST_F(AgentMessageTest, NoBundleDropsMessages) {
  fw::TraceCapture capture;
  AgentMessage::sendMessage("RT_AGENT_STARTED", 4, {});
  AgentMessage::setResourceBundle(Q7_MESSAGE_BUNDLE_DIR);
  AgentMessage::setResourceBundle("/no/such/RTAgentMsgs");
  AgentMessage::sendMessage("RT_AGENT_STARTED", 4, {});
  EXPECT_TRUE(AgentMessage::recentMessages().empty());
  EXPECT_TRUE(fw::ListEventRows("Q7AGNTMSGS").empty());
  EXPECT_TRUE(capture.contains("Attempting to open bundle using locale "));
  EXPECT_TRUE(capture.contains("Could not open resource bundle /no/such/RTAgentMsgs"));
}

// The list keeps the last 1000: the 1001st message evicts the first.
TEST_F(AgentMessageTest, ListKeepsTheLastThousand) {
  for (int i = 1; i <= 1001; ++i) {
    auto message = std::make_unique<AgentMessage>();
    message->severity = i;
    AgentMessage::sendMessage(std::move(message));
  }
  const std::vector<AgentMessage> messages = AgentMessage::recentMessages();
  ASSERT_EQ(AgentMessage::kMaxMessages, messages.size());
  EXPECT_EQ(2, messages.front().severity);
  EXPECT_EQ(1001, messages.back().severity);
  EXPECT_EQ(fw::kEventRingCapacity, fw::ListEventRows("Q7AGNTMSGS").size());
}

}  // namespace
