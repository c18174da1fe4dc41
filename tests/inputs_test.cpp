// What is made of an input is what a slow, obvious version makes of it. Each function here takes an
// input of three texts: the test has them from a table, the fuzzers think of more.

#include <sqlite3.h>

#include <bitset>
#include <optional>
#include <regex>
#include <sstream>

#include "fileutils.h"
#include "rig.h"
#define main TesselUpgraderMain
#include "tesselupgrader.cpp"  // NOLINT(bugprone-suspicious-include)

namespace {

const char NAME[] = "/var/packages/Camveld/target/system.db", EQUAL[] = "/var/equal.db";

string UpToNul(const string& strText) { return strText.substr(0, strText.find('\0')); }

string Hex(const string& strBytes, const char* szDigits = "0123456789ABCDEF") {
  string strHex;
  for (const char Byte : strBytes) {
    strHex += {szDigits[Byte >> 4 & 15], szDigits[Byte & 15]};
  }
  return strHex;
}

string ToText(const std::map<string, string>& KeyVals, const string& strQuote) {
  string strText;
  for (const auto& [strKey, strVal] : KeyVals) {
    strText.append(strKey).append("=" + strQuote).append(strVal).append(strQuote + "\n");
  }
  return strText;
}

}  // namespace

// Key-value files: what a reader finds, and what changes make of it.
void KeyVal(const string& strKey, const string& strVal, const string& strText) {
  static const std::regex Pair("([^=]*)=(?:[^\"]*\"([^\n]*)\"[^\"]*|([^\n]*))");
  std::map<string, string> KeyVals, Is = {{"old", "old"}};
  std::istringstream Text(strText);
  std::smatch Match;
  int Count = 0;
  for (string strLine; std::getline(Text, strLine);) {
    if (std::regex_match(strLine, Match, Pair)) {
      KeyVals.emplace(Match[1], Match[2].str() + Match[3].str());
      ++Count;
    }
  }
  WriteFile(NAME, strText);
  EXPECT_EQ(KiFileGetAllKeyVals(NAME, Is), Count);
  EXPECT_EQ(Is, KeyVals);
  if ((strKey + strVal).find('\n') != string::npos || strKey.find('=') != string::npos) {
    return;
  }
  const std::map<string, string> Add = {{strKey, strVal}, {"k", "v"}};
  std::map<string, string> All = Add;
  All.insert(KeyVals.begin(), KeyVals.end());
  EXPECT_EQ(KiFileSetVals(NAME, Add, false), 0);
  EXPECT_EQ(ReadFile(NAME), ToText(All, ""));
  WriteFile(NAME, strText);
  for (int Time = 0; Time < 2; ++Time) {
    EXPECT_EQ(KiFileSetVals(NAME, Add, true), 0);
    EXPECT_EQ(ReadFile(NAME), ToText(All, "\""));
  }
  KiFileGetAllKeyVals(NAME, Is);
  EXPECT_EQ(Is, All);
  EXPECT_EQ(KiFileRemoveKeys(NAME, {strKey, "k"}), 0);
  All.erase(strKey);
  All.erase("k");
  EXPECT_EQ(ReadFile(NAME), ToText(All, ""));
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
  for (std::istringstream Text(strText); std::getline(Text, strLine);) {
    if (std::regex_match(strLine, Match, Own)) {
      strValue = Found == 0 ? Match[1].str() + Match[2].str() : strValue;
      strSet += Found++ == 0 ? strNew + "\n" : "";
    } else {
      strLine += Text.eof() ? "" : "\n";
      strSet += strLine;
      strRemoved += strLine;
    }
  }
  if (Found == 0) {
    strSet += (strSet.empty() || strSet.back() == '\n' ? "" : "\n") + strNew + "\n";
  }
  const auto Holds = [szKey = strKey.c_str()](const string& strIs, const string& strFile) {
    char szValue[8];
    EXPECT_EQ(ZAMOCFileGetKeyValue(NAME, szKey, szValue, sizeof(szValue), 0),
              static_cast<int>(strIs.size()));
    EXPECT_EQ(szValue, UpToNul(strIs.substr(0, 7)));
    EXPECT_EQ(ReadFile(NAME), strFile);
  };
  WriteFile(NAME, strText);
  Holds(strValue, strText);
  for (int Time = 0; Time < 2; ++Time) {
    ZAMOCFileSetKeyValue(NAME, strKey.c_str(), strVal.c_str(), "%s= %s\n");
    ASSERT_TRUE(std::regex_match(strNew, Match, Own));
    Holds(Match[1].str() + Match[2].str(), strSet);
  }
  WriteFile(NAME, strText);
  EXPECT_EQ(ZAMOCFileRemoveKey(NAME, strKey.c_str()), Found > 0 ? 1 : 0);
  Holds("", strRemoved);
}

namespace {

// Rows, by column, of the statement that runs and of the last one that yielded columns.
std::vector<std::map<string, string>> gRows;
std::optional<decltype(gRows)> gResult;

string Cell(const char* szValue) { return szValue == nullptr ? "" : string("=") + szValue; }

int AddRow(void* /*pUnused*/, int Count, char** pValues, char** pNames) {
  gRows.emplace_back();
  for (int Column = 0; Column < Count; ++Column) {
    string strName = pNames[Column];
    std::transform(strName.begin(), strName.end(), strName.begin(), tolower);
    gRows.back().emplace(strName, Cell(pValues[Column]));
  }
  return 0;
}

int EndStatement(unsigned /*Event*/, void* /*pUnused*/, void* pStatement, void* /*pTime*/) {
  if (sqlite3_column_count(static_cast<sqlite3_stmt*>(pStatement)) > 0) {
    gResult = gRows;
  }
  gRows.clear();
  return 0;
}

// As ZAMODBExecute on a connection of its own; the result is in gResult.
int Exec(const char* szFile, const string& strText) {
  sqlite3* pDb = nullptr;
  gResult.reset();
  sqlite3_open(szFile, &pDb);
  sqlite3_trace_v2(pDb, SQLITE_TRACE_PROFILE, EndStatement, nullptr);
  const int Failed = sqlite3_exec(pDb, strText.c_str(), AddRow, nullptr, nullptr);
  const int Ret = Failed == 0 && sqlite3_get_autocommit(pDb) != 0 ? 0 : -1;
  sqlite3_close(pDb);  // rolls back what is open
  return Ret;
}

}  // namespace

// SQL texts: what sqlite3_exec makes of them on an equal database.
void Statements(const string& strFirst, const string& strSecond, const string& strThird) {
  const string strText = strFirst + strSecond + strThird;
  for (const char* szFile : {NAME, EQUAL}) {
    fs::remove(szFile);
    Exec(szFile, "CREATE TABLE t (n PRIMARY KEY CHECK (n <> 13)); INSERT INTO t VALUES (1)");
  }
  DBResult* pResult = nullptr;
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, NAME);
  const int Ret = ZAMODBExecute(pConn, strText.c_str(), &pResult);
  ZAMODBClose(pConn);
  EXPECT_EQ(Ret, Exec(EQUAL, strText));
  EXPECT_TRUE(ReadFile(NAME) == ReadFile(EQUAL));
  if (Ret == 0) {
    ASSERT_EQ(pResult != nullptr, gResult.has_value());
    EXPECT_EQ(ZAMODBNumRows(pResult), gResult ? gResult->size() : 0);
  }
  for (DBRow Row = 0; ZAMODBFetchRow(pResult, &Row) == 0;) {
    for (const auto& [strName, strCell] : gResult->at(Row)) {
      EXPECT_EQ(Cell(ZAMODBFetchField(pResult, Row, strName.c_str())), strCell);
    }
  }
  ZAMODBFreeResult(pResult);
}

// The second output of cameras with any wiring, as text and as a blob.
void Axis(const string& strFirst, const string& strSecond, const string& strThird) {
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
  fs::remove(NAME);
  const string strMake =
      "CREATE TABLE camera (id INTEGER PRIMARY KEY, vendor, model, id_on_rec_server, owner_ds_id, "
      "connected_wire TEXT); INSERT INTO camera VALUES (1, 'AXIS', 'A8105-E', 7, 8, CAST($ AS "
      "TEXT)), (2, 'AXIS', 'A8105-E', NULL, NULL, $), (3, 'AXIS', 'A', 7, 8, $); "
      "CREATE TABLE camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name)";
  EXPECT_EQ(Exec(NAME, std::regex_replace(strMake, std::regex("\\$"), "x'" + strOld + "'")), 0);
  EXPECT_EQ(UpdateAxisA8105E(), Quotes == 0 ? 0 : -1);
  Exec(NAME,
       "SELECT group_concat(hex(connected_wire)) wires, (SELECT group_concat(cam_id || ' ' || "
       "cam_id_on_rec_server || owner_ds_id || type || idx || name) FROM camdeviceoutput) outputs "
       "FROM camera");
  EXPECT_EQ(gResult->at(0)["wires"], "=" + strHex + "," + strHex + "," + strOld);
  EXPECT_EQ(gResult->at(0)["outputs"], Quotes == 0 ? "=1 7811DO 2,2 0011DO 2" : "");
}

// The helpers for texts.
void Helpers(const string& strSet, const string& strNew, const string& strText) {
  static const string ALNUM = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  const string strZero = UpToNul(strText), strChars = UpToNul(strSet), strHash = strText + ALNUM;
  const auto IsIn = [](char It, const string& strOf) { return strOf.find(It) != string::npos; };
  string strUrl, strBase, strErased, strReplaced, strBits, strBase64;
  for (const char It : strText) {
    const bool blStays = IsIn(It, ALNUM) || IsIn(It, "_~()*,-.") || IsIn(It, strSet);
    strUrl += IsIn(It, " \t\n\v\f\r") ? "%20" : blStays ? string(1, It) : "%" + Hex({It});
    IsIn(It, "/\\") ? strBase.clear() : strBase.push_back(It);
    strErased += It == strChars[0] ? "" : string(1, It);
    strBits += std::bitset<8>(static_cast<unsigned char>(It)).to_string();
  }
  string strIs = strText;
  StringEraseCharacter(strIs, strChars[0]);
  EXPECT_EQ(strIs, strErased);
  EXPECT_EQ(urlEncoding(strText, strSet), strUrl);
  EXPECT_EQ(GetBaseName(strText), strBase);
  EXPECT_EQ(UnsignedHashToStr(reinterpret_cast<const unsigned char*>(strHash.data())),
            Hex(strHash.substr(0, 16), "0123456789abcdef"));

  for (size_t Pos = 0; Pos < strText.size();) {
    const bool blFound = !strSet.empty() && strText.compare(Pos, strSet.size(), strSet) == 0;
    strReplaced += blFound ? strNew : string(1, strText[Pos]);
    Pos += blFound ? strSet.size() : 1;
  }
  ReplaceSubstr(strIs = strText, strSet, strNew);
  EXPECT_EQ(strIs, strReplaced);

  const size_t First = std::min(strText.find_first_not_of(strChars), strText.size());
  const size_t Last = strText.find_last_not_of(strChars);
  EXPECT_EQ(Trim(strText, strChars.c_str()), strText.substr(First, Last + 1 - First));

  strBits.resize(8 * strZero.size());
  for (size_t Bit = 0; Bit < strBits.size(); Bit += 6) {
    strBase64 += (ALNUM + "+/")[std::bitset<6>(strBits.substr(Bit, 6) + "0000").to_ulong()];
  }
  strBase64.append(3 - (strBase64.size() + 3) % 4, '=');
  const std::unique_ptr<char, decltype(&free)> pBase64(HttpBase64Encode(strText.c_str()), free);
  EXPECT_EQ(pBase64.get(), strBase64);

  const string strStart = strText.substr(0, strSet.size());
  const string strHex = strStart.substr(0, strStart.find_first_not_of("0123456789abcdefABCDEF"));
  const auto Low = std::stoull(("00000000" + strHex).substr(strHex.size()), nullptr, 16);
  EXPECT_EQ(Hex2Dec(strText.data(), static_cast<int32_t>(strStart.size())),
            static_cast<int32_t>(Low));

  string strCopy(strNew.size() + 1, 'x'), strCut = strZero.substr(0, strNew.size());
  Strncpy(strCopy.data(), strText.c_str(), strCopy.size());
  strCut.resize(strCopy.size());
  EXPECT_EQ(strCopy, strCut);
  EXPECT_EQ(Strncpy(nullptr, "", 0), nullptr);

  string strParted = strChars.empty() ? "" : strZero;
  std::replace_if(
      strParted.begin(), strParted.end(), [&](char It) { return IsIn(It, strChars); }, '\0');
  std::istringstream Pieces(strParted);
  std::vector<int32_t> Numbers;
  for (string strPiece; std::getline(Pieces, strPiece, '\0');) {
    if (!strPiece.empty()) {
      std::istringstream(strPiece) >> Numbers.emplace_back();
    }
  }
  EXPECT_EQ(String2IntVector(strText, strChars), Numbers);
}

TEST_F(Appliance, TextsAreTakenAsASlowVersionTakesThem) {
  std::map<string, decltype(&KeyVal)> Functions;
  Functions = {{"KeyVal", KeyVal}, {"CapKeys", CapKeys}, {"Axis", Axis}};
  Functions.insert({{"Statements", Statements}, {"Helpers", Helpers}});
  for (const Lines& Row : ReadTable("inputs.tsv")) {
    SCOPED_TRACE(::testing::PrintToString(Row));
    Functions.at(Row[0])(Row[1], Row[2], Row[3]);
  }
}
