#include "kidebuglog.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/time.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <ctime>

#include "kiflock.h"
#include "utils.h"

KiDbgLogCfg* g_pDbgLogCfg = nullptr;

template <>
KiEnum2StrMap<LOG_LEVEL>::KiEnum2StrMap()
    : m_szMap{
          {LOG_LEVEL_ALARM, "alarm"},   {LOG_LEVEL_ERROR, "error"},   {LOG_LEVEL_WARN, "warn"},
          {LOG_LEVEL_NOTICE, "notice"}, {LOG_LEVEL_INFO, "info"},     {LOG_LEVEL_DEBUG, "debug"},
          {LOG_LEVEL_DEBUG2, "debug2"}, {LOG_LEVEL_DEBUG3, "debug3"},
      } {}

template <>
KiEnum2StrMap<LOG_CATEG>::KiEnum2StrMap()
    : m_szMap{
#define LOG_CATEG_ENTRY(Categ, Value, szName) {Categ, szName},
#include "logcateg.def"
      } {
}

namespace {

constexpr int LOG_LOCK_TIMEOUT_SEC = 120;
constexpr int FIELD_SIZE = 128;

const char* KiGetLogFilePath(LOG_TYPE LogType) {
  switch (LogType) {
    case KI_LOG:
      return "/var/log/camveld/camveld.log";
    case NOTIFICATION_LOG:
      return "/var/log/camveld/kinotification.log";
  }
  return nullptr;
}

// Fills the FIELD_SIZE bytes of szTime, or leaves them empty when the clock cannot be converted.
const char* KiGetPresentTime(char* szTime) {
  timeval tvNow;
  tm Local;
  gettimeofday(&tvNow, nullptr);
  if (localtime_r(&tvNow.tv_sec, &Local) != nullptr) {
    strftime(szTime, FIELD_SIZE, "%b %e %T", &Local);
  }
  return szTime;
}

void ReportLostLine(int LineNo, const char* szStep) {
  syslog(LOG_ERR, "%s:%d:%s(): %s kilog file failed with errno [%d].", __FILE__, LineNo, "KiPrintf",
         szStep, errno);
}

// Opens and locks the log file, or reports why it cannot and returns null.
FILE* OpenLog(LOG_TYPE LogType) {
  const char* szPath = KiGetLogFilePath(LogType);
  errno = EINVAL;  // what a type without a path is reported with
  const int Fd =
      szPath == nullptr ? -1 : open(szPath, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
  if (Fd == -1) {
    ReportLostLine(__LINE__, "open");
    return nullptr;
  }
  FILE* pStream = fdopen(Fd, "a");
  if (pStream == nullptr) {
    ReportLostLine(__LINE__, "fdopen");
    close(Fd);
    return nullptr;
  }
  if (KiFlock::Lock(Fd, LOG_LOCK_TIMEOUT_SEC, true) != 0) {
    ReportLostLine(__LINE__, "lock");
    fclose(pStream);
    return nullptr;
  }
  return pStream;
}

// The time is read here, under the lock, so that the lines of a file stand in the order of their
// times.
void WritePrefix(FILE* pStream, const char* szCateg, const char* szLevel, const char* szFile,
                 int LineNo, const char* szFunc) {
  char szTime[FIELD_SIZE] = "";
  char szPidTid[FIELD_SIZE] = "";
  char szCategLevel[FIELD_SIZE] = "";
  const pid_t Pid = getpid();
  const pid_t Tid = gettid();
  if (Pid == Tid) {
    snprintf(szPidTid, sizeof(szPidTid), "[%d]", Pid);
  } else {
    snprintf(szPidTid, sizeof(szPidTid), "[%d][%d]", Pid, Tid);
  }
  if (szCateg != nullptr && szLevel != nullptr) {
    snprintf(szCategLevel, sizeof(szCategLevel), "[%s][%s]", szCateg, szLevel);
  }
  fprintf(pStream, "%s %s%s %s:%d:%s(): ", KiGetPresentTime(szTime), szPidTid, szCategLevel,
          GetBaseName(szFile).c_str(), LineNo, szFunc);
}

}  // namespace

void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...) {
  pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
  if (FILE* pStream = OpenLog(LogType)) {
    WritePrefix(pStream, szCateg, szLevel, szFile, LineNo, szFunc);
    va_list Args;
    va_start(Args, szFormat);
    vfprintf(pStream, szFormat, Args);
    va_end(Args);
    fflush(pStream);
    KiFlock::UnLock(fileno(pStream));
    fclose(pStream);
  }
  pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, nullptr);
}
