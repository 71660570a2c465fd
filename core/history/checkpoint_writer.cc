#include "core/history/checkpoint_writer.h"

#include <pthread.h>

#include <cstring>
#include <system_error>
#include <utility>

#include "core/runtime/clog.h"

namespace history {

std::vector<LoadedSection> CopySections(const std::vector<RecordSection>& sections) {
  std::vector<LoadedSection> copied;
  copied.reserve(sections.size());
  for (const RecordSection& section : sections) {
    LoadedSection& out = copied.emplace_back();
    out.stem = section.stem;
    out.record_size = section.record_size;
    out.records.resize(section.count * section.record_size);
    if (section.count > 0) {
      section.fill(0, section.count, out.records.data());
    }
  }
  return copied;
}

std::vector<RecordSection> SectionsOf(const std::vector<LoadedSection>& copied) {
  std::vector<RecordSection> sections;
  sections.reserve(copied.size());
  for (const LoadedSection& section : copied) {
    const LoadedSection* const from = &section;
    sections.push_back({section.stem, section.record_size, section.count(),
                        [from](size_t first, size_t n, void* out) {
                          std::memcpy(out, from->records.data() + first * from->record_size,
                                      n * from->record_size);
                        }});
  }
  return sections;
}

CheckpointWriter::CheckpointWriter(const CheckpointFile& file) : file_(file) {}

CheckpointWriter::~CheckpointWriter() {
  {
    fw::MutexLock lock(mutex_);
    stopping_ = true;
  }
  changed_.NotifyAll();
  if (thread_.joinable()) {
    thread_.join();  // the thread writes the job it holds before it looks at stopping_
  }
}

bool CheckpointWriter::busy() const {
  fw::MutexLock lock(mutex_);
  return job_.has_value() || writing_ || result_.has_value();
}

bool CheckpointWriter::start(CheckpointJob job) {
  {
    fw::MutexLock lock(mutex_);
    if (job_.has_value() || writing_ || result_.has_value()) {
      return false;
    }
  }
  if (!thread_.joinable()) {
    try {
      thread_ = std::thread([this] { run(); });
    } catch (const std::system_error& e) {
      CLOG::error("%s no thread for checkpoints (%s): this one is written in line",
                  "CheckpointWriter::start", e.what());
      CheckpointResult result = write(file_, job);
      fw::MutexLock lock(mutex_);
      result_ = std::move(result);
      return true;
    }
  }
  {
    fw::MutexLock lock(mutex_);
    job_ = std::move(job);
  }
  changed_.NotifyAll();
  return true;
}

std::optional<CheckpointResult> CheckpointWriter::finished() {
  fw::MutexLock lock(mutex_);
  return std::exchange(result_, std::nullopt);
}

std::optional<CheckpointResult> CheckpointWriter::wait() {
  fw::MutexLock lock(mutex_);
  changed_.Wait(mutex_, [this]() REQUIRES(mutex_) { return !job_.has_value() && !writing_; });
  return std::exchange(result_, std::nullopt);
}

void CheckpointWriter::run() {
  pthread_setname_np(pthread_self(), "Checkpoint");
  while (true) {
    std::optional<CheckpointJob> job;
    {
      fw::MutexLock lock(mutex_);
      changed_.Wait(mutex_, [this]() REQUIRES(mutex_) { return job_.has_value() || stopping_; });
      if (!job_.has_value()) {
        return;  // stopping, and nothing left to write
      }
      job = std::exchange(job_, std::nullopt);
      writing_ = true;
    }
    CheckpointResult result = write(file_, *job);
    job.reset();  // the copy's memory goes back before the next copy is made
    {
      fw::MutexLock lock(mutex_);
      result_ = std::move(result);
      writing_ = false;
    }
    changed_.NotifyAll();
  }
}

CheckpointResult CheckpointWriter::write(const CheckpointFile& file, const CheckpointJob& job) {
  const auto began = std::chrono::steady_clock::now();
  CheckpointResult result;
  result.sequence = job.sequence;
  for (const LoadedSection& section : job.sections) {
    result.bytes += section.records.size();
  }
  result.written = file.save(job.description, SectionsOf(job.sections));
  result.took = std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::steady_clock::now() - began);
  return result;
}

}  // namespace history
