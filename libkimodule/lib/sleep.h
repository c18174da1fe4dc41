// Sleeps although signals arrive. For the library itself; not installed.
#pragma once

#include <cerrno>
#include <cstdint>
#include <ctime>

// Sleeps usec microseconds. Goes on with the rest after a signal.
inline void SleepWhole(int64_t usec) {
  timespec Left = {};
  Left.tv_sec = static_cast<time_t>(usec / 1000000);
  Left.tv_nsec = static_cast<long>(usec % 1000000 * 1000);
  while (nanosleep(&Left, &Left) != 0 && errno == EINTR) {
  }
}
