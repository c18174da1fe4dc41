// The fuzzers, one a program: FUZZ is the function that it runs. An input is three texts, parted by
// "\|".

#include <fuzzer/FuzzedDataProvider.h>
#include <sqlite3.h>

#include <bitset>
#include <filesystem>
#include <fstream>
#include <optional>
#include <regex>

#include "fileutils.h"
#define main TesselUpgraderMain
#include "tesselupgrader.cpp"  // NOLINT(bugprone-suspicious-include)

using std::string;

static const char NAME[] = "/var/packages/Camveld/target/system.db", EQUAL[] = "/var/equal.db";

// What does not hold ends the program, which then shows where, and keeps the input.
static void Check(bool blHolds) {
  if (!blHolds) {
    abort();
  }
}

static string ReadFile(const char* szFile) {
  std::ifstream File(szFile);
  return string(std::istreambuf_iterator<char>(File), {});
}

static string UpToNul(const string& strText) { return strText.substr(0, strText.find('\0')); }

static string Hex(const string& strBytes, const char* szDigits = "0123456789ABCDEF") {
  string strHex;
  for (const char Byte : strBytes) {
    strHex += {szDigits[Byte >> 4 & 15], szDigits[Byte & 15]};
  }
  return strHex;
}

// Key-value files: what a slow reader finds, and what changes make of it.
void KeyVal(const string& strKey, const string& strVal, const string& strText) {
  static const std::regex Pair("([^=]*)=(?:[^\"]*\"([^\n]*)\"[^\"]*|([^\n]*))");
  std::map<string, string> KeyVals, Is;
  std::istringstream Lines(strText);
  std::smatch Match;
  int Count = 0;
  for (string strLine; std::getline(Lines, strLine);) {
    if (std::regex_match(strLine, Match, Pair)) {
      KeyVals.emplace(Match[1], Match[2].str() + Match[3].str());
      ++Count;
    }
  }
  std::ofstream(NAME) << strText;
  Check(KiFileGetAllKeyVals(NAME, Is) == Count && Is == KeyVals);
  if ((strKey + strVal).find('\n') != string::npos || strKey.find('=') != string::npos) {
    return;
  }
  KeyVals[strKey] = strVal;
  Check(KiFileSetVals(NAME, {{strKey, strVal}}, true) == 0);
  const string strOnce = ReadFile(NAME);
  Check(KiFileGetAllKeyVals(NAME, Is) == static_cast<int>(Is.size()) && Is == KeyVals);
  Check(KiFileSetVals(NAME, {{strKey, strVal}}, true) == 0 && ReadFile(NAME) == strOnce);
  string strPlain;
  KeyVals.erase(strKey);
  for (const auto& [strOther, strOtherVal] : KeyVals) {
    strPlain.append(strOther).append("=").append(strOtherVal).append("\n");
  }
  Check(KiFileRemoveKeys(NAME, {strKey}) == 0 && ReadFile(NAME) == strPlain);
}

// Capability files: one key, and every byte of the others.
void CapKeys(const string& strKey, const string& strVal, const string& strText) {
  if (!std::regex_match(strKey, std::regex("\\w+")) || strVal.find('\n') != string::npos) {
    return;
  }
  const std::regex Own("[ \t]*" + strKey + "[ \t]*=[ \t]*(?:\"([^\n]*)\"|([^\n]*?))[ \t]*\r?");
  const string strNew = strKey + "= " + UpToNul(strVal);
  string strSet, strRemoved, strValue, strLine;
  std::smatch Match;
  int Found = 0;
  for (std::istringstream Lines(strText); std::getline(Lines, strLine);) {
    if (std::regex_match(strLine, Match, Own)) {
      strValue = Found == 0 ? Match[1].str() + Match[2].str() : strValue;
      strSet += Found++ == 0 ? strNew + "\n" : "";
    } else {
      strLine += Lines.eof() ? "" : "\n";
      strSet += strLine;
      strRemoved += strLine;
    }
  }
  if (Found == 0) {
    strSet += (strSet.empty() || strSet.back() == '\n' ? "" : "\n") + strNew + "\n";
  }
  const auto Holds = [szKey = strKey.c_str()](const string& strIs, const string& strFile) {
    char szValue[8];
    const int Len = ZAMOCFileGetKeyValue(NAME, szKey, szValue, sizeof(szValue), 0);
    return Len == static_cast<int>(strIs.size()) && UpToNul(strIs.substr(0, 7)) == szValue &&
           ReadFile(NAME) == strFile;
  };
  std::ofstream(NAME) << strText;
  Check(Holds(strValue, strText));
  for (int Time = 0; Time < 2; ++Time) {
    ZAMOCFileSetKeyValue(NAME, strKey.c_str(), strVal.c_str(), "%s= %s\n");
    Check(std::regex_match(strNew, Match, Own) && Holds(Match[1].str() + Match[2].str(), strSet));
  }
  std::ofstream(NAME) << strText;
  Check(ZAMOCFileRemoveKey(NAME, strKey.c_str()) == (Found > 0 ? 1 : 0) && Holds("", strRemoved));
}

// Rows, by column, of the statement that runs and of the last one that yielded columns.
static std::vector<std::map<string, string>> gRows;
static std::optional<decltype(gRows)> gResult;

static string Cell(const char* szValue) { return szValue == nullptr ? "" : string("=") + szValue; }

static int AddRow(void* /*pUnused*/, int Count, char** pValues, char** pNames) {
  gRows.emplace_back();
  for (int Column = 0; Column < Count; ++Column) {
    string strName = pNames[Column];
    std::transform(strName.begin(), strName.end(), strName.begin(), tolower);
    gRows.back().emplace(strName, Cell(pValues[Column]));
  }
  return 0;
}

static int EndStatement(unsigned /*Event*/, void* /*pUnused*/, void* pStatement, void* /*pTime*/) {
  if (sqlite3_column_count(static_cast<sqlite3_stmt*>(pStatement)) > 0) {
    gResult = gRows;
  }
  gRows.clear();
  return 0;
}

// As ZAMODBExecute on a connection of its own; the result is in gResult.
static int Exec(const char* szFile, const string& strText) {
  sqlite3* pDb = nullptr;
  gResult.reset();
  sqlite3_open(szFile, &pDb);
  sqlite3_trace_v2(pDb, SQLITE_TRACE_PROFILE, EndStatement, nullptr);
  const int Failed = sqlite3_exec(pDb, strText.c_str(), AddRow, nullptr, nullptr);
  const int Ret = Failed == 0 && sqlite3_get_autocommit(pDb) != 0 ? 0 : -1;
  sqlite3_close(pDb);  // rolls back what is open
  return Ret;
}

// SQL texts: what sqlite3_exec makes of them on an equal database.
void Sql(const string& strFirst, const string& strSecond, const string& strThird) {
  const string strText = strFirst + strSecond + strThird;
  for (const char* szFile : {NAME, EQUAL}) {
    std::filesystem::remove(szFile);
    Exec(szFile, "CREATE TABLE t (n PRIMARY KEY CHECK (n <> 13)); INSERT INTO t VALUES (1)");
  }
  DBResult* pResult = nullptr;
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, NAME);
  const int Ret = ZAMODBExecute(pConn, strText.c_str(), &pResult);
  ZAMODBClose(pConn);
  Check(Exec(EQUAL, strText) == Ret && ReadFile(EQUAL) == ReadFile(NAME));
  Check(gResult.has_value() == (pResult != nullptr) || Ret != 0);
  Check(Ret != 0 || !gResult || gResult->size() == ZAMODBNumRows(pResult));
  for (DBRow Row = 0; ZAMODBFetchRow(pResult, &Row) == 0;) {
    for (const auto& [strName, strCell] : gResult->at(Row)) {
      Check(Cell(ZAMODBFetchField(pResult, Row, strName.c_str())) == strCell);
    }
  }
  ZAMODBFreeResult(pResult);
}

// The second output of cameras with any wiring, as text and as a blob.
void Axis(const string& strFirst, const string& strSecond, const string& strThird) {
  static const int Made =
      Exec(NAME, ReadFile(TESSEL_SOURCE_DIR "/examples/appliance.sql") +
                     "DELETE FROM camera; INSERT INTO camera (vendor, model, id_on_rec_server) "
                     "VALUES ('AXIS', 'A8105-E', 7), ('AXIS', 'A8105-E', NULL), ('AXIS', 'A', 7)");
  const string strBytes = strFirst + strSecond + strThird, strWire = UpToNul(strBytes);
  string strNew = "\2" + (strWire.size() < 2 ? "\1" : strWire.substr(1));
  if (strNew.substr(2, 1) == "\2") {
    strNew[2] = 1;
  }
  const auto Quotes = std::count(strNew.begin(), strNew.end(), '\'');
  if (Quotes > 1 || (Quotes == 1 && strNew.find_first_of(";-/\"[`") != string::npos)) {
    return;  // becomes another SQL text, whose effect is SQLite's
  }
  const string strOld = Hex(strBytes), strHex = Quotes == 0 ? Hex(strNew) : strOld;
  Check(Made == 0 && Exec(NAME,
                          "DELETE FROM camdeviceoutput; UPDATE camera SET connected_wire="
                          "iif(id = 2, x'" +
                              strOld + "', CAST(x'" + strOld + "' AS TEXT))") == 0);
  Check(UpdateAxisA8105E() == (Quotes == 0 ? 0 : -1));
  Exec(NAME,
       "SELECT group_concat(hex(connected_wire)) wires, (SELECT group_concat(cam_id || ' ' || "
       "cam_id_on_rec_server || owner_ds_id || type || idx || name) FROM camdeviceoutput) outputs "
       "FROM camera");
  Check(gResult->at(0)["wires"] == "=" + strHex + "," + strHex + "," + strOld);
  Check(gResult->at(0)["outputs"] == (Quotes == 0 ? "=1 7011DO 2,2 0011DO 2" : ""));
}

// The string helpers: slow, obvious versions.
void Utils(const string& strSet, const string& strNew, const string& strText) {
  static const string ALNUM = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  const string strZero = UpToNul(strText), strChars = UpToNul(strSet),
               strHash = strText + string(16, 'x');
  const auto IsIn = [](char It, const string& strOf) { return strOf.find(It) != string::npos; };
  string strUrl, strBase, strErased, strReplaced, strBits, strBase64, strPiece;
  for (const char It : strText) {
    const bool blStays = IsIn(It, ALNUM) || IsIn(It, "_~()*,-.") || IsIn(It, strSet);
    strUrl += IsIn(It, " \t\n\v\f\r") ? "%20" : blStays ? string(1, It) : "%" + Hex({It});
    IsIn(It, "/\\") ? strBase.clear() : strBase.push_back(It);
    strErased += It == strChars[0] ? "" : string(1, It);
    strBits += std::bitset<8>(static_cast<unsigned char>(It)).to_string();
  }
  string strIs = strText;
  StringEraseCharacter(strIs, strChars[0]);
  Check(strIs == strErased && urlEncoding(strText, strSet) == strUrl &&
        GetBaseName(strText) == strBase);
  Check(UnsignedHashToStr(reinterpret_cast<const unsigned char*>(strHash.data())) ==
        Hex(strHash.substr(0, 16), "0123456789abcdef"));

  for (size_t Pos = 0; Pos < strText.size();) {
    const bool blFound = !strSet.empty() && strText.compare(Pos, strSet.size(), strSet) == 0;
    strReplaced += blFound ? strNew : string(1, strText[Pos]);
    Pos += blFound ? strSet.size() : 1;
  }
  ReplaceSubstr(strIs = strText, strSet, strNew);
  Check(strIs == strReplaced);

  const auto IsOther = [&](char It) { return !IsIn(It, strChars); };
  const auto First = std::find_if(strText.begin(), strText.end(), IsOther);
  const auto Last = std::find_if(strText.rbegin(), std::make_reverse_iterator(First), IsOther);
  Check(Trim(strText, strChars.c_str()) == string(First, Last.base()));

  strBits.resize(8 * strZero.size());
  for (size_t Bit = 0; Bit < strBits.size(); Bit += 6) {
    strBase64 += (ALNUM + "+/")[std::bitset<6>(strBits.substr(Bit, 6) + "0000").to_ulong()];
  }
  strBase64.append(3 - (strBase64.size() + 3) % 4, '=');
  const std::unique_ptr<char, decltype(&free)> pBase64(HttpBase64Encode(strText.c_str()), free);
  Check(pBase64.get() == strBase64);

  const string strStart = strText.substr(0, strSet.size());
  const string strHex = strStart.substr(0, strStart.find_first_not_of("0123456789abcdefABCDEF"));
  const auto Low = std::stoul(("00000000" + strHex).substr(strHex.size()), nullptr, 16);
  Check(Hex2Dec(strText.data(), static_cast<int32_t>(strStart.size())) ==
        static_cast<int32_t>(Low));

  char szBuffer[9] = "xxxxxxxx";
  string strCopy = strZero.substr(0, std::max(strSet.size(), size_t{1}) - 1);
  Strncpy(szBuffer, strText.c_str(), strSet.size());
  strCopy.resize(strSet.size());
  Check(string(szBuffer, strSet.size()) == strCopy);

  std::vector<int32_t> Numbers;
  for (const char It : strZero + strChars) {
    if (IsOther(It)) {
      strPiece += It;
    } else if (!strPiece.empty()) {
      std::istringstream(strPiece) >> Numbers.emplace_back();
      strPiece.clear();
    }
  }
  Check(String2IntVector(strText, strChars) == Numbers);
}

// No text reaches beyond its database, runs for ever or depends on the time or on chance.
static int Guard(sqlite3* pDb, char** /*pszError*/, const sqlite3_api_routines* /*pApi*/) {
  const auto Deny = [](void*, int Action, const char*, const char* szFunction, const char*,
                       const char*) {
    const bool blVaries =
        Action == SQLITE_FUNCTION &&
        std::regex_search(szFunction, std::regex("random|date|time|day|epoch", std::regex::icase));
    return blVaries || Action == SQLITE_ATTACH || Action == SQLITE_PRAGMA ||
                   Action == SQLITE_CREATE_VTABLE
               ? 1
               : 0;
  };
  sqlite3_limit(pDb, SQLITE_LIMIT_LENGTH, 100000);
  sqlite3_progress_handler(
      pDb, 20000, [](void*) { return 1; }, nullptr);
  return sqlite3_set_authorizer(pDb, Deny, nullptr);
}

extern "C" int LLVMFuzzerInitialize(int* /*pArgc*/, char*** /*pArgv*/) {
  Check(getenv("TESSEL_PRIVATE_VAR") != nullptr);  // the paths are the appliance's own
  std::filesystem::create_directories(std::filesystem::path(NAME).parent_path());
  return sqlite3_auto_extension(reinterpret_cast<void (*)()>(Guard));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  const string strFirst = Input.ConsumeRandomLengthString(9);
  const string strSecond = Input.ConsumeRandomLengthString(9);
  FUZZ(strFirst, strSecond, Input.ConsumeRemainingBytesAsString());
  return 0;
}
