#pragma once

// CFileManager: the generic watcher of a data directory. It holds what every kind of manager
// shares: the directory, the outlier limit handed to monitors, the stop request, the sink
// records go to, the directory listing, and the persist file in which a manager records the
// last processed file and offset across restarts. CDPXFileManager is the collector's kind.
//
// Thread safety: the setters are for the owner before Start. Shutdown requests (the stop flag)
// and the shutdown-complete flag are atomics any thread may touch. The persist-file functions
// may be called from any thread but are not serialised against each other.

#include <atomic>

#include "core/analyzer/intake/file_info.h"
#include "core/analyzer/intake/last_file_info.h"
#include "core/analyzer/intake/transaction_sink.h"
#include "core/runtime/cvel_thread.h"
#include "framework/clock.h"

class CFileManager : public CvelThread {
 public:
  // Persist-path buffers are this big (4096 characters and a terminator).
  static constexpr int kPersistSpecSize = 4097;

  // Watches the configured collector data directory; no outlier limit.
  explicit CFileManager(const char* threadName);
  ~CFileManager() override;

  // Sets the stop flag; the loop ends at its next turn.
  virtual void Shutdown();
  // Writes the persist file's path into buffer; false when it does not fit in size bytes.
  virtual bool getPersistFileSpec(char* buffer, int size) = 0;
  // The files of the watched directory matching pattern, as "directory/name" (caller frees the
  // list with deleteFoundFiles); null when there are none.
  virtual _FILE_INFO_LL* findFiles(const char* pattern);
  virtual void deleteFoundFiles(_FILE_INFO_LL* list);

  // Truncates the persist file (created 0600) and writes every record of list, type word 1.
  bool persistLastProcessedFile(_LAST_FILE_INFO* list);
  // Reads every record of the persist file into a new list, the last record first; null when
  // the file cannot be read or holds no whole record. The caller frees it.
  _LAST_FILE_INFO* getLastProcessedFile();

  // Stores seconds x 1000 (32-bit wrap) as the outlier limit.
  void setExcludeOutlierSeconds(int seconds);
  void setExcludeOutlierMillis(int millis) { excludeOutlierMillis = millis; }
  int getExcludeOutlierMillis() const { return excludeOutlierMillis; }
  void setDirToWatch(const char* dir);
  const char* getDirToWatch() const { return dirToWatch; }
  // Where monitors queue transactions (not owned; set before Start).
  void setSink(TransactionSink* sink) { this->sink = sink; }
  TransactionSink* getSink() const { return sink; }
  // What the manager's pauses between passes wait on (not owned; the system clock unless set
  // before Start).
  void setClock(const fw::Clock& clock) { this->clock = &clock; }
  const fw::Clock& getClock() const { return *clock; }
  bool isShutdownComplete() const { return shutdownComplete.load(); }
  void setShutdownComplete(bool done) { shutdownComplete.store(done); }

 protected:
  bool isStopRequested() const { return stopRequested.load(); }
  // The stop flag itself, for naps that end early on it.
  const std::atomic<bool>* stopFlag() const { return &stopRequested; }

 private:
  char dirToWatch[kFileInfoMaxPath + 1] = {};   // set at construction, then by the owner
  int excludeOutlierMillis = -1;                // ms; -1: no test
  std::atomic<bool> stopRequested{false};       // set by Shutdown, read by the loop
  TransactionSink* sink = nullptr;              // not owned
  const fw::Clock* clock = &fw::SystemClock();  // not owned
  const int32_t persistRecordType = 1;          // first word of every persisted record
  std::atomic<bool> shutdownComplete{false};    // set when the loop has returned
};
