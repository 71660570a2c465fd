#include "collector/writer/writer_loop.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>

#include "collector/common/process.h"
#include "collector/common/unique_fd.h"
#include "collector/writer/record_appender.h"

namespace collector {
namespace {

using Clock = LiveFile::Clock;

// Also bounds how late an age roll or a truth rewrite can be.
constexpr int kPollMs = 100;
constexpr size_t kReadSize = 64 * 1024;
// Bounds one round of reading, so the loop still ticks under a flood.
constexpr std::chrono::milliseconds kDrainLimit(kPollMs);
// At a stop, well inside the 5 s sm3ctl waits before it kills.
constexpr std::chrono::milliseconds kFinalDrainLimit(2000);

void Report(const std::string& text) {
  std::fprintf(stderr, "sm3writer: %s\n", text.c_str());
}

// Reads what the FIFO holds now into the appender, for at most limit (a producer may keep it
// full). False on a read error other than "empty".
bool Drain(int fd, RecordAppender* appender, std::chrono::milliseconds limit) {
  const Clock::time_point deadline = Clock::now() + limit;
  std::string buffer(kReadSize, '\0');
  while (Clock::now() < deadline) {
    const ssize_t n = ::read(fd, buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n < 0 && errno == EAGAIN) {
      return true;
    }
    if (n <= 0) {
      // With the FIFO open for writing too, end-of-file cannot happen; anything else is odd.
      Report(n == 0 ? "unexpected end of the FIFO" : ErrnoText("read"));
      return false;
    }
    std::string error;
    if (!appender->Feed(std::string_view(buffer.data(), static_cast<size_t>(n)), Clock::now(),
                        &error)) {
      Report(error);
    }
  }
  return true;
}

}  // namespace

Writer::Writer(WriterOptions options) : options_(std::move(options)) {}

Writer::~Writer() = default;

bool Writer::Open(std::string* error) {
  if (!EnsureFifo(options_.fifo, error)) {
    return false;
  }
  fifo_.reset(::open(options_.fifo.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
  if (!fifo_.valid()) {
    *error = ErrnoText(options_.fifo);
    return false;
  }
  appender_ = std::make_unique<RecordAppender>(options_.file, options_.truth_path);
  return appender_->Open(Clock::now(), error);
}

void Writer::Run() {
  RecordAppender& appender = *appender_;

  // Stop signals are delivered only inside ppoll, so a stop can never slip in between the
  // check and the wait.
  sigset_t stop_signals, during_wait;
  sigemptyset(&stop_signals);
  sigaddset(&stop_signals, SIGINT);
  sigaddset(&stop_signals, SIGTERM);
  sigprocmask(SIG_BLOCK, &stop_signals, &during_wait);
  sigdelset(&during_wait, SIGINT);
  sigdelset(&during_wait, SIGTERM);

  const struct timespec timeout = {0, kPollMs * 1000000L};
  while (!StopRequested()) {
    struct pollfd pfd = {fifo_.get(), POLLIN, 0};
    const int ready = ::ppoll(&pfd, 1, &timeout, &during_wait);
    if (ready < 0 && errno != EINTR) {
      Report(ErrnoText("poll"));
    }
    if (ready > 0 && !Drain(fifo_.get(), &appender, kDrainLimit)) {
      // Avoid spinning on a FIFO that keeps failing.
      ::usleep(kPollMs * 1000);
    }
    std::string failure;
    if (!appender.Tick(Clock::now(), &failure)) {
      Report(failure);
    }
  }

  // Records a capture process finished writing before it stopped are still in the FIFO.
  Drain(fifo_.get(), &appender, kFinalDrainLimit);
  std::string failure;
  if (!appender.Finish(Clock::now(), &failure)) {
    Report(failure);
  }
  std::fprintf(stderr,
               "sm3writer: stopped: %lld records appended, %llu bytes dropped, %lld files "
               "rolled\n",
               static_cast<long long>(appender.cutter().records()),
               static_cast<unsigned long long>(appender.cutter().dropped_bytes()),
               static_cast<long long>(appender.file().rolled()));
}

}  // namespace collector
