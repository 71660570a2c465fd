// The data file monitor: when a grown file is read, chunking across records, the rename
// handling, the outlier test and the stop at an analyzer shutdown.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "core/analyzer/intake/dpx_data_file_monitor.h"
#include "core/analyzer/intake/intake_fixture.h"
#include "core/analyzer/intake/sm3_framing.h"

namespace q7test {
namespace {

using Strings = std::vector<std::string>;

class DataFileMonitorTest : public IntakeFixture {
 protected:
  // A static monitor over path from offset into the test's queue; returns it stopped.
  std::unique_ptr<CDPXDataFileMonitor> finish(const std::string& path, long long offset = 0,
                                              int outlierMillis = -1) {
    return CDPXDataFileMonitor::processStatically(path.c_str(), offset, outlierMillis,
                                                  analyzer_.get());
  }
};

// A file counts as grown only once it passes the read-to offset by two bytes, so a record's
// first byte alone never triggers a read.
TEST_F(DataFileMonitorTest, OneByteGrowthWaitsForTheNext) {
  const std::string path = dataFile("a.sm3");
  append(path, page("/one"));
  CDPXDataFileMonitor monitor(path.c_str(), sizeOf(path));
  EXPECT_FALSE(monitor.anyUpdates());
  append(path, "<");
  EXPECT_FALSE(monitor.anyUpdates());
  append(path, "h");
  EXPECT_TRUE(monitor.anyUpdates());

  CDPXDataFileMonitor missing(dataFile("none.sm3").c_str(), 0);
  EXPECT_FALSE(missing.anyUpdates());
  monitor.Start();
  monitor.Shutdown();
  monitor.Join();
  missing.Start();
  missing.Shutdown();
  missing.Join();
}

// A read takes at most 32768 bytes from the last processed offset and moves the read-to offset
// to the chunk's end; a file shorter than the offset gives nothing.
TEST_F(DataFileMonitorTest, ReadsOneBoundedChunk) {
  const std::string path = dataFile("a.sm3");
  append(path, std::string(40000, 'x'));
  CDPXDataFileMonitor monitor(path.c_str(), 100);
  long length = 0;
  long long end = 0;
  std::unique_ptr<char[]> chunk = monitor.getNewFileContents(&length, &end);
  ASSERT_TRUE(chunk);
  EXPECT_EQ(MAX_BUFFER, length);
  EXPECT_EQ(100 + MAX_BUFFER, end);
  EXPECT_EQ('\0', chunk[length]);
  EXPECT_EQ(100, monitor.getLastProcessedOffset());  // only consuming moves it

  monitor.setLastProcessedOffset(39990);
  chunk = monitor.getNewFileContents(&length, &end);
  ASSERT_TRUE(chunk);
  EXPECT_EQ(10, length);
  EXPECT_EQ(40000, end);

  monitor.setLastProcessedOffset(50000);
  EXPECT_FALSE(monitor.getNewFileContents(&length, &end));
  monitor.Start();
  monitor.Shutdown();
  monitor.Join();
}

// Records that straddle chunk boundaries are read again whole on the next pass: every record of
// a file several chunks long arrives exactly once, in order, and the offset ends at the end.
TEST_F(DataFileMonitorTest, RecordsAcrossChunkBoundariesArriveOnce) {
  const std::string path = dataFile("a.sm3");
  Strings expected;
  std::string bytes;
  for (int i = 0; static_cast<long>(bytes.size()) < 3 * MAX_BUFFER + 5000; ++i) {
    expected.push_back("/page/" + std::to_string(i) + std::string(i % 97, 'p'));
    bytes += page(expected.back());
  }
  append(path, bytes);
  const auto monitor = finish(path);
  EXPECT_TRUE(monitor->isCompleted());
  EXPECT_EQ(static_cast<long long>(bytes.size()), monitor->getLastProcessedOffset());
  EXPECT_EQ(expected, urls(expected.size()));
}

// An unfinished record at the end stays unconsumed; once the collector completes it, it is read
// whole from its start.
TEST_F(DataFileMonitorTest, UnfinishedTailIsReadOnceComplete) {
  const std::string path = dataFile("a.sm3");
  const std::string second = page("/two");
  append(path, page("/one") + second.substr(0, 30));
  auto monitor = finish(path);
  const long long stopped = monitor->getLastProcessedOffset();
  EXPECT_EQ(sizeOf(path) - 30, stopped);
  EXPECT_EQ(Strings{"/one"}, urls(1));

  append(path, second.substr(30));
  monitor = finish(path, stopped);
  EXPECT_EQ(sizeOf(path), monitor->getLastProcessedOffset());
  EXPECT_EQ(Strings{"/two"}, urls(1));
}

// The outlier limit: -1 passes everything, 5000 rejects exactly 5000 ms, 0 rejects everything;
// the monitor drops what fails.
TEST_F(DataFileMonitorTest, OutlierLimit) {
  const std::string path = dataFile("a.sm3");
  append(path, page("/fast", 4999) + page("/limit", 5000) + page("/slow", 90000));
  finish(path, 0, -1);
  EXPECT_EQ((Strings{"/fast", "/limit", "/slow"}), urls(3));
  const auto monitor = finish(path, 0, 5000);
  EXPECT_EQ(Strings{"/fast"}, urls(1));
  EXPECT_EQ(sizeOf(path), monitor->getLastProcessedOffset());  // dropped records are consumed
  finish(path, 0, 0);
  EXPECT_TRUE(urls(0).empty());
}

// A collector renamed the file to a-0001.sm3 after writing two more records and started a new,
// shorter a.sm3: the live monitor finishes the renamed file from its offset, then reads the new
// file from 0.
TEST_F(DataFileMonitorTest, RenamedFileIsFinishedThenLiveNameRestarts) {
  const std::string live = dataFile("a.sm3");
  append(live, page("/old/1") + page("/old/2") + page("/old/3"));
  const long long readSoFar = sizeOf(live);
  append(live, page("/old/4") + page("/old/5"));
  std::filesystem::rename(live, dataFile("a-0001.sm3"));
  append(dataFile("a-0000.sm3"), page("/older"));  // an earlier rename: not the greatest name
  append(live, page("/new/1"));

  CDPXDataFileMonitor monitor(live.c_str(), readSoFar);
  monitor.setSink(analyzer_.get());
  monitor.Start();
  EXPECT_EQ((Strings{"/old/4", "/old/5", "/new/1"}), urls(3));
  monitor.Shutdown();
  monitor.Join();
  EXPECT_EQ(sizeOf(live), monitor.getLastProcessedOffset());

  // Each file's records are followed by a mark of where they end, naming the file as it was
  // read and by its identity, which the rename kept.
  const auto inode = [](const std::string& path) {
    struct stat st {};
    EXPECT_EQ(0, ::stat(path.c_str(), &st));
    return static_cast<uint64_t>(st.st_ino);
  };
  ASSERT_EQ(2u, analyzer_->marks.size());
  const auto& [renamedAfter, renamed] = analyzer_->marks[0];
  EXPECT_EQ(2u, renamedAfter);
  EXPECT_EQ(dataFile("a-0001.sm3"), renamed.file);
  EXPECT_EQ(inode(dataFile("a-0001.sm3")), renamed.inode);
  EXPECT_EQ(sizeOf(dataFile("a-0001.sm3")), renamed.offset);
  const auto& [liveAfter, restarted] = analyzer_->marks[1];
  EXPECT_EQ(3u, liveAfter);
  EXPECT_EQ(live, restarted.file);
  EXPECT_EQ(inode(live), restarted.inode);
  EXPECT_EQ(sizeOf(live), restarted.offset);

  // A checkpoint's position is found again under the file's new name; a name now holding
  // another file, with the old one gone, starts over; an unknown identity is taken as it is.
  ReadPosition before{live, renamed.device, inode(live), 40};
  std::filesystem::rename(live, dataFile("a-0002.sm3"));
  append(live, page("/newer"));
  const ReadPosition found = LocateReadPosition(before, data().c_str());
  EXPECT_EQ(dataFile("a-0002.sm3"), found.file);
  EXPECT_EQ(40, found.offset);
  std::filesystem::remove(dataFile("a-0002.sm3"));
  EXPECT_EQ(0, LocateReadPosition(before, data().c_str()).offset);
  EXPECT_EQ(live, LocateReadPosition(before, data().c_str()).file);
  before.device = before.inode = 0;
  EXPECT_EQ(40, LocateReadPosition(before, data().c_str()).offset);
}

// A checkpoint's offset belongs to the file it names by identity: renamed twice over and
// replaced by a file already longer than the offset, the old file's tail, the file renamed
// after it and the new live file are each read once.
TEST_F(DataFileMonitorTest, RenameCaughtByIdentityWhenTheNewFileIsLonger) {
  const std::string live = dataFile("a.sm3");
  append(live, page("/old/1") + page("/old/2"));
  const long long offset = sizeOf(live);
  append(live, page("/old/3"));
  struct stat st {};
  ASSERT_EQ(0, ::stat(live.c_str(), &st));
  std::filesystem::rename(live, dataFile("a-0001.sm3"));
  append(live, page("/between/1"));
  std::filesystem::rename(live, dataFile("a-0002.sm3"));
  std::string longer;
  for (int i = 0; i < 5; ++i) {
    longer += page("/new/" + std::to_string(i));
  }
  append(live, longer);
  ASSERT_GT(sizeOf(live), offset);

  CDPXDataFileMonitor monitor(live.c_str(), offset);
  monitor.setReadIdentity(static_cast<uint64_t>(st.st_dev), static_cast<uint64_t>(st.st_ino));
  monitor.setSink(analyzer_.get());
  monitor.Start();
  EXPECT_EQ((Strings{"/old/3", "/between/1", "/new/0", "/new/1", "/new/2", "/new/3", "/new/4"}),
            urls(7));
  monitor.Shutdown();
  monitor.Join();
  EXPECT_TRUE(urls(1, std::chrono::milliseconds(300)).empty());
}

// A truncated file with no renamed file beside it is read again from 0.
TEST_F(DataFileMonitorTest, TruncatedFileRestartsAtZero) {
  const std::string live = dataFile("a.sm3");
  append(live, page("/first/1") + page("/first/2"));
  CDPXDataFileMonitor monitor(live.c_str(), 0);
  monitor.setSink(analyzer_.get());
  monitor.Start();
  EXPECT_EQ((Strings{"/first/1", "/first/2"}), urls(2));
  std::ofstream(live, std::ios::binary | std::ios::trunc) << page("/again");
  EXPECT_EQ(Strings{"/again"}, urls(1));
  monitor.Shutdown();
  monitor.Join();
  EXPECT_EQ(sizeOf(live), monitor.getLastProcessedOffset());
}

// The renamed-file lookup takes the greatest name with the live name's prefix and a '-'.
TEST_F(DataFileMonitorTest, NewLegacyFilename) {
  for (const char* name : {"a.sm3", "a-1.sm3", "a-2.sm3", "b-9.sm3", "a-3.txt"}) {
    append(dataFile(name), "x");
  }
  char found[4097] = {};
  ASSERT_TRUE(
      CDPXDataFileMonitor::getNewLegacyFilename(dataFile("a.sm3").c_str(), found, sizeof(found)));
  EXPECT_EQ(dataFile("a-2.sm3"), found);
  EXPECT_FALSE(
      CDPXDataFileMonitor::getNewLegacyFilename(dataFile("c.sm3").c_str(), found, sizeof(found)));
}

// A '.' in the directory cuts the prefix there, so any renamed file of the directory matches.
TEST_F(DataFileMonitorTest, DotInDirectoryCutsThePrefix) {
  const std::string dotted = dir_.file("v1.2");
  std::filesystem::create_directories(dotted);
  CConfig::setDpxDataDirectory(dotted.c_str());
  append(dotted + "/a.sm3", "x");
  append(dotted + "/zzz-1.sm3", "x");
  char found[4097] = {};
  ASSERT_TRUE(
      CDPXDataFileMonitor::getNewLegacyFilename((dotted + "/a.sm3").c_str(), found, sizeof(found)));
  EXPECT_EQ(dotted + "/zzz-1.sm3", found);
}

// Once the analyzer is shutting down, records are refused and not consumed: the offset stays at
// the first refused record so that the next start reads it.
TEST_F(DataFileMonitorTest, StopsAtShutdownWithoutConsuming) {
  const std::string path = dataFile("a.sm3");
  append(path, page("/kept") + page("/later"));
  analyzer_->Shutdown();
  const auto monitor = finish(path);
  EXPECT_TRUE(monitor->wasInterrupted());
  EXPECT_EQ(0, monitor->getLastProcessedOffset());
  EXPECT_TRUE(urls(0).empty());
}

// Objects name the page before them; a page starts a new instance.
TEST_F(DataFileMonitorTest, ObjectsJoinThePageBeforeThem) {
  const std::string path = dataFile("a.sm3");
  append(path,
         page("/p1") + Record(2, PageLine({{23, "/p1.css"}})) + Record(3, AvLine()) + page("/p2"));
  finish(path);
  std::vector<std::unique_ptr<CDPXTransaction>> got = analyzer_->take();
  ASSERT_EQ(4u, got.size());
  EXPECT_EQ(1, got[0]->getRecordType());
  EXPECT_EQ(3, got[2]->getRecordType());
  EXPECT_STREQ(got[0]->getCurrentUUID(), got[1]->getParentUUID());
  EXPECT_STREQ(got[0]->getCurrentUUID(), got[2]->getRootUUID());
  EXPECT_EQ(got[0]->getInstanceRoot(), got[2]->getInstanceRoot());
  EXPECT_NE(got[0]->getInstanceRoot(), got[3]->getInstanceRoot());
}

}  // namespace
}  // namespace q7test
