#include "collector/capture/record_output.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include "collector/common/process.h"
#include "collector/sm3gen/record_format.h"

namespace capture {
namespace {

constexpr size_t kFileBatch = 256 * 1024;
constexpr auto kReconnect = std::chrono::milliseconds(100);

}  // namespace

bool FileOutput::Open(const std::string& path, std::string* error) {
  path_ = path;
  if (path == "-") {
    fd_.reset(STDOUT_FILENO);
    borrowed_ = true;
    return true;
  }
  fd_.reset(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (!fd_.valid()) {
    *error = collector::ErrnoText(path);
    return false;
  }
  return true;
}

void FileOutput::Write(const sm3gen::Record& record) {
  sm3gen::AppendRecord(record, &buffer_);
  buffer_.push_back('\n');
  ++stats_->records;
  if (buffer_.size() >= kFileBatch && failure_.empty()) {
    WriteAll(&failure_);
  }
}

bool FileOutput::WriteAll(std::string* error) {
  size_t done = 0;
  while (done < buffer_.size()) {
    const ssize_t n = ::write(fd_.get(), buffer_.data() + done, buffer_.size() - done);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      *error = collector::ErrnoText(path_);
      buffer_.clear();
      return false;
    }
    done += static_cast<size_t>(n);
  }
  buffer_.clear();
  return true;
}

bool FileOutput::Pump(std::string* error) {
  if (!failure_.empty()) {
    *error = failure_;
    return false;
  }
  return WriteAll(error);
}

bool FileOutput::Finish(std::chrono::steady_clock::time_point, std::string* error) {
  const bool ok = Pump(error);
  if (borrowed_) {
    (void)fd_.release();
  } else if (::fsync(fd_.get()) != 0 && errno != EINVAL) {
    *error = collector::ErrnoText(path_);
    return false;
  }
  return ok;
}

FifoOutput::~FifoOutput() = default;

bool FifoOutput::Open(const std::string& path, std::string* error) {
  path_ = path;
  if (!collector::EnsureFifo(path, error)) {
    return false;
  }
  return TryConnect(error);
}

bool FifoOutput::TryConnect(std::string* error) {
  next_connect_ = std::chrono::steady_clock::now() + kReconnect;
  fd_.reset(::open(path_.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC));
  if (!fd_.valid() && errno != ENXIO) {  // ENXIO: no reader yet
    *error = collector::ErrnoText(path_);
    return false;
  }
  return true;
}

void FifoOutput::Write(const sm3gen::Record& record) {
  if (bytes_.size() - begun_ >= max_queued_) {
    ++stats_->records_lost;
    return;
  }
  sm3gen::AppendRecord(record, &bytes_);
  bytes_.push_back('\n');
  ends_.push_back(bytes_.size());
  ++stats_->records;
}

bool FifoOutput::Pump(std::string* error) {
  if (!fd_.valid()) {
    if (std::chrono::steady_clock::now() < next_connect_) {
      return true;
    }
    if (!TryConnect(error)) {
      return false;
    }
  }
  while (fd_.valid() && sent_ < bytes_.size()) {
    const ssize_t n = ::write(fd_.get(), bytes_.data() + sent_, bytes_.size() - sent_);
    if (n > 0) {
      sent_ += static_cast<size_t>(n);
    } else if (n < 0 && errno == EINTR) {
      continue;
    } else if (n < 0 && errno == EPIPE) {
      // The reader left. A new reader must start on a whole record: the rest of one it had
      // begun is dropped (it discards the part it got), the records after it wait.
      fd_.reset();
      if (sent_ > begun_ && !ends_.empty()) {
        sent_ = ends_.front();
        ends_.pop_front();
        begun_ = sent_;
        ++stats_->records_lost;
        --stats_->records;
      }
    } else {
      break;  // full for now
    }
    while (!ends_.empty() && ends_.front() <= sent_) {
      begun_ = ends_.front();
      ends_.pop_front();
    }
  }
  // Forget what was sent, now and then, so the queue does not grow with the traffic.
  if (begun_ > 0 && (ends_.empty() || begun_ >= (1u << 20))) {
    bytes_.erase(0, begun_);
    for (size_t& end : ends_) {
      end -= begun_;
    }
    sent_ -= begun_;
    begun_ = 0;
  }
  return true;
}

void FifoOutput::WaitForRoom(std::chrono::milliseconds timeout) {
  if (fd_.valid()) {
    struct pollfd pfd = {fd_.get(), POLLOUT, 0};
    ::poll(&pfd, 1, static_cast<int>(timeout.count()));
  } else {
    std::this_thread::sleep_for(std::min(timeout, kReconnect));
  }
}

bool FifoOutput::Finish(std::chrono::steady_clock::time_point deadline, std::string* error) {
  while (sent_ < bytes_.size() && std::chrono::steady_clock::now() < deadline) {
    if (!Pump(error)) {
      return false;
    }
    if (sent_ < bytes_.size()) {
      WaitForRoom(std::chrono::milliseconds(10));
    }
  }
  // What the reader never took is lost; a record it had begun is finished or dropped by it.
  const size_t unsent = ends_.size();
  stats_->records_lost += unsent;
  stats_->records -= unsent;
  return true;
}

std::unique_ptr<RecordOutput> OpenRecordOutput(const std::string& out_path,
                                               const std::string& fifo_path, CaptureStats* stats,
                                               std::string* error) {
  if (!out_path.empty()) {
    auto file = std::make_unique<FileOutput>(stats);
    return file->Open(out_path, error) ? std::move(file) : nullptr;
  }
  auto fifo = std::make_unique<FifoOutput>(stats);
  return fifo->Open(fifo_path, error) ? std::move(fifo) : nullptr;
}

bool PumpOutput(RecordOutput* output, bool wait, std::string* error) {
  bool pumped = output->Pump(error);
  while (pumped && wait && output->Backlogged() && !collector::StopRequested()) {
    output->WaitForRoom(std::chrono::milliseconds(100));
    pumped = output->Pump(error);
  }
  return pumped;
}

}  // namespace capture
