// A daemon of the package. Logs a line at the interval, in milliseconds, that the package's
// settings give. Ends on SIGTERM, after the current interval.

#include <delaytimer.h>
#include <fileutils.h>
#include <kidebuglog.h>
#include <signal.h>

#include <cstdlib>
#include <string>

static volatile sig_atomic_t g_blEnd = 0;

static void OnTerm(int /*Signal*/) { g_blEnd = 1; }

int main() {
  std::string strInterval;
  KiFileGetVal("/var/packages/Camveld/etc/settings.conf", "exampled_interval", strInterval);
  const auto Interval = static_cast<int>(strtol(strInterval.c_str(), nullptr, 10));
  if (Interval < 1 || Interval > 60000) {
    KIDBGLOG(LOG_CATEG_EVENT, LOG_LEVEL_ERROR, "Bad interval [%s]\n", strInterval.c_str());
    return EXIT_FAILURE;
  }
  signal(SIGTERM, OnTerm);
  DelayTimer Timer(Interval * 1000);
  while (!g_blEnd) {
    KIDBGLOG(LOG_CATEG_EVENT, LOG_LEVEL_NOTICE, "Tick\n");
    Timer.Delay();
  }
  KIDBGLOG(LOG_CATEG_EVENT, LOG_LEVEL_NOTICE, "End\n");
}
