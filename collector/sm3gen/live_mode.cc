#include "collector/sm3gen/live_mode.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <deque>
#include <fstream>

#include "collector/common/process.h"
#include "collector/common/unique_fd.h"
#include "collector/sm3gen/ground_truth.h"
#include "collector/sm3gen/record_format.h"

namespace sm3gen {
namespace {

using Clock = std::chrono::steady_clock;

// How often the loop wakes when nothing is due, and how often it retries a missing reader.
constexpr auto kTick = std::chrono::milliseconds(10);
constexpr auto kRetry = std::chrono::milliseconds(100);
// Records due while this much is still unwritten are lost rather than queued without bound.
constexpr size_t kMaxBacklog = 1 << 20;
// At a stop, how long a record already begun may take to finish.
constexpr auto kFinishGrace = std::chrono::seconds(1);

// Bytes on their way into the FIFO, with the records they hold, so the truth counts only
// records the reader can have received whole.
class Outbox {
 public:
  void Add(Record record) {
    AppendRecord(record, &bytes_);
    bytes_.push_back('\n');
    records_.push_back({bytes_.size(), std::move(record)});
  }
  bool empty() const { return sent_ == bytes_.size(); }
  size_t unsent() const { return bytes_.size() - sent_; }
  // True when the bytes sent so far end at a record boundary.
  bool at_boundary() const { return sent_ == begun_; }
  std::string_view rest() const { return std::string_view(bytes_).substr(sent_); }
  // Marks count bytes sent; records now complete go to truth.
  int64_t Sent(size_t count, GroundTruth* truth) {
    sent_ += count;
    int64_t done = 0;
    while (!records_.empty() && records_.front().end <= sent_) {
      truth->AddRecord(records_.front().record);
      truth->AddBytes(records_.front().end - begun_);
      begun_ = records_.front().end;
      records_.pop_front();
      ++done;
    }
    if (records_.empty()) {
      bytes_.clear();
      sent_ = begun_ = 0;
    } else if (begun_ >= kMaxBacklog) {
      // A FIFO that never quite empties would otherwise keep every byte ever sent.
      bytes_.erase(0, begun_);
      for (Pending& pending : records_) {
        pending.end -= begun_;
      }
      sent_ -= begun_;
      begun_ = 0;
    }
    return done;
  }
  // Drops everything not yet sent; returns the records lost.
  int64_t Clear() {
    const auto lost = static_cast<int64_t>(records_.size());
    records_.clear();
    bytes_.clear();
    sent_ = begun_ = 0;
    return lost;
  }

 private:
  struct Pending {
    size_t end;  // offset in bytes_ just past the record's line end
    Record record;
  };
  std::string bytes_;
  size_t sent_ = 0;   // bytes of bytes_ written to the FIFO
  size_t begun_ = 0;  // start of the first record not completely sent
  std::deque<Pending> records_;
};

bool WriteTruth(const std::string& path, const GroundTruth& truth, std::string* error) {
  if (path.empty()) {
    return true;
  }
  const std::string temp = path + ".tmp";
  {
    std::ofstream out(temp, std::ios::trunc);
    out << truth.ToJson().dump(2, ' ', false, nlohmann::json::error_handler_t::replace) << "\n";
    out.close();
    if (!out) {
      *error = collector::ErrnoText(temp);
      return false;
    }
  }
  if (std::rename(temp.c_str(), path.c_str()) != 0) {
    *error = collector::ErrnoText(path);
    return false;
  }
  return true;
}

// The FIFO end of live mode: connects when a reader is there, writes without blocking.
class FifoOut {
 public:
  explicit FifoOut(std::string path) : path_(std::move(path)) {}

  bool connected() const { return fd_.valid(); }

  // Opens the FIFO for writing if a reader has it open. False with *error on a real failure.
  bool TryConnect(std::string* error) {
    if (!collector::EnsureFifo(path_, error)) {
      return false;
    }
    fd_.reset(::open(path_.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC));
    if (!fd_.valid() && errno != ENXIO) {  // ENXIO: no reader yet
      *error = collector::ErrnoText(path_);
      return false;
    }
    return true;
  }

  // Writes what the FIFO takes now. Returns bytes written; disconnects when the reader left.
  size_t Write(std::string_view bytes) {
    const ssize_t n = ::write(fd_.get(), bytes.data(), bytes.size());
    if (n >= 0) {
      return static_cast<size_t>(n);
    }
    if (errno == EPIPE) {
      // Closing frees the pipe, so a new reader starts on a fresh one, not on our half record.
      fd_.reset();
    }
    return 0;
  }

  // Waits until the FIFO can take bytes or timeout passes.
  void WaitWritable(std::chrono::milliseconds timeout) {
    struct pollfd pfd = {fd_.get(), POLLOUT, 0};
    ::poll(&pfd, 1, static_cast<int>(timeout.count()));
  }

 private:
  std::string path_;
  collector::UniqueFd fd_;
};

bool RunIntoFifo(const LiveJob& job, LiveStats* stats, std::string* error) {
  TrafficModel model(job.model);
  GroundTruth truth(job.model.seed);
  FifoOut fifo(job.fifo);
  Outbox outbox;
  const Clock::time_point begin = Clock::now();
  Clock::time_point next_connect = begin;
  Clock::time_point truth_written = begin;
  if (!WriteTruth(job.truth_path, truth, error)) {
    return false;
  }
  int64_t queued = 0;  // records handed to the outbox, written or not
  while (!collector::StopRequested()) {
    const Clock::time_point now = Clock::now();
    if (!fifo.connected() && now >= next_connect) {
      if (!fifo.TryConnect(error)) {
        return false;
      }
      next_connect = now + kRetry;
    }
    const double elapsed = std::chrono::duration<double>(now - begin).count();
    const auto due = static_cast<int64_t>(std::floor(elapsed * job.model.rate));
    while (model.produced() < due) {
      if (job.records > 0 && queued >= job.records) {
        break;
      }
      Record record = model.Next();
      if (fifo.connected() && outbox.unsent() < kMaxBacklog) {
        outbox.Add(std::move(record));
        ++queued;
      } else {
        ++stats->lost;
      }
    }
    if (fifo.connected() && !outbox.empty()) {
      stats->written += outbox.Sent(fifo.Write(outbox.rest()), &truth);
      if (!fifo.connected()) {
        stats->lost += outbox.Clear();
        queued = stats->written;
      }
    }
    if (job.records > 0 && stats->written >= job.records) {
      break;
    }
    if (job.truth_path.size() > 0 && now - truth_written >= std::chrono::seconds(1)) {
      truth_written = now;
      if (!WriteTruth(job.truth_path, truth, error)) {
        return false;
      }
    }
    if (fifo.connected() && !outbox.empty()) {
      fifo.WaitWritable(kTick);
    } else {
      ::usleep(static_cast<useconds_t>(
          std::chrono::duration_cast<std::chrono::microseconds>(kTick).count()));
    }
  }
  // Stop at a record boundary: finish the record the reader has begun, drop the rest.
  const Clock::time_point give_up = Clock::now() + kFinishGrace;
  while (fifo.connected() && !outbox.at_boundary() && Clock::now() < give_up) {
    stats->written += outbox.Sent(fifo.Write(outbox.rest()), &truth);
    if (!outbox.at_boundary()) {
      fifo.WaitWritable(kTick);
    }
  }
  stats->lost += outbox.Clear();
  return WriteTruth(job.truth_path, truth, error);
}

bool RunIntoDirectory(const LiveJob& job, LiveStats* stats, std::string* error) {
  TrafficModel model(job.model);
  GroundTruth truth(job.model.seed);
  collector::LiveFile file(job.out_dir);
  const Clock::time_point begin = Clock::now();
  Clock::time_point truth_written = begin;
  if (!file.Open(begin, error) || !WriteTruth(job.truth_path, truth, error)) {
    return false;
  }
  std::string text;
  while (!collector::StopRequested() && (job.records == 0 || stats->written < job.records)) {
    const Clock::time_point now = Clock::now();
    const double elapsed = std::chrono::duration<double>(now - begin).count();
    const auto due = static_cast<int64_t>(std::floor(elapsed * job.model.rate));
    while (model.produced() < due && (job.records == 0 || stats->written < job.records)) {
      const Record record = model.Next();
      text.clear();
      AppendRecord(record, &text);
      text.push_back('\n');
      if (!file.Append(text, now, error)) {
        return false;
      }
      truth.AddRecord(record);
      truth.AddBytes(text.size());
      ++stats->written;
    }
    if (!file.Flush(error) || !file.Tick(now, error)) {
      return false;
    }
    if (job.truth_path.size() > 0 && now - truth_written >= std::chrono::seconds(1)) {
      truth_written = now;
      if (!WriteTruth(job.truth_path, truth, error)) {
        return false;
      }
    }
    ::usleep(static_cast<useconds_t>(
        std::chrono::duration_cast<std::chrono::microseconds>(kTick).count()));
  }
  return file.Flush(error) && WriteTruth(job.truth_path, truth, error);
}

}  // namespace

bool RunLiveMode(const LiveJob& job, LiveStats* stats, std::string* error) {
  LiveJob now_job = job;
  now_job.model.start = std::time(nullptr);
  return job.out_dir.dir.empty() ? RunIntoFifo(now_job, stats, error)
                                 : RunIntoDirectory(now_job, stats, error);
}

}  // namespace sm3gen
