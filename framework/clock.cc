#include "framework/clock.h"

#include <time.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <thread>
#include <utility>

#include "framework/mutex.h"

namespace fw {
namespace {

constinit Mutex g_clock_mutex;
std::function<time_t()> g_clock GUARDED_BY(g_clock_mutex);  // empty: time()
// Lets Now() skip the lock in production, where no clock is ever injected.
std::atomic<bool> g_clock_injected{false};

}  // namespace

time_t Now() {
  if (g_clock_injected.load(std::memory_order_acquire)) {
    MutexLock lock(g_clock_mutex);
    if (g_clock) {
      return g_clock();
    }
  }
  return time(nullptr);
}

time_t Clock::now() const {
  return Now();
}

void Clock::sleep(unsigned long ms) const {
  std::this_thread::sleep_for(std::chrono::milliseconds(ms));
}

const Clock& SystemClock() {
  static const Clock clock;
  return clock;
}

void SetClockForTesting(std::function<time_t()> clock) {
  MutexLock lock(g_clock_mutex);
  g_clock = std::move(clock);
  g_clock_injected.store(static_cast<bool>(g_clock), std::memory_order_release);
}

}  // namespace fw

void TimeSince70ToMordel(time_t t, char* out) {
  // Every row an interval creates stamps its start, and instance rows stamp seconds that
  // repeat: the last answer is kept per thread, keyed also by the zone tzset last set (which
  // is all localtime_r follows).
  thread_local struct {
    bool valid = false;
    time_t t = 0;
    long zone = 0;
    int daylight = 0;
    char text[16];
  } last;
  if (last.valid && last.t == t && last.zone == timezone && last.daylight == daylight) {
    std::memcpy(out, last.text, 16);
    return;
  }
  struct tm local;
  if (localtime_r(&t, &local) == nullptr) {
    std::memset(out, '0', 16);
    return;
  }
  // Wide enough for any int fields, so an out-of-range year cannot overflow; only 16 are kept.
  char text[80];
  snprintf(text, sizeof(text), "%03d%02d%02d%02d%02d%02d000", local.tm_year, local.tm_mon + 1,
           local.tm_mday, local.tm_hour, local.tm_min, local.tm_sec);
  std::memcpy(out, text, 16);
  std::memcpy(last.text, text, 16);
  last.t = t;
  last.zone = timezone;
  last.daylight = daylight;
  last.valid = true;
}

time_t MordelToTimeSince70(const char* text) {
  if (text == nullptr) {
    return -1;
  }
  // Timestamps live in fixed-width fields without a terminator.
  char field[17];
  std::size_t len = 0;
  while (len < 16 && text[len] != '\0') {
    field[len] = text[len];
    ++len;
  }
  field[len] = '\0';
  struct tm local;
  std::memset(&local, 0, sizeof(local));
  if (sscanf(field, "%3d%2d%2d%2d%2d%2d", &local.tm_year, &local.tm_mon, &local.tm_mday,
             &local.tm_hour, &local.tm_min, &local.tm_sec) != 6) {
    return -1;
  }
  local.tm_mon -= 1;
  local.tm_isdst = -1;
  return mktime(&local);
}

int64_t QbrmBestGetCurrentTime() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<int64_t>(ts.tv_sec) * 1000000000 + ts.tv_nsec;
}
