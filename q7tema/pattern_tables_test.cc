// The pattern tables: situations that define transaction and client patterns, the defaults and
// warnings when they define too little, removal, sampling, and reading filter values.

#include "q7tema/pattern_tables.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "framework/request.h"
#include "framework/trace_capture.h"
#include "q7tema/exported_tables.h"
#include "q7tema/row_query.h"

namespace q7tema {
namespace {

class PatternTablesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    PatternHooks hooks;
    hooks.registerTransaction = [this](const char* situation, const char* app, const char* appPat,
                                       const char* tx, const char* txPat, int16_t aggap,
                                       int16_t aggtx, int16_t inst, int32_t pct, int32_t thres,
                                       int16_t importance) {
      calls_.push_back("tx " + std::string(situation) + " " + app + "|" + appPat + "|" + tx +
                       "|" + txPat + " " + std::to_string(aggap) + "," + std::to_string(aggtx) +
                       "," + std::to_string(inst) + "," + std::to_string(pct) + "," +
                       std::to_string(thres) + "," + std::to_string(importance));
      return refuse_.empty() || refuse_ != txPat;
    };
    hooks.deregisterTransaction = [this](const char* situation) {
      calls_.push_back("untx " + std::string(situation));
      return true;
    };
    hooks.registerClient = [this](const char* situation, const char* name, const char* host,
                                  const char* ip, int16_t uniq) {
      calls_.push_back("cl " + std::string(situation) + " " + name + "|" + host + "|" + ip + " " +
                       std::to_string(uniq));
      return true;
    };
    hooks.deregisterClient = [this](const char* situation) {
      calls_.push_back("uncl " + std::string(situation));
      return true;
    };
    hooks.sendMessage = [this](const char* key, int, const char* situation) {
      calls_.push_back("message " + std::string(key) + " " + situation);
    };
    SetPatternHooks(std::move(hooks));
  }
  void TearDown() override { SetPatternHooks({}); }

  static fw::Request Situation(std::vector<std::pair<std::string, std::string>> conditions,
                               int type = 4) {
    fw::Request request;
    request.type = type;
    request.situation = "Shop";
    for (auto& [column, value] : conditions) {
      request.conditions.push_back({column, fw::ConditionOp::kEQ, value, -1});
    }
    return request;
  }
  void startTransaction(fw::Request& request) {
    kq7_q7txptns_agent agent(&request, nullptr);
    agent.TakeSampleConstructor();
  }

  std::vector<std::string> calls_;
  std::string refuse_;  // a transaction pattern the controller refuses
};

// Each complete set of ten settings registers a pattern at once; the situation's old patterns
// go first.
TEST_F(PatternTablesTest, EveryCompleteSetRegistersOnePattern) {
  std::vector<std::pair<std::string, std::string>> set = {
      {"APPLICATIN", "Shop"}, {"APPPATTERN", "*shop*"}, {"TRANSACTN", "Checkout"},
      {"TRANSPATTN", "*/checkout*"}, {"AGGAPSUNIQ", "1"}, {"AGGTXSUNIQ", "0"},
      {"COLLINSTCS", "2"}, {"SAMPERCENT", "50"}, {"IMPORTANCE", "7"}, {"mrtthres", " 2500"}};
  auto two = set;
  two[3].second = "*/cart*";
  two.insert(two.end(), set.begin(), set.end());
  fw::Request request = Situation(two);
  startTransaction(request);
  EXPECT_EQ((std::vector<std::string>{"untx Shop",
                                      "tx Shop Shop|*shop*|Checkout|*/cart* 1,0,2,50,2500,7",
                                      "tx Shop Shop|*shop*|Checkout|*/checkout* 1,0,2,50,2500,7"}),
            calls_);
}

// Only the four texts: the defaults fill the rest.
TEST_F(PatternTablesTest, FourTextsGetTheDefaults) {
  fw::Request request = Situation({{"APPLICATIN", "Shop"},
                                   {"APPPATTERN", "*"},
                                   {"TRANSACTN", "Checkout"},
                                   {"TRANSPATTN", "*/checkout*"},
                                   {"SAMPERCENT", "25"}});
  startTransaction(request);
  EXPECT_EQ((std::vector<std::string>{"untx Shop",
                                      "tx Shop Shop|*|Checkout|*/checkout* 0,1,0,25,10000000,99"}),
            calls_);
}

// Without a transaction pattern nothing is registered: the warning, the missing column's line
// and the operator message.
TEST_F(PatternTablesTest, MissingTextsAreReported) {
  fw::TraceCapture capture("*=ALL");
  fw::Request request =
      Situation({{"APPLICATIN", "Shop"}, {"APPPATTERN", "*"}, {"TRANSACTN", "Checkout"}});
  startTransaction(request);
  EXPECT_TRUE(capture.contains("Warning: pattern was not added because not all required columns "
                               "were defined for sitation Shop"));
  EXPECT_TRUE(capture.contains("\t Transaction Pattern was not defined"));
  EXPECT_FALSE(capture.contains("\t Application Name was not defined"));
  EXPECT_TRUE(capture.contains("Situation name is [Shop] sampleType[4]"));
  EXPECT_EQ((std::vector<std::string>{"untx Shop",
                                      "message RT_AGENT_TRANSACTION_PATTERN_ERROR Shop"}),
            calls_);
}

// A pattern the controller refuses is reported to the operator too.
TEST_F(PatternTablesTest, RefusedPatternIsReported) {
  refuse_ = "*/x*";
  fw::Request request = Situation(
      {{"APPLICATIN", "A"}, {"APPPATTERN", "*"}, {"TRANSACTN", "X"}, {"TRANSPATTN", "*/x*"}});
  startTransaction(request);
  ASSERT_EQ(3u, calls_.size());
  EXPECT_EQ("message RT_AGENT_TRANSACTION_PATTERN_ERROR Shop", calls_[2]);
}

// Other request types register nothing; the destructor removes the situation's patterns.
TEST_F(PatternTablesTest, OnlySituationsRegisterAndStoppingRemoves) {
  fw::Request sample = Situation({{"APPLICATIN", "Shop"}}, 3);
  startTransaction(sample);
  EXPECT_TRUE(calls_.empty());
  fw::Request request = Situation({});
  kq7_q7txptns_agent agent(&request, nullptr);
  agent.TakeSampleDestructor();
  kq7_q7clntptns_agent client(&request, nullptr);
  client.TakeSampleDestructor();
  EXPECT_EQ((std::vector<std::string>{"untx Shop", "uncl Shop"}), calls_);
}

// Client patterns: three texts and the aggregation flag; the three texts alone aggregate 0.
TEST_F(PatternTablesTest, ClientPatterns) {
  fw::Request full = Situation({{"CLIENTNA", "Office"},
                                {"CLIENTHOPT", "*"},
                                {"CLIENTPPT", "10.1.*"},
                                {"AGGUNIQLY", "2"},
                                {"CLIENTNA", "Home"},
                                {"CLIENTHOPT", "*.home"},
                                {"CLIENTPPT", "*"}});
  kq7_q7clntptns_agent agent(&full, nullptr);
  agent.TakeSampleConstructor();
  EXPECT_EQ((std::vector<std::string>{"uncl Shop", "cl Shop Office|*|10.1.* 2"}), calls_);
  calls_.clear();
  fw::Request texts =
      Situation({{"CLIENTNA", "Home"}, {"CLIENTHOPT", "*.home"}, {"CLIENTPPT", "*"}});
  kq7_q7clntptns_agent second(&texts, nullptr);
  second.TakeSampleConstructor();
  EXPECT_EQ((std::vector<std::string>{"uncl Shop", "cl Shop Home|*.home|* 0"}), calls_);
}

// A sample (type 3) lists what the row query answers.
TEST_F(PatternTablesTest, SampleListsPatterns) {
  SetRowQuery<kq7_q7txptns_data_t>([](int type, int* count) -> kq7_q7txptns_data_t* {
    *count = type == 3 ? 2 : 0;
    return type == 3 ? new kq7_q7txptns_data_t[2]{} : nullptr;
  });
  fw::Request request = Situation({}, 3);
  kq7_q7txptns_agent agent(&request, nullptr);
  agent.TakeSample();
  EXPECT_EQ(2, request.row_count());
  SetRowQuery<kq7_q7txptns_data_t>({});
}

// Filter values: leading blanks, a sign, digits up to the first other character; no digits 0;
// the length bounds what is read.
TEST(FilterIntValueTest, ReadsLeadingInteger) {
  EXPECT_EQ(42, getFilterIntValue("  42", -1));
  EXPECT_EQ(-7, getFilterIntValue("-7x", -1));
  EXPECT_EQ(12, getFilterIntValue("+12.5", -1));
  EXPECT_EQ(0, getFilterIntValue("abc", -1));
  EXPECT_EQ(0, getFilterIntValue("", -1));
  EXPECT_EQ(0, getFilterIntValue(nullptr, 3));
  EXPECT_EQ(12, getFilterIntValue("1234", 2));
  EXPECT_EQ(2147483647, getFilterIntValue("99999999999", -1));
}

}  // namespace
}  // namespace q7tema
