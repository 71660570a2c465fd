// AlertBook: raising after "for" consecutive matches, clearing, forgetting a situation, the
// ring of recent changes, and the state surviving a restart (or being set aside when torn).

#include "framework/alert_book.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "framework/status.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

using Json = nlohmann::ordered_json;

constexpr time_t kStart = 1700000000;  // 2023-11-14T22:13:20Z

class AlertBookTest : public ::testing::Test {
 protected:
  AlertBookTest() : file_(dir_.file("q7_alerts.json")) { Restart(); }

  // A new book on the same file, as after an agent restart; the Load status.
  int Restart(std::size_t capacity = kDefaultAlertCapacity) {
    book_ = std::make_unique<AlertBook>(file_, capacity);
    return book_->Load(&error_);
  }

  // One sample of situation "slow" (for_count matches to raise) in which the applications
  // named matched, at kStart + 60 * sample. Its changes as "raised Shop" / "cleared Shop".
  std::vector<std::string> Sample(int sample, const std::vector<std::string>& apps,
                                  int for_count = 3, const std::string& situation = "slow") {
    std::vector<MatchedRow> rows;
    for (const std::string& app : apps) {
      rows.push_back({{{"applicatin", app}}, {{"applicatin", app}, {"sample", sample}}});
    }
    last_ =
        book_->Evaluate(situation, "Q7APPSM", "critical", for_count, rows, kStart + 60 * sample);
    std::vector<std::string> changes;
    for (const AlertChange& change : last_) {
      changes.push_back(std::string(AlertKindName(change.kind)) + " " +
                        change.key["applicatin"].get<std::string>());
    }
    return changes;
  }

  ino_t FileInode() const {
    struct stat st {};
    return ::stat(file_.c_str(), &st) == 0 ? st.st_ino : 0;
  }

  q7test::ScratchDir dir_;
  std::string file_;
  std::string error_;
  std::unique_ptr<AlertBook> book_;
  std::vector<AlertChange> last_;  // the changes of the last Sample
};

using Changes = std::vector<std::string>;

// With for=3 the third consecutive match raises; a sample without the key starts the count over.
TEST_F(AlertBookTest, RaisesOnTheThirdConsecutiveMatchAndAGapResets) {
  EXPECT_EQ(Changes{}, Sample(1, {"Shop"}));
  EXPECT_EQ(Changes{}, Sample(2, {"Shop"}));
  EXPECT_EQ(Changes{}, Sample(3, {}));
  EXPECT_EQ(Changes{}, Sample(4, {"Shop"}));
  EXPECT_EQ(Changes{}, Sample(5, {"Shop"}));
  EXPECT_EQ(Changes{"raised Shop"}, Sample(6, {"Shop"}));
  EXPECT_EQ(kStart + 360, last_.at(0).raised_at);
  EXPECT_EQ(6, last_.at(0).values["sample"]);
}

// An open alert is not raised again while its key keeps matching, and clears once, with the
// last values seen, when it stops.
TEST_F(AlertBookTest, RaisesOnceWhileMatchingAndClearsOnceWhenItStops) {
  EXPECT_EQ(Changes{"raised Shop"}, Sample(1, {"Shop"}, 1));
  EXPECT_EQ(Changes{}, Sample(2, {"Shop"}, 1));
  EXPECT_EQ(Changes{}, Sample(3, {"Shop"}, 1));
  EXPECT_EQ(1u, book_->Open().size());
  EXPECT_EQ(3, book_->Open()[0]["values"]["sample"]);
  EXPECT_EQ(Changes{"cleared Shop"}, Sample(4, {}, 1));
  EXPECT_EQ(kStart + 60, last_.at(0).raised_at);
  EXPECT_EQ(kStart + 240, last_.at(0).at);
  EXPECT_EQ(3, last_.at(0).values["sample"]);
  EXPECT_EQ(Changes{}, Sample(5, {}, 1));
  EXPECT_TRUE(book_->Open().empty());
}

// Keys, and situations, count apart; several rows of one key in a sample count once.
TEST_F(AlertBookTest, KeysCountApartAndDuplicateRowsCountOnce) {
  EXPECT_EQ(Changes{}, Sample(1, {"Shop", "Shop", "Shop", "Bank"}, 2));
  EXPECT_EQ(Changes{}, Sample(1, {"Shop"}, 2, "other"));
  EXPECT_EQ(Changes{"raised Shop"}, Sample(2, {"Shop"}, 2));
  EXPECT_EQ(Changes{}, Sample(3, {"Shop", "Bank"}, 2));
  EXPECT_EQ(Changes{"raised Bank"}, Sample(4, {"Shop", "Bank"}, 2));
  EXPECT_EQ(Changes{"cleared Shop"}, Sample(5, {"Bank"}, 2));
  EXPECT_EQ(Changes{"raised Shop"}, Sample(6, {"Shop"}, 2, "other"));
  const Json open = book_->Open();
  ASSERT_EQ(2u, open.size());
  EXPECT_EQ("Bank", open[0]["key"]["applicatin"]);  // oldest raise first
  EXPECT_EQ("other", open[1]["situation"]);
}

// Stopping a situation clears its open alerts and drops the counts of its other keys.
TEST_F(AlertBookTest, ForgetSituationClearsOpenAlertsAndDropsCounts) {
  Sample(1, {"Shop"}, 2);
  EXPECT_EQ(Changes{"raised Shop"}, Sample(2, {"Shop", "Bank"}, 2));
  const std::vector<AlertChange> cleared = book_->ForgetSituation("slow", kStart + 500);
  ASSERT_EQ(1u, cleared.size());
  EXPECT_EQ(AlertKind::kCleared, cleared[0].kind);
  EXPECT_EQ(kStart + 500, cleared[0].at);
  EXPECT_TRUE(book_->Situations().empty());
  EXPECT_EQ(Changes{}, Sample(3, {"Bank"}, 2));  // Bank counts from 1 again
  EXPECT_TRUE(book_->ForgetSituation("never", kStart).empty());
}

// The JSON of a change is the webhook body, fields in this order.
TEST_F(AlertBookTest, ChangeJsonIsTheWebhookBody) {
  Sample(0, {"Shop"}, 1);
  const Json body = last_.at(0).ToJson();
  EXPECT_EQ(
      R"({"sequence":1,"kind":"raised","situation":"slow","table":"Q7APPSM","severity":"critical",)"
      R"("key":{"applicatin":"Shop"},"values":{"applicatin":"Shop","sample":0},)"
      R"("raised_at":"2023-11-14T22:13:20Z","raised_at_epoch":1700000000,)"
      R"("at":"2023-11-14T22:13:20Z","at_epoch":1700000000})",
      body.dump());
}

// The ring keeps the last changes only; Changes gives what follows a sequence, and all of them
// to a reader whose sequence is ahead of the book's (the book started over).
TEST_F(AlertBookTest, RecentRingIsCappedAtCapacity) {
  Restart(3);
  for (int sample = 1; sample <= 5; ++sample) {
    Sample(sample, sample % 2 == 1 ? std::vector<std::string>{"Shop"} : std::vector<std::string>{},
           1);
  }
  auto sequences = [](const Json& items) {
    std::vector<int> out;
    for (const Json& item : items) {
      out.push_back(item["sequence"]);
    }
    return out;
  };
  EXPECT_EQ((std::vector<int>{3, 4, 5}), sequences(book_->Recent(10)));
  EXPECT_EQ((std::vector<int>{4, 5}), sequences(book_->Recent(2)));
  EXPECT_EQ((std::vector<int>{5}), sequences(book_->Changes(4)));
  EXPECT_EQ((std::vector<int>{}), sequences(book_->Changes(5)));
  EXPECT_EQ((std::vector<int>{3, 4, 5}), sequences(book_->Changes(99)));
  ASSERT_EQ(kOk, Restart(2));
  EXPECT_EQ((std::vector<int>{4, 5}), sequences(book_->Recent(10)));
}

// After a restart an open alert stays open, is not raised again while its key matches, and
// clears when it stops; sequences go on from where they were.
TEST_F(AlertBookTest, RestartKeepsOpenAlertsOpen) {
  EXPECT_EQ(Changes{"raised Shop"}, Sample(1, {"Shop"}, 1));
  ASSERT_EQ(kOk, Restart());
  EXPECT_EQ(1u, book_->Open().size());
  EXPECT_EQ(1u, book_->last_sequence());
  EXPECT_EQ(1u, book_->Recent(10).size());
  EXPECT_EQ(Changes{}, Sample(2, {"Shop"}, 1));
  ASSERT_EQ(kOk, Restart());
  EXPECT_EQ(Changes{"cleared Shop"}, Sample(3, {}, 1));
  EXPECT_EQ(2u, last_.at(0).sequence);
  EXPECT_EQ(kStart + 60, last_.at(0).raised_at);
  EXPECT_EQ("critical", last_.at(0).severity);
  ASSERT_EQ(kOk, Restart());
  EXPECT_TRUE(book_->Open().empty());
  EXPECT_EQ(Changes{"raised Shop"}, Sample(4, {"Shop"}, 1));
  EXPECT_EQ(3u, last_.at(0).sequence);
}

// A count of matches survives a restart: the streak neither starts over nor raises twice.
TEST_F(AlertBookTest, RestartMidStreakContinuesTheStreak) {
  Sample(1, {"Shop"});
  Sample(2, {"Shop"});
  ASSERT_EQ(kOk, Restart());
  EXPECT_EQ(Changes{"raised Shop"}, Sample(3, {"Shop"}));
  ASSERT_EQ(kOk, Restart());
  EXPECT_EQ(Changes{}, Sample(4, {"Shop"}));
}

// Samples that change nothing write nothing; a change replaces the file.
TEST_F(AlertBookTest, SamplesThatChangeNothingDoNotWrite) {
  Sample(1, {"Shop"}, 1);
  const ino_t written = FileInode();
  ASSERT_NE(0u, written);
  Sample(2, {"Shop"}, 1);
  Sample(3, {"Shop"}, 1);
  EXPECT_EQ(written, FileInode());
  Sample(4, {}, 1);
  EXPECT_NE(written, FileInode());
}

TEST_F(AlertBookTest, MissingFileIsAFirstStart) {
  EXPECT_EQ(kOk, Restart());
  EXPECT_FALSE(std::filesystem::exists(file_));
  EXPECT_EQ(0u, book_->last_sequence());
}

// Garbage, a torn write and JSON of another shape are set aside; the book starts empty and
// writes a fresh file at its next change.
TEST_F(AlertBookTest, FileThatDoesNotLoadIsSetAside) {
  Sample(1, {"Shop"}, 1);
  const std::string whole = dir_.read("q7_alerts.json");
  for (const std::string& bad : {std::string("\x01garbage"), whole.substr(0, whole.size() / 2),
                                 std::string("[]"), std::string(R"({"format":"other"})")}) {
    SCOPED_TRACE(bad);
    dir_.write("q7_alerts.json", bad);
    TraceCapture trace("*=ERROR");
    EXPECT_EQ(kParseError, Restart());
    EXPECT_TRUE(trace.contains("set aside as " + file_ + ".bad"));
    EXPECT_EQ(bad, dir_.read("q7_alerts.json.bad"));
    EXPECT_FALSE(std::filesystem::exists(file_));
    EXPECT_TRUE(book_->Open().empty());
    EXPECT_TRUE(book_->Recent(10).empty());
  }
  EXPECT_EQ(Changes{"raised Shop"}, Sample(2, {"Shop"}, 1));
  EXPECT_EQ(kOk, Restart());
  EXPECT_EQ(1u, book_->Open().size());
}

}  // namespace
}  // namespace fw
