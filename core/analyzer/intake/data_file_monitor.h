#pragma once

// CDataFileMonitor: the generic tail of one data file. It knows where it is in the file and
// reads what was appended since, one chunk of at most MAX_BUFFER bytes at a time; subclasses
// (CDPXDataFileMonitor) supply the thread body that cuts chunks into records.
//
// Offsets:
// - last processed offset: bytes of the file fully consumed (the start of the first record not
//   yet taken); the next chunk is read from here.
// - read-to offset: the end of the last chunk read. A file counts as grown only when its size
//   passes read-to + 1, so an unfinished record at the end of a chunk is read again, from its
//   start, once the file has grown by at least two more bytes.
//
// The file is never held open: every chunk is one open, seek, read and close.
//
// Thread safety: the setters are for the owner before Start; the thread body owns the offsets
// afterwards. Shutdown and getLastProcessedOffset may be called from any thread (atomics); the
// owner takes the final offset after joining.

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "core/runtime/cvel_thread.h"

class CDataFileMonitor : public CvelThread {
 public:
  // A monitor of file (copied) at offset 0 with no outlier limit. name names the thread.
  CDataFileMonitor(const char* name, const char* file);
  ~CDataFileMonitor() override;

  // Asks the thread to end at its next turn; returns at once.
  virtual void Shutdown();
  // True when the file's size can be read and exceeds the read-to offset by more than 1.
  virtual bool anyUpdates();

  // Returns a new NUL-terminated buffer holding the file's bytes from the last processed offset
  // (at most MAX_BUFFER of them), with their count in *length and the offset just past them in
  // *newOffset; the read-to offset moves there. Null (traced) when the file cannot be examined,
  // opened or read, or is shorter than the last processed offset.
  std::unique_ptr<char[]> getNewFileContents(long* length, long long* newOffset);

  // Sets both the last processed and the read-to offset.
  void setLastProcessedOffset(long long offset);
  long long getLastProcessedOffset() const { return lastProcessedOffset.load(); }
  void setFile(const char* file) { this->file = file; }
  const char* getFile() const { return file.c_str(); }
  // The device and inode of the file the last chunk came from (0 before the first read): the
  // file itself, whatever it is called by the time a checkpoint is resumed. Thread body only.
  uint64_t getReadDevice() const { return readDevice; }
  uint64_t getReadInode() const { return readInode; }
  // Says which file the offset belongs to (a checkpoint's), so that a file renamed before the
  // first read is not read from that offset; 0, 0 forgets it (a new file). Owner before Start,
  // then the thread body.
  void setReadIdentity(uint64_t device, uint64_t inode) {
    readDevice = device;
    readInode = inode;
  }
  // True when the name now holds another file than the one read so far.
  bool identityChanged() const;
  void setExcludeOutlierMillis(int millis) { excludeOutlierMillis = millis; }
  int getExcludeOutlierMillis() const { return excludeOutlierMillis; }

 protected:
  bool isShutdownRequested() const { return shutdownRequested.load(); }
  long long getReadToOffset() const { return readToOffset.load(); }
  void advanceLastProcessedOffset(long consumed) { lastProcessedOffset += consumed; }

 private:
  void objectInit(const char* file);

  std::atomic<bool> shutdownRequested{false};  // set by Shutdown, read by the thread body
  std::string file;                            // the data file tailed; set before Start
  // Bytes of the file fully consumed. Written by the thread body (or the owner before Start),
  // read by the owner at any time.
  std::atomic<long long> lastProcessedOffset{0};
  std::atomic<long long> readToOffset{0};  // end of the last chunk read; as above
  int excludeOutlierMillis = -1;           // response-time limit in ms; -1: no test
  uint64_t readDevice = 0;                 // of the last chunk's file; thread body
  uint64_t readInode = 0;                  // as readDevice
};
