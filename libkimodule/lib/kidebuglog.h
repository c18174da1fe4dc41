// The package's log: one call appends one line to a log file that all of its processes share.
#pragma once

#include "enumtostr.h"

// Which log file a line goes to.
enum LOG_TYPE : int {
  KI_LOG = 0,            // /var/log/camveld/camveld.log
  NOTIFICATION_LOG = 1,  // /var/log/camveld/kinotification.log
};

// How severe a message is: the smaller, the more.
enum LOG_LEVEL : int {
  LOG_LEVEL_ALARM = 0,
  LOG_LEVEL_ERROR = 1,
  LOG_LEVEL_WARN = 2,
  LOG_LEVEL_NOTICE = 3,
  LOG_LEVEL_INFO = 4,
  LOG_LEVEL_DEBUG = 5,
  LOG_LEVEL_DEBUG2 = 6,
  LOG_LEVEL_DEBUG3 = 7,
  LOG_LEVEL_TOTAL = 8,  // how many there are, not a level
};

// Which component of the package a message comes from.
enum LOG_CATEG : int {
#define LOG_CATEG_ENTRY(Categ, Value, szName) Categ = (Value),
#include "logcateg.def"
  LOG_CATEG_TOTAL = 88,  // how many there are, not a category
  LOG_CATEG_MAX = 512,   // how many there may ever be
};

// The names that stand for them in log lines, as Enum2String gives them.
template <>
KiEnum2StrMap<LOG_LEVEL>::KiEnum2StrMap();
template <>
KiEnum2StrMap<LOG_CATEG>::KiEnum2StrMap();

class KiDbgLogCfg;

// The debug-log configuration that all processes share, null while none is attached.
extern KiDbgLogCfg* g_pDbgLogCfg;

// Appends one line to the log file of LogType: local time, process id (and thread id, from a thread
// other than the main one), "[szCateg][szLevel]" when both are given, the base name of szFile,
// LineNo and szFunc, then the message. Adds no line feed: szFormat ends in one.
//
// Writes under an exclusive lock on the file, waiting up to 120 seconds for it, so the lines of all
// threads and processes stay whole and in the order of their times. The file is opened for this
// call alone and created (mode 0666 less the umask) when missing; its directory is not. A line that
// cannot be written is lost after one syslog record (LOG_ERR) that says why. Any thread may call
// it; thread cancellation is disabled meanwhile and always enabled on return.
void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 7, 8)));
