#include "delaytimer.h"

#include <sched.h>

#include "sleep.h"
#include "utils.h"

namespace {

constexpr int64_t USEC_PER_SEC = 1000000;

}  // namespace

DelayTimer::DelayTimer(int32_t usec) : m_usecDelay(usec), m_tvLast() { BeginTiming(); }

void DelayTimer::BeginTiming() { gettimeofday(&m_tvLast, nullptr); }

void DelayTimer::SetDelayTime(int32_t usec) { m_usecDelay = usec; }

void DelayTimer::Delay() {
  if (m_tvLast.tv_sec == 0) {
    BeginTiming();
  }
  timeval tvNow;
  gettimeofday(&tvNow, nullptr);
  const auto usecPassed = static_cast<int32_t>(GetTimeDiffUSec(m_tvLast, tvNow));
  if (usecPassed < 0 || usecPassed >= m_usecDelay) {
    m_tvLast = tvNow;
    sched_yield();
    return;
  }
  const int64_t usecNext = int64_t{m_tvLast.tv_usec} + m_usecDelay;
  m_tvLast.tv_sec += USecToSec(usecNext);
  m_tvLast.tv_usec = static_cast<decltype(m_tvLast.tv_usec)>(usecNext % USEC_PER_SEC);
  SleepWhole(m_usecDelay - usecPassed);
}
