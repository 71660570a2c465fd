#pragma once

// Time for the framework and the agent: the wall clock (injectable for tests), the framework
// timestamp form and the processing timer.
//
// Framework timestamp: 16 characters in local time: the years since 1900 as three digits, then
// month, day, hour, minute and second as two digits each, then "000". 1 January 2009 00:00:00
// is "1090101000000000".
//
// Thread safety: all callable from any thread; SetClockForTesting only in tests, before threads
// that read the clock exist.

#include <cstdint>
#include <ctime>
#include <functional>

namespace fw {

// Seconds since 1970 from the injected clock, or time() when none is injected.
time_t Now();

// Replaces the wall clock; an empty function restores time().
void SetClockForTesting(std::function<time_t()> clock);

// The wall clock and waiting as an object, for the code that polls or waits: it is handed a
// Clock, and tests hand it one whose waits are short, so polls run without real waiting.
// Thread safety: a Clock's functions may be called from any thread.
class Clock {
 public:
  virtual ~Clock() = default;
  // Seconds since 1970 (Now()).
  virtual time_t now() const;
  // Waits ms milliseconds.
  virtual void sleep(unsigned long ms) const;
};

// The process's clock: Now() and real waits.
const Clock& SystemClock();

}  // namespace fw

// Writes t as a framework timestamp into out[0..15], without a terminator.
void TimeSince70ToMordel(time_t t, char* out);

// Reads the first 16 characters of a framework timestamp (the last three are ignored) as local
// time. Returns -1 when the text does not hold six numbers.
time_t MordelToTimeSince70(const char* text);

// Monotonic processing timer in nanoseconds.
int64_t QbrmBestGetCurrentTime();
