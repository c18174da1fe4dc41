#include "kidb.h"

#include <map>
#include <memory>
#include <mutex>

#include "fileops.h"
#include "kidebuglog.h"

namespace {

std::mutex gDBMutex[KiDB::DBI_CNT];

struct ConnectionCloser {
  void operator()(DBConnect* pConn) const { ZAMODBClose(pConn); }
};
using Connection = std::unique_ptr<DBConnect, ConnectionCloser>;

}  // namespace

namespace KiDB {

// Leaves both outputs unchanged if the instance is unknown.
static void GetDBInfo(DB_INSTANCE DBInstance, std::string& strDBName, int& MutexIdx) {
  switch (DBInstance) {
    case DBI_SYSTEM:
      strDBName = "/var/packages/Camveld/target/system.db";
      MutexIdx = 0;
      break;
    case DBI_RECORDING:
      strDBName = "/var/services/camveld/recording.db";
      MutexIdx = 1;
      break;
    case DBI_CNT:
      break;
  }
}

static void ReplaceBoolForSqlite(std::string& strCmd) {
  const std::map<std::string, std::string> BoolStrMap = {
      {"false", "0"}, {"FALSE", "0"}, {"true", "1"}, {"TRUE", "1"}};
  bool blReplaced = false;
  for (const auto& [strWord, strDigit] : BoolStrMap) {
    // Continue at the replacement: a digit cannot be part of another word.
    size_t Pos = strCmd.find(strWord);
    while (Pos != std::string::npos) {
      strCmd.replace(Pos, strWord.size(), strDigit);
      blReplaced = true;
      Pos = strCmd.find(strWord, Pos);
    }
  }
  if (blReplaced) {
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
             "Got sql cmd with bool replaced: %s\n", strCmd.c_str());
  }
}

static Connection KiDBConnect(const std::string& strDBName) {
  // The user name is ignored, but callers always pass this one.
  return Connection(ZAMODBConnect(nullptr, "postgres", nullptr, strDBName.c_str()));
}

int Execute(DB_INSTANCE DBInstance, std::string strCommand, DBResult_tag** ppResult,
            bool blReplaceBoolForSqlite) {
  int MutexIdx = 0;
  std::string strDBName;
  GetDBInfo(DBInstance, strDBName, MutexIdx);
  if (blReplaceBoolForSqlite) {
    ReplaceBoolForSqlite(strCommand);
  }

  // Were the thread cancelled in SQLite, the database would stay locked.
  const fileops::NoCancel Guard;
  const std::lock_guard<std::mutex> Lock(gDBMutex[MutexIdx]);
  const Connection pConn = KiDBConnect(strDBName);
  if (pConn == nullptr) {
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
             "Failed to connect to db[%d, %s].\n", DBInstance, strDBName.c_str());
    return -1;
  }
  strCommand = "BEGIN;" + strCommand + ";COMMIT;";
  if (ZAMODBExecute(pConn.get(), strCommand.c_str(), ppResult) != 0) {
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
             "Failed to execute db[%d] cmd: %s.\n", DBInstance, strCommand.c_str());
    return -1;
  }
  return 0;
}

void KiDBFreeResult(DBResult_tag* pResult) { ZAMODBFreeResult(pResult); }

}  // namespace KiDB
