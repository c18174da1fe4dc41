// A loop that is to run at a fixed rate.
#pragma once

#include <sys/time.h>

#include <cstdint>

// On 32-bit systems flags decide the size of time_t and timeval, which must be that of the library.
static_assert(sizeof(time_t) == 8 && sizeof(timeval) == 16,
              "compile with -D_FILE_OFFSET_BITS=64 -D_TIME_BITS=64, as the library is");

// Paces one thread: each Delay() is one tick. Ticks are counted from where the last one was
// planned, not from where it ended, so that what a sleep is late by does not add up. A plain value,
// to be copied at will; not shared between threads.
class DelayTimer {
 public:
  // Begins timing. usec is the microseconds from tick to tick.
  explicit DelayTimer(int32_t usec);

  // Makes now the last tick.
  void BeginTiming();

  // Leaves the last tick where it is.
  void SetDelayTime(int32_t usec);

  // Sleeps until the interval since the last tick is over. When it is already, or the clock was set
  // back, returns at once, having yielded the processor, and counts on from now.
  void Delay();

 private:
  int32_t m_usecDelay;
  timeval m_tvLast;  // tv_sec 0: timing has not begun
};
