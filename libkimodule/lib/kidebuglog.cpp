#include "kidebuglog.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/time.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <ctime>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "basename.h"
#include "fileops.h"
#include "fileutils.h"
#include "kiflock.h"
#include "settings.h"
#include "utils.h"

pid_t g_DbgLogPid = 0;

// --- Names ---

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

// --- The log writer ---

namespace {

constexpr int LOG_LOCK_TIMEOUT_SEC = 120;
constexpr int FIELD_SIZE = 128;
constexpr size_t LINE_SIZE = 1024;

const char* KiGetLogFilePath(LOG_TYPE LogType) {
  switch (LogType) {
    case KI_LOG:
      return "/var/log/camveld/camveld.log";
    case NOTIFICATION_LOG:
      return "/var/log/camveld/kinotification.log";
  }
  return nullptr;
}

bool LogInMs() {
  const KiDbgLogCfg* pCfg = g_pDbgLogCfg;
  return pCfg != nullptr && pCfg->LogInMs();
}

// Writes the local time to szTime (FIELD_SIZE bytes), or leaves it unchanged if the clock cannot be
// converted. The month has its English name in every locale. Returns szTime.
const char* KiGetPresentTime(char* szTime) {
  static const char* const rgFormat[] = {"Jan %e %T", "Feb %e %T", "Mar %e %T", "Apr %e %T",
                                         "May %e %T", "Jun %e %T", "Jul %e %T", "Aug %e %T",
                                         "Sep %e %T", "Oct %e %T", "Nov %e %T", "Dec %e %T"};
  timeval tvNow;
  tm Local;
  gettimeofday(&tvNow, nullptr);
  if (localtime_r(&tvNow.tv_sec, &Local) == nullptr) {
    return szTime;
  }
  const size_t Len = strftime(szTime, FIELD_SIZE, rgFormat[Local.tm_mon], &Local);
  if (LogInMs()) {
    snprintf(szTime + Len, FIELD_SIZE - Len, ".%03ld", static_cast<long>(tvNow.tv_usec / 1000));
  }
  return szTime;
}

void ReportLostLine(int LineNo, const char* szStep) {
  syslog(LOG_ERR, "%s:%d:%s(): %s kilog file failed with errno [%d].", __FILE__, LineNo, "KiPrintf",
         szStep, errno);
}

// Opens and locks the log file. Returns its descriptor, or -1 after reporting the reason.
int OpenLog(LOG_TYPE LogType) {
  const char* szPath = KiGetLogFilePath(LogType);
  if (szPath == nullptr) {
    errno = EINVAL;
    ReportLostLine(__LINE__, "open");
    return -1;
  }
  const int Fd = open(szPath, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
  if (Fd == -1) {
    ReportLostLine(__LINE__, "open");
    return -1;
  }
  if (KiFlock::Lock(Fd, LOG_LOCK_TIMEOUT_SEC, true) != 0) {
    ReportLostLine(__LINE__, "lock");
    close(Fd);
    return -1;
  }
  return Fd;
}

// Where a message comes from, as the caller of the log gives it.
struct Origin {
  const char* szCateg;
  const char* szLevel;
  const char* szFile;
  int LineNo;
  const char* szFunc;
};

// The fields before the message of a line. The texts belong to the caller of the log.
struct LinePrefix {
  char szTime[FIELD_SIZE] = "";
  char szPidTid[FIELD_SIZE] = "";
  char szCategLevel[FIELD_SIZE] = "";
  const char* szFile = "";
  int LineNo = 0;
  const char* szFunc = "";
};

constexpr char PREFIX_FORMAT[] = "%s %s%s %s:%d:%s(): ";

// Call with the lock held: the lines of a file must be in the order of their times.
LinePrefix MakePrefix(const Origin& From) {
  LinePrefix Prefix;
  const pid_t Pid = getpid();
  const pid_t Tid = gettid();
  KiGetPresentTime(Prefix.szTime);
  if (Pid == Tid) {
    snprintf(Prefix.szPidTid, FIELD_SIZE, "[%d]", Pid);
  } else {
    snprintf(Prefix.szPidTid, FIELD_SIZE, "[%d][%d]", Pid, Tid);
  }
  if (From.szCateg != nullptr && From.szLevel != nullptr) {
    snprintf(Prefix.szCategLevel, FIELD_SIZE, "[%s][%s]", From.szCateg, From.szLevel);
  }
  Prefix.szFile = From.szFile + BaseNameOffset(From.szFile);
  Prefix.LineNo = From.LineNo;
  Prefix.szFunc = From.szFunc;
  return Prefix;
}

// Formats a line into szLine (LINE_SIZE bytes). Errno is for "%m". Returns the length, or 0 if the
// line does not fit or snprintf cannot format it completely.
__attribute__((format(printf, 4, 0))) size_t FormatLine(char* szLine, const LinePrefix& Prefix,
                                                        int Errno, const char* szFormat,
                                                        va_list Args) {
  const auto PrefixLen = static_cast<size_t>(
      snprintf(szLine, LINE_SIZE, PREFIX_FORMAT, Prefix.szTime, Prefix.szPidTid,
               Prefix.szCategLevel, Prefix.szFile, Prefix.LineNo, Prefix.szFunc));
  if (PrefixLen >= LINE_SIZE) {  // so is the -1 of a failure, as a size_t
    return 0;
  }
  const size_t Left = LINE_SIZE - PrefixLen;
  errno = Errno;
  const auto MessageLen = static_cast<size_t>(vsnprintf(szLine + PrefixLen, Left, szFormat, Args));
  return MessageLen < Left ? PrefixLen + MessageLen : 0;
}

// Needs no heap and one write. Unlocks and closes Fd.
void WriteAtOnce(int Fd, const char* szLine, size_t Len) {
  fileops::WriteAll(Fd, szLine, Len);  // deliberately not reported: a full disk
  KiFlock::UnLock(Fd);
  close(Fd);
}

// Writes a line of any length, and as much as can be formatted. Unlocks and closes Fd.
__attribute__((format(printf, 4, 0))) void WriteThroughStream(int Fd, const LinePrefix& Prefix,
                                                              int Errno, const char* szFormat,
                                                              va_list Args) {
  FILE* pStream = fdopen(Fd, "a");
  if (pStream == nullptr) {
    ReportLostLine(__LINE__, "fdopen");
    close(Fd);
    return;
  }
  fprintf(pStream, PREFIX_FORMAT, Prefix.szTime, Prefix.szPidTid, Prefix.szCategLevel,
          Prefix.szFile, Prefix.LineNo, Prefix.szFunc);
  errno = Errno;
  vfprintf(pStream, szFormat, Args);
  fflush(pStream);
  KiFlock::UnLock(Fd);
  fclose(pStream);
}

// Writes one line and keeps the caller's errno, which "%m" in the message gives. Call with thread
// cancellation disabled.
__attribute__((format(printf, 3, 0))) void WriteLine(LOG_TYPE LogType, const Origin& From,
                                                     const char* szFormat, va_list Args) {
  const fileops::ErrnoKeeper Errno;
  const int Fd = OpenLog(LogType);
  if (Fd == -1) {
    return;
  }
  const LinePrefix Prefix = MakePrefix(From);
  char szLine[LINE_SIZE];
  va_list Copy;
  va_copy(Copy, Args);
  const size_t Len = FormatLine(szLine, Prefix, Errno.Get(), szFormat, Copy);
  va_end(Copy);
  if (Len > 0) {
    WriteAtOnce(Fd, szLine, Len);
  } else {
    WriteThroughStream(Fd, Prefix, Errno.Get(), szFormat, Args);
  }
}

}  // namespace

void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...) {
  pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
  va_list Args;
  va_start(Args, szFormat);
  WriteLine(LogType, {szCateg, szLevel, szFile, LineNo, szFunc}, szFormat, Args);
  va_end(Args);
  pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, nullptr);
}

void KiDbgPrintf(LOG_CATEG Categ, LOG_LEVEL Level, const char* szFile, int LineNo,
                 const char* szFunc, const char* szFormat, ...) {
  const char* szCateg = Enum2String(Categ);  // the first call may throw: it fills the map
  const char* szLevel = Enum2String(Level);
  const fileops::NoCancel Guard;
  va_list Args;
  va_start(Args, szFormat);
  WriteLine(KI_LOG, {szCateg, szLevel, szFile, LineNo, szFunc}, szFormat, Args);
  va_end(Args);
}

// --- The shared configuration ---

namespace {

// Programs that were linked to the first packages of version 1.0.0 call these members in the shared
// library. The pointers make the compiler emit them, although the header defines them inline.
[[gnu::used]] constexpr LOG_LEVEL (KiDbgLogCfg::*GET_LOG_LEVEL)(LOG_CATEG) const =
    &KiDbgLogCfg::GetLogLevel;
[[gnu::used]] constexpr LOG_LEVEL (KiDbgLogCfg::*GET_PID_LEVEL)(pid_t) const =
    &KiDbgLogCfg::GetPidLevel;

constexpr const char* LEVELS_KEY = "ki_dbglog_settings";  // by category, separated by commas
constexpr const char* IN_MS_KEY = "ki_dbglog_time_scale";

}  // namespace

void KiDbgLogCfg::Init(int /*ShmKey*/) {
  SetLogInMs(false);
  for (int Categ = 0; Categ < LOG_CATEG_TOTAL; ++Categ) {
    SetLogLevel(static_cast<LOG_CATEG>(Categ), LOG_LEVEL_NOTICE);
  }
  for (__PidDbgLevel& Entry : m_PidLevels) {
    Store(Entry.Pid, 0);
    Store(Entry.Level, LOG_LEVEL_ALARM);
  }
  SetUsedPids(0);
  LoadDbgLogSettings();
}

void KiDbgLogCfg::Free() {}

int KiDbgLogCfg::LoadDbgLogSettings() {
  std::map<std::string, std::string> KeyVals;
  const int Ret = KiFileGetKeyVals(SETTINGS_FILE, {LEVELS_KEY, IN_MS_KEY}, KeyVals);
  if (const auto It = KeyVals.find(LEVELS_KEY); It != KeyVals.end()) {
    int Categ = 0;
    for (const int32_t Level : String2IntVector(It->second, ",")) {
      SetLogLevel(static_cast<LOG_CATEG>(Categ++), static_cast<LOG_LEVEL>(Level));
    }
  }
  if (const auto It = KeyVals.find(IN_MS_KEY); It != KeyVals.end()) {
    SetLogInMs(It->second == "yes");
  }
  return Ret;
}

int KiDbgLogCfg::SaveDbgLogSettings() const {
  std::string strLevels;
  for (int Categ = 0; Categ < LOG_CATEG_TOTAL; ++Categ) {
    strLevels += (Categ == 0 ? "" : ",") + itos(GetLogLevel(static_cast<LOG_CATEG>(Categ)));
  }
  return KiFileSetVals(SETTINGS_FILE,
                       {{LEVELS_KEY, strLevels}, {IN_MS_KEY, LogInMs() ? "yes" : "no"}}, true);
}

void KiDbgLogCfg::SetLogLevel(LOG_CATEG Categ, LOG_LEVEL Level) {
  if (IsCateg(Categ)) {
    Store(m_LogLevels[Categ], Level);
  }
}

bool KiDbgLogCfg::LogInMs() const { return Load(m_blLogInMs) != 0; }

void KiDbgLogCfg::SetLogInMs(bool blLogInMs) { Store<uint8_t>(m_blLogInMs, blLogInMs ? 1 : 0); }

LOG_LEVEL KiDbgLogCfg::FindPidLevel(pid_t Pid) const {
  const int Idx = FindPid(Pid, UsedPids());
  return Idx == -1 ? LOG_LEVEL_ALARM : Load(m_PidLevels[Idx].Level);
}

int KiDbgLogCfg::GetPidLevel(int Idx, pid_t& Pid, LOG_LEVEL& Level) const {
  if (Idx < 0 || Idx >= UsedPids()) {
    return -1;
  }
  Pid = Load(m_PidLevels[Idx].Pid);
  Level = Load(m_PidLevels[Idx].Level);
  return 0;
}

void KiDbgLogCfg::SetPidLevel(pid_t Pid, LOG_LEVEL Level) {
  const int Count = UsedPids();
  const int Idx = FindPid(Pid, Count);
  if (Idx != -1) {
    Store(m_PidLevels[Idx].Level, Level);
  } else if (Count < MAX_PIDS) {
    Store(m_PidLevels[Count].Pid, Pid);
    Store(m_PidLevels[Count].Level, Level);
    SetUsedPids(Count + 1);
  }
}

void KiDbgLogCfg::ClearPid(pid_t Pid) {
  const int Count = UsedPids();
  int Idx = FindPid(Pid, Count);
  if (Idx == -1) {
    return;
  }
  for (; Idx + 1 < Count; ++Idx) {
    Store(m_PidLevels[Idx].Pid, Load(m_PidLevels[Idx + 1].Pid));
    Store(m_PidLevels[Idx].Level, Load(m_PidLevels[Idx + 1].Level));
  }
  SetUsedPids(Count - 1);
}

// Other processes write the count, so limit it to the table.
int KiDbgLogCfg::UsedPids() const {
  return std::clamp(__atomic_load_n(&m_PidCnt, __ATOMIC_ACQUIRE), 0, MAX_PIDS);
}

// A reader that sees the new count also sees the entries that it covers.
void KiDbgLogCfg::SetUsedPids(int Count) { __atomic_store_n(&m_PidCnt, Count, __ATOMIC_RELEASE); }

// The index of the first of Count entries that is Pid's, or -1.
int KiDbgLogCfg::FindPid(pid_t Pid, int Count) const {
  for (int Idx = 0; Idx < Count; ++Idx) {
    if (Load(m_PidLevels[Idx].Pid) == Pid) {
      return Idx;
    }
  }
  return -1;
}

int KiShmDbgLogIPCKey() { return 0x18180004; }

KiDbgLogCfg* KiShmDbgLogCfgAt() { return ShmAt<KiDbgLogCfg>(KiShmDbgLogIPCKey()); }
