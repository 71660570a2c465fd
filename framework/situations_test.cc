// Situations: checking what an operator asks for, starting, replacing and stopping them on a
// table's agent objects, keeping the list across a restart, and the API token.

#include "framework/situations.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "framework/api_token.h"
#include "framework/status.h"
#include "framework/tables.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

// What the agent objects of the test table were asked to do, in order.
std::vector<std::string>& Calls() {
  static std::vector<std::string> calls;
  return calls;
}

class RecordingAgent : public TableAgent {
 public:
  explicit RecordingAgent(Request* request) : request_(request) {}
  void TakeSampleConstructor() override {
    Calls().push_back("start " + request_->situation.value_or("?") + " type " +
                      std::to_string(request_->type) + " conditions " +
                      std::to_string(request_->conditions.size()));
  }
  void TakeSample() override {}
  void TakeSampleDestructor() override {
    Calls().push_back("stop " + request_->situation.value_or("?"));
  }

 private:
  Request* request_;
};

class RecordingManager : public TableManager {
 public:
  std::unique_ptr<TableAgent> CreateAgent(Request* request) override {
    return std::make_unique<RecordingAgent>(request);
  }
  void EventArrived(Request&) override {}
  void AddDataToEvent(Request&, const void*, int) override {}
};

class SituationsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ResetTablesForTesting();
    ResetSituations();
    Calls().clear();
    // 20 bytes of text, a 16-bit and a 32-bit integer.
    ASSERT_EQ(kOk, RegisterTable(TableDefinition{"Q7TXPTNS",
                                                 {{"transpattn", kColumnTypeString, 20, 0},
                                                  {"aggapsuniq", kColumnTypeInt16, 2, 20},
                                                  {"mrtthres", kColumnTypeInt32, 4, 24}},
                                                 28,
                                                 std::make_unique<RecordingManager>(),
                                                 {},
                                                 false}));
    file_ = dir_.file("q7_situations.json");
    SetSituationsFile(file_);
  }
  void TearDown() override {
    ResetSituations();
    ResetTablesForTesting();
  }

  // Checks and starts; the check's status.
  int start(const std::string& name, std::vector<ConditionText> conditions,
            const std::string& table = "q7txptns") {
    SituationInfo info;
    std::string error;
    const int checked = CheckSituation(name, table, conditions, &info, &error);
    if (checked != kOk) {
      error_ = error;
      return checked;
    }
    bool replaced = false;
    EXPECT_EQ(kOk, StartSituation(std::move(info), &replaced, &error)) << error;
    replaced_ = replaced;
    return kOk;
  }

  q7test::ScratchDir dir_;
  std::string file_;
  std::string error_;
  bool replaced_ = false;
};

// Unknown tables and columns, operators, over-long texts and bad or out-of-range numbers are
// refused with a message naming the problem.
TEST_F(SituationsTest, ChecksWhatIsAsked) {
  EXPECT_EQ(kNotFound, start("s", {}, "Q7NOPE"));
  EXPECT_NE(std::string::npos, error_.find("Q7NOPE"));
  EXPECT_EQ(kInvalidArgument, start("s", {{"NOPE", "EQ", "x"}}));
  EXPECT_NE(std::string::npos, error_.find("no column \"NOPE\""));
  EXPECT_EQ(kInvalidArgument, start("s", {{"TRANSPATTN", "LIKE", "x"}}));
  EXPECT_NE(std::string::npos, error_.find("unknown operator"));
  EXPECT_EQ(kInvalidArgument, start("s", {{"TRANSPATTN", "EQ", std::string(21, 'x')}}));
  EXPECT_NE(std::string::npos, error_.find("21 bytes, the column holds 20"));
  EXPECT_EQ(kOk, start("s", {{"TRANSPATTN", "eq", std::string(20, 'x')}}));
  EXPECT_EQ(kInvalidArgument, start("s", {{"MRTTHRES", "EQ", "12ms"}}));
  EXPECT_NE(std::string::npos, error_.find("not a whole number"));
  EXPECT_EQ(kInvalidArgument, start("s", {{"AGGAPSUNIQ", "EQ", "40000"}}));
  EXPECT_NE(std::string::npos, error_.find("out of range"));
  EXPECT_EQ(kOk, start("s", {{"AGGAPSUNIQ", "EQ", " -5 "}, {"MRTTHRES", "EQ", "+2147483647"}}));
  EXPECT_EQ(kInvalidArgument, start("a/b", {}));
  EXPECT_EQ(kInvalidArgument, start("", {}));
  EXPECT_EQ(kInvalidArgument, start(std::string(65, 'n'), {}));
}

// Start runs the agent object's constructor with a type-4 request; starting a name again
// replaces it without the old destructor; stop runs the destructor; the list keeps start order.
TEST_F(SituationsTest, StartReplaceStop) {
  ASSERT_EQ(kOk, start("first", {{"TRANSPATTN", "EQ", "*"}}));
  EXPECT_FALSE(replaced_);
  ASSERT_EQ(kOk, start("second", {}));
  ASSERT_EQ(kOk, start("first", {{"TRANSPATTN", "EQ", "a"}, {"MRTTHRES", "EQ", "5"}}));
  EXPECT_TRUE(replaced_);
  std::vector<SituationInfo> list = ListSituations();
  ASSERT_EQ(2u, list.size());
  EXPECT_EQ("first", list[0].name);
  EXPECT_EQ("Q7TXPTNS", list[0].table);
  EXPECT_EQ(2u, list[0].conditions.size());
  std::string error;
  EXPECT_EQ(kOk, StopSituation("first", &error));
  EXPECT_EQ(kNotFound, StopSituation("first", &error));
  EXPECT_EQ((std::vector<std::string>{"start first type 4 conditions 1",
                                      "start second type 4 conditions 0",
                                      "start first type 4 conditions 2", "stop first"}),
            Calls());
  EXPECT_EQ(1u, ListSituations().size());
}

// The list survives a restart, in order and without re-running constructors; stopping a
// restored situation runs its destructor. The file is private to its owner.
TEST_F(SituationsTest, RestoredWithoutRerunning) {
  ASSERT_EQ(kOk, start("one", {{"TRANSPATTN", "EQ", "*/checkout*"}}));
  ASSERT_EQ(kOk, start("two", {{"MRTTHRES", "EQ", "250"}}));
  struct stat st {};
  ASSERT_EQ(0, ::stat(file_.c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);
  ResetSituations();
  Calls().clear();
  SetSituationsFile(file_);
  EXPECT_EQ(2, RestoreSituations());
  EXPECT_TRUE(Calls().empty());
  const std::vector<SituationInfo> list = ListSituations();
  ASSERT_EQ(2u, list.size());
  EXPECT_EQ("one", list[0].name);
  EXPECT_EQ("*/checkout*", list[0].conditions[0].value);
  EXPECT_EQ("250", list[1].conditions[0].value);
  std::string error;
  EXPECT_EQ(kOk, StopSituation("two", &error));
  EXPECT_EQ(std::vector<std::string>{"stop two"}, Calls());
}

// A list that does not parse is kept aside, not lost, and nothing is restored from it.
TEST_F(SituationsTest, BrokenListIsKeptAside) {
  std::ofstream(file_) << "[{\"name\": \"half\", ";
  EXPECT_EQ(0, RestoreSituations());
  EXPECT_TRUE(std::filesystem::exists(file_ + ".bad"));
  EXPECT_FALSE(std::filesystem::exists(file_));
  EXPECT_TRUE(ListSituations().empty());
}

// The token file is created once with 0600 and 64 hexadecimal digits, then reused; a bearer
// header must match it exactly.
TEST(ApiTokenTest, CreatedOnceAndChecked) {
  q7test::ScratchDir dir;
  const std::string path = dir.file("q7_api_token");
  std::string token;
  std::string again;
  std::string error;
  ASSERT_EQ(kOk, LoadOrCreateApiToken(path, &token, &error)) << error;
  EXPECT_EQ(64u, token.size());
  EXPECT_EQ(std::string::npos, token.find_first_not_of("0123456789abcdef"));
  struct stat st {};
  ASSERT_EQ(0, ::stat(path.c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);
  ASSERT_EQ(kOk, LoadOrCreateApiToken(path, &again, &error));
  EXPECT_EQ(token, again);

  EXPECT_TRUE(BearerMatches("Bearer " + token, token));
  EXPECT_FALSE(BearerMatches("Bearer " + token + "x", token));
  EXPECT_FALSE(BearerMatches("bearer " + token, token));
  EXPECT_FALSE(BearerMatches("", token));
  EXPECT_FALSE(BearerMatches("Bearer ", ""));

  EXPECT_TRUE(IsLoopbackHost("127.0.0.1"));
  EXPECT_TRUE(IsLoopbackHost("[::1]"));
  EXPECT_TRUE(IsLoopbackHost("localhost"));
  EXPECT_FALSE(IsLoopbackHost("0.0.0.0"));
  EXPECT_FALSE(IsLoopbackHost("10.0.0.1"));

  std::ofstream(dir.file("empty")) << "  \n";
  EXPECT_EQ(kIoError, LoadOrCreateApiToken(dir.file("empty"), &token, &error));
}

}  // namespace
}  // namespace fw
