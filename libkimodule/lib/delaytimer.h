// Runs a loop at a fixed rate.
#pragma once

#include <sys/time.h>

#include <cstdint>

// On 32-bit systems compiler flags decide the size of time_t and timeval. The library and its users
// must have the same.
static_assert(sizeof(time_t) == 8 && sizeof(timeval) == 16,
              "compile with -D_FILE_OFFSET_BITS=64 -D_TIME_BITS=64, as the library is");

// Paces one thread: each Delay() is one tick. The interval starts when the last tick was due, not
// when it ended, so that delays do not add up. An object can be copied. Threads must not share one.
class DelayTimer {
 public:
  // Begins timing. usec is the interval between ticks in microseconds.
  explicit DelayTimer(int32_t usec);

  // Sets the last tick to now.
  void BeginTiming();

  // Changes the interval. Does not change the last tick.
  void SetDelayTime(int32_t usec);

  // Sleeps until the interval since the last tick is over. If it is over already, or if the clock
  // was set back, yields the processor, returns at once and sets the last tick to now.
  void Delay();

 private:
  int32_t m_usecDelay;
  timeval m_tvLast;  // tv_sec 0: timing has not begun
};
