// The follower across partial and long lines, rotation, truncation and restarts. Every test
// drives it with explicit Poll() calls, so nothing waits.

#include "collector/accesslog/log_follower.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "collector/accesslog/commit_points.h"
#include "tests/support/scratch_dir.h"

namespace accesslog {
namespace {

using Lines = std::vector<std::string>;

class LogFollowerTest : public ::testing::Test {
 protected:
  std::string Log() const { return dir_.file("access.log"); }
  std::string State() const { return dir_.file("access.state"); }
  static void Append(const std::string& path, const std::string& bytes) {
    std::ofstream(path, std::ios::binary | std::ios::app) << bytes;
  }
  FollowOptions Options(bool from_start = true) const {
    FollowOptions options;
    options.state_path = State();
    options.from_start = from_start;
    return options;
  }
  static FollowOptions OneShot() {
    FollowOptions options;
    options.one_shot = true;
    return options;
  }
  std::unique_ptr<LogFollower> Start(const FollowOptions& options) {
    auto follower = std::make_unique<LogFollower>(Log(), options);
    std::string error;
    EXPECT_TRUE(follower->Start(&error)) << error;
    return follower;
  }
  static Lines Poll(LogFollower* follower) {
    Lines lines;
    std::string error;
    EXPECT_TRUE(follower->Poll([&](std::string_view line) { lines.emplace_back(line); }, &error))
        << error;
    return lines;
  }
  static void Commit(LogFollower* follower) {
    std::string error;
    EXPECT_TRUE(follower->Commit(&error)) << error;
  }

  q7test::ScratchDir dir_;
};

// ---- Lines

// A line is handed over only once its '\n' arrives.
TEST_F(LogFollowerTest, PartialLineWaitsForItsEnd) {
  Append(Log(), "a\nb");
  auto follower = Start(Options());
  EXPECT_EQ(Poll(follower.get()), Lines({"a"}));
  EXPECT_EQ(Poll(follower.get()), Lines());
  Append(Log(), "c\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"bc"}));
}

// A small poll budget cuts reads anywhere; lines still come out whole and in order.
TEST_F(LogFollowerTest, SmallPollBudgetKeepsLinesWhole) {
  Append(Log(), "first\nsecond\nthird\n");
  FollowOptions options = Options();
  options.max_poll_bytes = 4;
  auto follower = Start(options);
  Lines all;
  for (int i = 0; i < 10; ++i) {
    for (const auto& line : Poll(follower.get())) {
      all.push_back(line);
    }
  }
  EXPECT_EQ(all, Lines({"first", "second", "third"}));
  EXPECT_TRUE(follower->caught_up());
}

// Without a saved position an existing file is followed from the start of its last line;
// from_start reads all of it.
TEST_F(LogFollowerTest, FirstStartBeginsAtTheLastLineUnlessFromStart) {
  Append(Log(), "old1\nold2\npart");
  auto at_end = Start(Options(/*from_start=*/false));
  FollowOptions stateless;
  stateless.from_start = true;
  auto from_start = Start(stateless);
  Append(Log(), "ial\n");
  EXPECT_EQ(Poll(at_end.get()), Lines({"partial"}));
  EXPECT_EQ(Poll(from_start.get()), Lines({"old1", "old2", "partial"}));
}

// A log that does not exist yet is waited for, then read from 0.
TEST_F(LogFollowerTest, MissingFileIsReadWhenItAppears) {
  auto follower = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(follower.get()), Lines());
  Append(Log(), "a\nb\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"a", "b"}));
}

// A line over the cap is dropped as it streams in, counted, and the next line is intact.
TEST_F(LogFollowerTest, OverlongLineIsSkippedAndCounted) {
  FollowOptions options = Options();
  options.max_line_bytes = 8;
  Append(Log(), "12345678\n" + std::string(6, 'x'));
  auto follower = Start(options);
  EXPECT_EQ(Poll(follower.get()), Lines({"12345678"}));
  Append(Log(), std::string(20, 'y'));
  EXPECT_EQ(Poll(follower.get()), Lines());
  Append(Log(), "zz\nnext\n123456789\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"next"}));
  EXPECT_EQ(follower->stats().long_lines, 2u);
}

// --read: the whole file from 0, its unterminated last line included; a missing file fails.
TEST_F(LogFollowerTest, OneShotReadsToTheEnd) {
  Append(Log(), "a\nb\nlast");
  LogFollower follower(Log(), OneShot());
  std::string error;
  ASSERT_TRUE(follower.Start(&error)) << error;
  EXPECT_EQ(Poll(&follower), Lines({"a", "b", "last"}));
  EXPECT_TRUE(follower.at_end());
  EXPECT_EQ(follower.stats().unterminated_lines, 1u);

  LogFollower missing(dir_.file("none.log"), OneShot());
  EXPECT_FALSE(missing.Start(&error));
  EXPECT_NE(error.find("none.log"), std::string::npos) << error;
}

// ---- Rotation and truncation

// The renamed file is read to its end, lines written after the rename included, before the
// new file is read from 0.
TEST_F(LogFollowerTest, RenameRotationFinishesTheOldFileFirst) {
  Append(Log(), "1\n");
  auto follower = Start(Options());
  EXPECT_EQ(Poll(follower.get()), Lines({"1"}));
  std::filesystem::rename(Log(), Log() + ".1");
  Append(Log() + ".1", "2\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"2"}));  // nothing at the path yet
  // Cut short: the tail is handed over as it is when the file is left.
  Append(Log() + ".1", "3\ntail");
  Append(Log(), "4\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"3", "tail", "4"}));
  Append(Log(), "5\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"5"}));
  EXPECT_EQ(follower->stats().rotations, 1u);
}

// An empty new file takes over only after the old one stayed quiet for rotate_wait_polls.
TEST_F(LogFollowerTest, EmptyNewFileTakesOverWhenTheOldOneGoesQuiet) {
  FollowOptions options = Options();
  options.rotate_wait_polls = 2;
  Append(Log(), "1\n");
  auto follower = Start(options);
  Poll(follower.get());
  std::filesystem::rename(Log(), Log() + ".1");
  Append(Log(), "");
  EXPECT_EQ(Poll(follower.get()), Lines());
  Append(Log() + ".1", "late\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"late"}));
  EXPECT_EQ(Poll(follower.get()), Lines());
  EXPECT_EQ(follower->stats().rotations, 0u);
  EXPECT_EQ(Poll(follower.get()), Lines());
  EXPECT_EQ(follower->stats().rotations, 1u);
  Append(Log(), "new\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"new"}));
}

// copytruncate: the file shrinks under the position; reading starts again at 0.
TEST_F(LogFollowerTest, CopytruncateStartsAgainAtZero) {
  Append(Log(), "aaa\nbbb\n");
  auto follower = Start(Options());
  Poll(follower.get());
  ASSERT_EQ(::truncate(Log().c_str(), 0), 0);
  Append(Log(), "c\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"c"}));
  EXPECT_EQ(follower->stats().truncations, 1u);
}

// Truncated and written past the old position between two polls: only the head tells.
TEST_F(LogFollowerTest, RewriteInPlacePastThePositionIsNoticedByTheHead) {
  Append(Log(), "first line\n");
  auto follower = Start(Options());
  Poll(follower.get());
  std::ofstream(Log(), std::ios::binary | std::ios::trunc) << "other line\nanother\n";
  EXPECT_EQ(Poll(follower.get()), Lines({"other line", "another"}));
  EXPECT_EQ(follower->stats().truncations, 1u);
}

// ---- Restarts and the state file

// Lines up to the last Commit are not repeated; lines handed over after it come again.
TEST_F(LogFollowerTest, RestartResumesAfterTheLastCommittedLine) {
  Append(Log(), "1\n2\n");
  auto first = Start(Options());
  EXPECT_EQ(Poll(first.get()), Lines({"1", "2"}));
  Commit(first.get());
  Append(Log(), "3\n4");
  EXPECT_EQ(Poll(first.get()), Lines({"3"}));
  first.reset();  // stopped before committing "3"

  auto second = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(second.get()), Lines({"3"}));
  Commit(second.get());
  second.reset();
  Append(Log(), "\n5\n");  // grew while stopped

  auto third = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(third.get()), Lines({"4", "5"}));
}

// Saving while lines are still held: the position after the last line whose record is out,
// even when the log was rotated since. A crash then repeats the held lines, skips none.
TEST_F(LogFollowerTest, CommitPointBeforeHeldLinesSurvivesRotation) {
  Append(Log(), "1\n2\n");
  auto first = Start(Options());
  CommitPoints points;
  uint64_t lines = 0;
  const auto poll = [&] {
    const Lines got = Poll(first.get());
    lines += got.size();
    points.Reached(lines, first->position());
    return got;
  };
  poll();
  Append(Log(), "3\n");
  poll();
  std::filesystem::rename(Log(), Log() + ".1");
  Append(Log(), "4\n");
  EXPECT_EQ(poll(), Lines({"4"}));
  EXPECT_EQ(points.size(), 3u);

  EXPECT_FALSE(points.TakeSafe(1).has_value());                 // line 1 held: nothing is safe
  const std::optional<FilePosition> safe = points.TakeSafe(3);  // lines 1-2 out, 3 held
  ASSERT_TRUE(safe.has_value());
  EXPECT_EQ(safe->offset, 4u);
  std::string error;
  ASSERT_TRUE(first->CommitAt(*safe, &error)) << error;
  first.reset();  // a crash: lines 3 and 4 never reached the output

  auto second = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(second.get()), Lines({"3", "4"}));
  // Once nothing is held, the latest point is the one to save.
  CommitPoints more;
  more.Reached(1, second->position());
  EXPECT_EQ(more.TakeSafe(UINT64_MAX), second->position());
  EXPECT_EQ(more.size(), 0u);
}

// Rotated while stopped: the rest of ".1" from the saved offset, then the new file.
TEST_F(LogFollowerTest, RotationWhileStoppedFinishesTheRotatedFile) {
  Append(Log(), "1\n");
  auto first = Start(Options());
  Poll(first.get());
  Commit(first.get());
  first.reset();
  Append(Log(), "2\n");
  std::filesystem::rename(Log(), Log() + ".1");
  Append(Log(), "3\n");

  auto second = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(second.get()), Lines({"2", "3"}));
  EXPECT_EQ(second->stats().rotations, 1u);
}

// The same from a position saved before the file held anything.
TEST_F(LogFollowerTest, RotationWhileStoppedFromAnEmptyFile) {
  Append(Log(), "");
  auto first = Start(Options());
  Commit(first.get());
  first.reset();
  Append(Log(), "1\n");
  std::filesystem::rename(Log(), Log() + ".1");
  Append(Log(), "2\n");

  auto second = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(second.get()), Lines({"1", "2"}));
}

// A new file at the path, perhaps with the old inode number, is read from 0 after a restart.
TEST_F(LogFollowerTest, FileReplacedWhileStoppedIsReadFromZero) {
  Append(Log(), "old line one\nold line two\n");
  auto first = Start(Options());
  Poll(first.get());
  Commit(first.get());
  first.reset();
  std::filesystem::remove(Log());
  Append(Log(), "new line one\nnew line two\nnew line three\n");

  auto second = Start(Options(/*from_start=*/false));
  EXPECT_EQ(Poll(second.get()), Lines({"new line one", "new line two", "new line three"}));
}

// The state file is private and leaves no temporary behind.
TEST_F(LogFollowerTest, StateFileIsPrivateAndComplete) {
  Append(Log(), "1\n");
  auto follower = Start(Options());
  Poll(follower.get());
  Commit(follower.get());
  struct stat st {};
  ASSERT_EQ(::stat(State().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_FALSE(std::filesystem::exists(State() + ".tmp"));
  FollowState state;
  std::string error;
  ASSERT_TRUE(ParseFollowState(dir_.read("access.state"), &state, &error)) << error;
  EXPECT_EQ(state.log_path, Log());
  EXPECT_EQ(state.position, follower->position());
  EXPECT_EQ(state.position.offset, 2u);
}

// A state file that does not parse is set aside and reported; the start goes on.
TEST_F(LogFollowerTest, BrokenStateFileIsSetAside) {
  Append(Log(), "old\n");
  dir_.write("access.state", "q7-follow-state 1\noffset 12\n");
  auto follower = Start(Options(/*from_start=*/false));
  EXPECT_EQ(follower->stats().state_set_aside, 1u);
  EXPECT_TRUE(std::filesystem::exists(State() + ".bad"));
  EXPECT_FALSE(follower->TakeNotes().empty());
  Append(Log(), "new\n");
  EXPECT_EQ(Poll(follower.get()), Lines({"new"}));
}

TEST(FollowStateTest, ParserRejectsAnythingButACompleteState) {
  const FollowState good{"/var/log/x.log", {1, 2, 100, 64, 0xabcdefull}};
  const std::string text = FormatFollowState(good);
  FollowState parsed;
  std::string error;
  ASSERT_TRUE(ParseFollowState(text, &parsed, &error)) << error;
  EXPECT_EQ(parsed.position, good.position);

  for (const std::string& bad : {
           std::string(),                          // empty
           text.substr(0, text.size() - 1),        // no line end
           "q7-follow-state 2" + text.substr(17),  // other version
           text + "dev 1\n",                       // repeated key
           text + "extra 1\n",                     // unknown key
           text.substr(0, text.find("head")),      // missing key
       }) {
    EXPECT_FALSE(ParseFollowState(bad, &parsed, &error)) << bad;
  }
  FollowState wide = good;
  wide.position.offset = 10;  // the head cannot cover more than was consumed
  EXPECT_FALSE(ParseFollowState(FormatFollowState(wide), &parsed, &error));
}

}  // namespace
}  // namespace accesslog
