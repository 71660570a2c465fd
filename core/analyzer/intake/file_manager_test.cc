// The file manager: the persist record, the first pass over files written while the agent was
// down, resuming where the last run stopped, and following a rollover to a newer file.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "core/analyzer/intake/dpx_file_manager.h"
#include "core/analyzer/intake/intake_fixture.h"
#include "framework/trace_capture.h"

namespace q7test {
namespace {

using Strings = std::vector<std::string>;

class FileManagerTest : public IntakeFixture {
 protected:
  std::string persistPath() const {
    return std::string(CConfig::getDpxOdiDataDirectory()) + "DPXLastFile";
  }

  // Waits a fiftieth of what it is asked: the manager's 5-second pause between passes takes
  // 100 ms.
  class FastClock : public fw::Clock {
   public:
    void sleep(unsigned long ms) const override { fw::Clock::sleep(ms / 50); }
  };

  std::unique_ptr<CDPXFileManager> startManager() {
    auto manager = std::make_unique<CDPXFileManager>();
    manager->setSink(analyzer_.get());
    manager->setClock(fastClock_);
    manager->Start();
    return manager;
  }

  // Writes a persist file saying reading stopped in file at offset.
  void persist(const std::string& file, long long offset) {
    CDPXFileManager writer;
    _LAST_FILE_INFO record;
    std::strncpy(record.fileName, file.c_str(), sizeof(record.fileName) - 1);
    record.setFullOffset(offset);
    ASSERT_TRUE(writer.persistLastProcessedFile(&record));
  }

  FastClock fastClock_;
};

// The persist record: 4348 bytes, type word 1, the name, the offset split in two words at 4104
// and 4112, a zero link word; created 0600; read back whole.
TEST_F(FileManagerTest, PersistRecordLayout) {
  const long long offset = (3LL << 32) + 0x12345;
  persist("/data/day1.sm3", offset);
  const std::string bytes = dir_.read("base/odi/dpx/DPXLastFile");
  ASSERT_EQ(4348u, bytes.size());
  auto word = [&](size_t at) {
    uint32_t w = 0;
    std::memcpy(&w, bytes.data() + at, 4);
    return w;
  };
  EXPECT_EQ(1u, word(0));
  EXPECT_EQ("/data/day1.sm3", std::string(bytes.data() + 4));
  EXPECT_EQ(std::string(4100 - 14, '\0'), bytes.substr(4 + 14, 4100 - 14));
  EXPECT_EQ(0x12345u, word(4104));
  EXPECT_EQ(0u, word(4108));
  EXPECT_EQ(3u, word(4112));
  EXPECT_EQ(std::string(228, '\0'), bytes.substr(4116, 228));
  EXPECT_EQ(0u, word(4344));
  struct stat st {};
  ASSERT_EQ(0, ::stat(persistPath().c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);

  CDPXFileManager reader;
  EXPECT_EQ("/data/day1.sm3", reader.getLastProcessedFileName());
  EXPECT_EQ(offset, reader.getLastProcessedOffset());
}

// A file of several records reads back last record first; a partial record is ignored; no file
// gives nothing.
TEST_F(FileManagerTest, ReadsEveryWholeRecordLastFirst) {
  CDPXFileManager manager;
  EXPECT_EQ(nullptr, manager.getLastProcessedFile());
  _LAST_FILE_INFO first;
  _LAST_FILE_INFO second;
  std::strcpy(first.fileName, "one.sm3");
  std::strcpy(second.fileName, "two.sm3");
  second.setFullOffset(7);
  first.next = &second;
  ASSERT_TRUE(manager.persistLastProcessedFile(&first));
  append(persistPath(), "partial");
  _LAST_FILE_INFO* list = manager.getLastProcessedFile();
  ASSERT_NE(nullptr, list);
  EXPECT_STREQ("two.sm3", list->fileName);
  EXPECT_EQ(7, list->fullOffset());
  ASSERT_NE(nullptr, list->next);
  EXPECT_STREQ("one.sm3", list->next->fileName);
  EXPECT_EQ(nullptr, list->next->next);
  freeLastProcessedFile(list);
}

// A record of another type, or a file too short for one, is set aside and named in the trace;
// the manager starts with no last processed file.
TEST_F(FileManagerTest, ForeignOrCutPersistFileIsSetAside) {
  {
    CDPXFileManager writer;
    _LAST_FILE_INFO record;
    std::strcpy(record.fileName, "one.sm3");
    ASSERT_TRUE(writer.persistLastProcessedFile(&record));
  }
  std::string bytes;
  {
    std::ifstream in(persistPath(), std::ios::binary);
    bytes.assign(std::istreambuf_iterator<char>(in), {});
  }
  std::string foreign = bytes;
  foreign[0] = 9;
  for (const std::string& damaged : {bytes.substr(0, 100), foreign}) {
    std::ofstream(persistPath(), std::ios::binary | std::ios::trunc) << damaged;
    fw::TraceCapture capture("*=ALL");
    CDPXFileManager manager;
    EXPECT_EQ("", manager.getLastProcessedFileName());
    EXPECT_TRUE(capture.contains("Last processed file record " + persistPath() + " does not load"));
    EXPECT_TRUE(capture.contains("Found NO last processed file info"));
    EXPECT_TRUE(std::filesystem::exists(persistPath() + ".bad"));
  }
}

// The persist path is the history directory and "DPXLastFile" glued together, if it fits.
TEST_F(FileManagerTest, PersistFileSpec) {
  CDPXFileManager manager;
  char buffer[4097];
  ASSERT_TRUE(manager.getPersistFileSpec(buffer, sizeof(buffer)));
  EXPECT_EQ(persistPath(), buffer);
  const int exact = static_cast<int>(std::strlen(CConfig::getDpxOdiDataDirectory())) + 12;
  EXPECT_TRUE(manager.getPersistFileSpec(buffer, exact));
  EXPECT_FALSE(manager.getPersistFileSpec(buffer, exact - 1));
}

// First start, no persist file, three files: the two older are read whole in file order, the
// newest is tailed from 0; at shutdown the persisted offset is where its monitor stopped.
TEST_F(FileManagerTest, FirstStartReadsOlderFilesThenTailsTheNewest) {
  append(dataFile("day1.sm3"), page("/live/1"));
  append(dataFile("day1-0002.sm3"), page("/renamed2/1") + page("/renamed2/2"));
  append(dataFile("day1-0001.sm3"), page("/renamed1/1"));
  auto manager = startManager();
  EXPECT_EQ((Strings{"/renamed1/1", "/renamed2/1", "/renamed2/2", "/live/1"}), urls(4));
  append(dataFile("day1.sm3"), page("/live/2"));
  EXPECT_EQ(Strings{"/live/2"}, urls(1));
  manager->Shutdown();
  EXPECT_TRUE(manager->isShutdownComplete());
  EXPECT_EQ(dataFile("day1.sm3"), manager->getLastProcessedFileName());
  EXPECT_EQ(sizeOf(dataFile("day1.sm3")), manager->getLastProcessedOffset());

  // The next run resumes there: only what was written while it was down arrives.
  append(dataFile("day1.sm3"), page("/while/down"));
  manager = startManager();
  EXPECT_EQ(Strings{"/while/down"}, urls(1));
  manager->Shutdown();
  EXPECT_TRUE(urls(0).empty());
}

// The outlier limit holds for the first pass as for the live file: with 30 s, the oldest file's
// record of 60 s is dropped, whichever files the first listing found.
TEST_F(FileManagerTest, FirstPassDropsOutliersToo) {
  CConfig::setExcludeOutlierSeconds(30);
  append(dataFile("day1-0001.sm3"), page("/old/slow", 60000) + page("/old/ok", 29000));
  append(dataFile("day1-0002.sm3"), page("/renamed"));
  append(dataFile("day1.sm3"), page("/live/slow", 60000) + page("/live/ok"));
  auto manager = startManager();
  EXPECT_EQ((Strings{"/old/ok", "/renamed", "/live/ok"}), urls(3));
  manager->Shutdown();
  EXPECT_TRUE(urls(0).empty());
}

// A restart with a saved file skips older files, finishes the saved one from its offset, reads
// newer ones whole and tails the newest from 0.
TEST_F(FileManagerTest, RestartResumesTheSavedFile) {
  append(dataFile("day0.sm3"), page("/day0"));
  append(dataFile("day1.sm3"), page("/day1/read"));
  const long long saved = sizeOf(dataFile("day1.sm3"));
  append(dataFile("day1.sm3"), page("/day1/unread"));
  append(dataFile("day2.sm3"), page("/day2"));
  append(dataFile("day3.sm3"), page("/day3"));
  persist(dataFile("day1.sm3"), saved);
  auto manager = startManager();
  EXPECT_EQ((Strings{"/day1/unread", "/day2", "/day3"}), urls(3));
  manager->Shutdown();
  EXPECT_EQ(dataFile("day3.sm3"), manager->getLastProcessedFileName());
}

// A newer file appearing while the manager runs is a rollover: the old monitor finishes its file
// (records written just before the switch included) and the new file is read from 0.
TEST_F(FileManagerTest, FollowsARolloverToANewerFile) {
  append(dataFile("day1.sm3"), page("/day1/1"));
  auto manager = startManager();
  EXPECT_EQ(Strings{"/day1/1"}, urls(1));
  append(dataFile("day1.sm3"), page("/day1/2"));
  append(dataFile("day2.sm3"), page("/day2/1"));
  // The manager looks for new files at its next pass.
  EXPECT_EQ((Strings{"/day1/2", "/day2/1"}), urls(2, std::chrono::seconds(8)));
  manager->Shutdown();
  EXPECT_EQ(dataFile("day2.sm3"), manager->getLastProcessedFileName());
}

// An empty directory: the manager idles and stops at once, persisting no file.
TEST_F(FileManagerTest, EmptyDirectoryStopsCleanly) {
  auto manager = startManager();
  manager->Shutdown();
  EXPECT_TRUE(manager->isShutdownComplete());
  CDPXFileManager reader;
  EXPECT_EQ("", reader.getLastProcessedFileName());
  EXPECT_EQ(0, reader.getLastProcessedOffset());
}

}  // namespace
}  // namespace q7test
