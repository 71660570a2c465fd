#pragma once

// CDPXFileManager: the thread that watches the collector's data directory. Every 5 seconds it
// lists the ".sm3" files, orders them oldest to newest (CCommon::newerFile), and keeps exactly
// one live CDPXDataFileMonitor on the newest; when a newer file appears (a rollover) the old
// monitor finishes its file as a static monitor and a new one starts at 0. On its first pass
// it reads the files written while the agent was down. Shutdown stops the monitor and persists
// the last processed file and the offset reached in it ("DPXLastFile"); the constructor reads
// them back, so a restart neither repeats nor misses a record. After a crash the analyzer's
// checkpoint is newer: the owner then sets the position with resumeAt before Start.
//
// Ownership: the analyzer thread creates it, starts it and calls shutdownAndJoin before
// draining its queue. The manager owns its monitors; the sink must outlive it.
//
// Thread safety: Run on the manager thread owns the monitors and the last processed file and
// offset while it runs; Shutdown (from another thread) sets the stop flag and joins the thread
// before touching them.

#include <cstdint>
#include <memory>
#include <string>

#include "core/analyzer/intake/file_manager.h"
#include "core/analyzer/intake/transaction_sink.h"

class CDPXDataFileMonitor;

class CDPXFileManager : public CFileManager, public TransactionFeeder {
 public:
  // Reads the persist file: the last processed file and offset of the previous run, if any.
  CDPXFileManager();
  ~CDPXFileManager() override;

  // Sets the stop flag, joins the thread, stops the monitor and persists where it stopped.
  void Shutdown() override;
  // The collector history directory followed directly by "DPXLastFile".
  bool getPersistFileSpec(char* buffer, int size) override;

  // TransactionFeeder.
  void start() override { Start(); }
  void shutdownAndJoin() override { Shutdown(); }

  // Resumes at file and offset instead of where "DPXLastFile" says: a checkpoint's position,
  // which is newer after a crash. Owner, before Start.
  // device and inode say which file the offset belongs to (0, 0: not known), so that a file
  // renamed meanwhile is not read from it.
  void resumeAt(const char* file, long long offset, uint64_t device, uint64_t inode);

  // The last processed file and offset: where the current monitor started, or, once stopped,
  // where reading stopped. Owner only while the thread is not running.
  const std::string& getLastProcessedFileName() const { return lastProcessedFile; }
  long long getLastProcessedOffset() const { return lastProcessedOffset; }

 protected:
  void Run() override;

 private:
  void objectInit();
  // Reads every file of the sorted list but the newest (as the last processed file says) and
  // returns the list holding only the newest, which becomes the last processed file.
  _FILE_INFO_LL* processOlderFiles(_FILE_INFO_LL* list);
  // Takes the identity of the newest file of a sorted listing, for the monitor started on it.
  void noteNewest(const _FILE_INFO_LL* list);
  void startANewMonitor();
  // Stops and deletes the current monitor, keeping the offset it reached. For a rollover it
  // first lets the monitor finish its file as a static monitor.
  void stopCurrentMonitor(bool finishFile);
  void setLastProcessed(const char* file, long long offset);

  std::string lastProcessedFile;  // at most 4096 characters; empty: none
  // The identity resumeAt gave, for the first monitor started on lastProcessedFile.
  std::string resumeFile;
  uint64_t resumeDevice = 0;
  uint64_t resumeInode = 0;
  // The newest file of the last listing and its identity as listed.
  std::string listedFile;
  uint64_t listedDevice = 0;
  uint64_t listedInode = 0;
  long long lastProcessedOffset = 0;
  std::unique_ptr<CDPXDataFileMonitor> currentMonitor;
};
