// The analyzer's checkpoints: the current interval's rows saved together with the read
// position that produced them, so that a start after a crash counts every record exactly once.
//
// Why this is enough: processing only ever adds to the current interval's trees (a record too
// old for it is counted into it, never into a past interval's rows) and appends to the current
// interval's instance files. So everything a run wrote after its last checkpoint is: the rows
// of that checkpoint's interval saved at its rollover, files of later intervals, and instance
// records past the checkpointed lengths. A recovery puts the checkpoint's rows back as that
// interval's, removes the later files, cuts the instance files back and reads again from the
// checkpoint's position.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/analyzer/analysis/checkpoint_state.h"
#include "core/analyzer/analysis/interval_cache.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/situation_controller.h"
#include "core/config/cconfig.h"
#include "core/history/checkpoint_file.h"
#include "core/history/checkpoint_writer.h"
#include "core/history/history_store.h"
#include "core/history/instance_file.h"
#include "core/runtime/clog.h"
#include "framework/clock.h"

namespace {

constexpr const char* kInstanceStems[] = {"q7txins", "q7subtxins"};

int64_t FileBytes(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 ? static_cast<int64_t>(st.st_size) : 0;
}

}  // namespace

void CDPXAnalyzer::notePosition(const ReadPosition& noted) {
  position = noted;
  if (!checkpointFile) {
    return;
  }
  collectCheckpoint(false);
  if (checkpointWriter->busy()) {
    return;  // the one before is still being written: this mark waits for the next
  }
  // After a rollover at once, but a failing one is tried at most once a second.
  const long now = fw::Now();
  if (now - lastCheckpointAt >= (checkpointDue ? 1 : CConfig::getCheckpointSeconds())) {
    startCheckpoint();
  }
}

bool CDPXAnalyzer::writeCheckpoint() {
  if (!checkpointFile) {
    return false;
  }
  collectCheckpoint(true);
  return startCheckpoint() && collectCheckpoint(true);
}

void CDPXAnalyzer::awaitCheckpoint() {
  if (checkpointFile) {
    collectCheckpoint(true);
  }
}

bool CDPXAnalyzer::startCheckpoint() {
  lastCheckpointAt = fw::Now();
  const auto began = std::chrono::steady_clock::now();
  history::CheckpointJob job;
  PendingCheckpoint pending;
  {
    CvelMutexLock lock(treeMutex);
    // A past interval's rows swapped in are saved as that interval's; the checkpoint holds
    // the current interval's.
    cache->flush();
    // A checkpoint says what the files hold: while an ended interval or instance records are
    // still unwritten (a full disk), the previous checkpoint stays the one to recover from.
    if (!saveUnsaved() || !instanceFile->flush() || !subInstanceFile->flush()) {
      if (!checkpointPutOff) {
        CLOG::min("Checkpoint put off: history or instance records are not written yet");
      }
      checkpointPutOff = true;
      return false;
    }
    checkpointPutOff = false;
    CheckpointState state;
    state.sequence = checkpointSequence + 1;
    state.interval = getCurrentOverTimeInterval();
    state.written = lastCheckpointAt;
    state.position = position;
    state.instanceLevel = lastInstanceLevel;
    state.oldTransactions = oldTransactions;
    state.transactionsReceived = transactionsReceived;
    for (const char* stem : kInstanceStems) {
      state.instanceFiles.push_back(
          {stem, state.interval, FileBytes(history->pathOf(state.interval, stem))});
    }
    state.patterns = situations().getPatternCounters();
    // A copy of the rows: the file is written after the lock is given up, on the writer's
    // thread, while processing goes on.
    job.sections = history::CopySections(cache->currentIntervalTrees().sections());
    job.description = state.encode();
    job.sequence = state.sequence;
    pending = {state.sequence, static_cast<long>(state.interval), position,
               cache->currentIntervalTrees().totalRows(), 0};
  }
  pending.copyMillis = std::chrono::duration_cast<std::chrono::milliseconds>(
                           std::chrono::steady_clock::now() - began)
                           .count();
  checkpointStats.longestCopyMillis.store(
      std::max(checkpointStats.longestCopyMillis.load(), pending.copyMillis));
  if (!checkpointWriter->start(std::move(job))) {
    return false;  // callers wait for the one before first
  }
  pendingCheckpoint = pending;
  return true;
}

bool CDPXAnalyzer::collectCheckpoint(bool wait) {
  const std::optional<history::CheckpointResult> result =
      wait ? checkpointWriter->wait() : checkpointWriter->finished();
  if (!result || !pendingCheckpoint || pendingCheckpoint->sequence != result->sequence) {
    return false;
  }
  const PendingCheckpoint done = *std::exchange(pendingCheckpoint, std::nullopt);
  if (!result->written) {
    return false;  // traced; tried again when the next one falls due
  }
  checkpointSequence = done.sequence;
  // One of the interval that began with the last rollover: the ended one is safe.
  if (done.interval == referenceInterval.load()) {
    checkpointDue = false;
  }
  checkpointStats.written.fetch_add(1);
  checkpointStats.longestWriteMillis.store(std::max(checkpointStats.longestWriteMillis.load(),
                                                    static_cast<long long>(result->took.count())));
  CLOG::med(
      "Checkpoint %llu of interval[%ld] at [%s] offset[%lld] (%ld rows, %.1f MB; copied in %lld "
      "ms, written in %lld ms)",
      static_cast<unsigned long long>(done.sequence), done.interval, done.position.file.c_str(),
      done.position.offset, done.rows, static_cast<double>(result->bytes) / 1e6, done.copyMillis,
      static_cast<long long>(result->took.count()));
  return true;
}

bool CDPXAnalyzer::recoverFromCheckpoint() {
  if (!checkpointFile) {
    return false;
  }
  const auto began = std::chrono::steady_clock::now();
  history::CheckpointImage image;
  if (checkpointFile->load(&image) != history::CheckpointFile::Load::kLoaded) {
    return false;  // none, or set aside and traced
  }
  CheckpointState state;
  std::string why;
  auto rows = std::make_unique<COverTimeTrees>();
  if (!CheckpointState::decode(image.description, &state, &why)) {
    checkpointFile->setAside(why);
    return false;
  }
  for (const history::LoadedSection& section : image.sections) {
    if (!rows->loadSection(section)) {
      checkpointFile->setAside("rows of an unknown table or record size: " + section.stem);
      return false;
    }
  }
  // Everything is read: only now are the files put back.
  const long interval = static_cast<long>(state.interval);
  const int removed = history->removeIntervalsAfter(interval);
  for (const InstanceFileLength& file : state.instanceFiles) {
    history->truncateInterval(file.interval, file.stem, static_cast<off_t>(file.bytes));
  }
  const int counters = situations().restorePatternCounters(state.patterns);
  lastInstanceLevel = static_cast<short>(state.instanceLevel);
  oldTransactions = state.oldTransactions;
  transactionsReceived = state.transactionsReceived;
  checkpointSequence = state.sequence;
  resumeAt = state.position;
  position = state.position;
  CLOG::min(
      "Resuming from checkpoint %llu of interval[%ld] (%ld rows, %d pattern counters, %d later "
      "history files removed) at [%s] offset[%lld], restored in %lld ms",
      static_cast<unsigned long long>(state.sequence), interval, rows->totalRows(), counters,
      removed, state.position.file.c_str(), state.position.offset,
      static_cast<long long>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                 std::chrono::steady_clock::now() - began)
                                 .count()));
  if (interval == getCurrentOverTimeInterval()) {
    cache->replaceCurrent(std::move(rows));
    return true;
  }
  // The interval ended while the agent was down: save it as its rollover would have, and
  // start the current one afresh.
  auto fresh = std::make_unique<COverTimeTrees>();
  if (CConfig::getReportZeroRecords()) {
    fresh->seedZeroRows(*rows, getCurrentOverTimeInterval());
  }
  if (!rows->save(*history, interval)) {
    unsaved.emplace_back(interval, std::move(rows));
  }
  cache->replaceCurrent(std::move(fresh));
  oldTransactions = 0;
  transactionsReceived = 0;
  checkpointDue = true;
  return true;
}

void CDPXAnalyzer::retireCheckpoint() const {
  const std::string& path = paths.retiredCheckpointFile;
  if (path.empty()) {
    return;
  }
  if (::unlink(path.c_str()) != 0) {
    if (errno != ENOENT) {
      CLOG::error(
          "Checkpoints are off, yet the checkpoint %s of an earlier run cannot be "
          "removed: %s",
          path.c_str(), std::strerror(errno));
    }
    return;
  }
  CLOG::min(
      "Checkpoints are off (KQ7CHECKPOINTSECONDS=0): removed the checkpoint %s of an earlier "
      "run, which would undo everything saved since were checkpoints turned on again",
      path.c_str());
}
