// What is made of an input is what a slow, obvious version makes of it. Each function here takes an
// input of three texts: the test has them from a table, the fuzzers think of more.

#include <sqlite3.h>

#include <bitset>
#include <regex>
#include <sstream>

#include "fileutils.h"
#include "rig.h"
#define main TesselUpgraderMain
#include "tesselupgrader.cpp"  // NOLINT(bugprone-suspicious-include)

static const char NAME[] = "/var/packages/Camveld/target/system.db", EQUAL[] = "/var/equal.db";

static string UpToNul(const string& strText) { return strText.substr(0, strText.find('\0')); }

static string Hex(const string& strBytes, const char* szDigits = "0123456789ABCDEF") {
  string strHex;
  for (const char Byte : strBytes) {
    strHex += {szDigits[Byte >> 4 & 15], szDigits[Byte & 15]};
  }
  return strHex;
}

// Key-value files: what a reader finds, and what changes make of it.
void KeyVal(const string& strKey, const string& strVal, const string& strText) {
  static const std::regex Pair("\n([^=\n]*)=(?:[^\"\n]*\"([^\n]*)\"[^\"\n]*|([^\n]*))");
  const string strLines = "\n" + strText;
  std::map<string, string> KeyVals, Is = {{"old", "old"}};
  int Count = 0;
  for (std::sregex_iterator It(strLines.begin(), strLines.end(), Pair), End; It != End; ++It) {
    KeyVals.emplace((*It)[1], (*It)[2].str() + (*It)[3].str());
    ++Count;
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
  string strQuoted, strOthers;
  for (const auto& [strName, strIs] : All) {
    strQuoted.append(strName).append("=\"").append(strIs).append("\"\n");
    if (Add.count(strName) == 0) {
      strOthers.append(strName).append("=").append(strIs).append("\n");
    }
  }
  for (int Time = 0; Time < 2; ++Time) {
    EXPECT_EQ(KiFileSetVals(NAME, Add, true), 0);
    EXPECT_EQ(ReadFile(NAME), strQuoted);
  }
  KiFileGetAllKeyVals(NAME, Is);
  EXPECT_EQ(Is, All);
  EXPECT_EQ(KiFileRemoveKeys(NAME, {strKey, "k"}), 0);
  EXPECT_EQ(ReadFile(NAME), strOthers);
}

// Capability files: one key, and every byte of the others.
void CapKeys(const string& strKey, const string& strVal, const string& strText) {
  if (!std::regex_match(strKey, std::regex("\\w+")) || strVal.find('\n') != string::npos) {
    return;
  }
  static const std::regex Line("[^\n]*\n|[^\n]+");
  const std::regex Own("[ \t]*" + strKey + "[ \t]*=[ \t]*(?:\"([^\n]*)\"|([^\n]*?))[ \t]*\r?\n?");
  const string strNew = strKey + "= " + UpToNul(strVal) + "\n";
  string strSet, strRemoved, strValue;  // the first two differ from the first line of the key on
  std::smatch Match;
  for (std::sregex_iterator It(strText.begin(), strText.end(), Line), End; It != End; ++It) {
    const string strLine = It->str();
    if (!std::regex_match(strLine, Match, Own)) {
      strSet += strLine;
      strRemoved += strLine;
    } else if (strSet == strRemoved) {
      strSet += strNew;
      strValue = Match[1].str() + Match[2].str();
    }
  }
  if (strSet == strRemoved) {
    strSet += (strSet.empty() || strSet.back() == '\n' ? "" : "\n") + strNew;
  }
  const auto Holds = [szKey = strKey.c_str()](const string& strIs, const string& strFile) {
    char szValue[8];
    const int Len = ZAMOCFileGetKeyValue(NAME, szKey, szValue, sizeof(szValue), 0);
    EXPECT_EQ(static_cast<size_t>(Len), strIs.size());
    EXPECT_EQ(szValue, UpToNul(strIs.substr(0, 7)));
    EXPECT_EQ(ReadFile(NAME), strFile);
  };
  WriteFile(NAME, strText);
  Holds(strValue, strText);
  std::regex_match(strNew, Match, Own);
  EXPECT_EQ(ZAMOCFileSetKeyValue(NAME, strKey.c_str(), strVal.c_str(), "%s= %s\n"), 0);
  Holds(Match[1].str() + Match[2].str(), strSet);
  WriteFile(NAME, strText);
  EXPECT_EQ(ZAMOCFileRemoveKey(NAME, strKey.c_str()), strRemoved == strText ? 0 : 1);
  Holds("", strRemoved);
}

static string Cell(const char* szValue) { return szValue == nullptr ? "" : string("=") + szValue; }

// SQL texts: what SQLite's own calls make of them on an equal database.
void Statements(const string& strFirst, const string& strSecond, const string& strThird) {
  const string strText = strFirst + strSecond + strThird;
  DBResult* pResult = nullptr;
  WriteFile(NAME, "");
  WriteFile(EQUAL, "");
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, NAME);
  const int Ret = ZAMODBExecute(pConn, strText.c_str(), &pResult);
  ZAMODBClose(pConn);
  sqlite3* pDb = nullptr;
  int Expected = sqlite3_open(EQUAL, &pDb), Rows = -1;
  std::map<std::pair<DBRow, string>, string> Cells;
  for (const char* szRest = strText.c_str(); Expected == 0 && *szRest != '\0';) {
    sqlite3_stmt* pStatement = nullptr;
    Expected = sqlite3_prepare_v2(pDb, szRest, -1, &pStatement, &szRest);
    if (sqlite3_column_count(pStatement) > 0) {
      Cells.clear();
      Rows = 0;
    }
    for (; sqlite3_step(pStatement) == SQLITE_ROW; ++Rows) {
      for (int Column = 0; Column < sqlite3_column_count(pStatement); ++Column) {
        string strName = sqlite3_column_name(pStatement, Column);
        std::transform(strName.begin(), strName.end(), strName.begin(), tolower);
        const void* pText = sqlite3_column_text(pStatement, Column);
        Cells.emplace(std::pair(Rows, strName), Cell(static_cast<const char*>(pText)));
      }
    }
    Expected |= sqlite3_finalize(pStatement);
  }
  EXPECT_EQ(Ret == 0, Expected == 0 && sqlite3_get_autocommit(pDb) != 0);
  sqlite3_close(pDb);  // rolls back what is open
  EXPECT_TRUE(ReadFile(NAME) == ReadFile(EQUAL));
  if (Ret == 0) {
    EXPECT_EQ(pResult == nullptr ? -1 : static_cast<int>(ZAMODBNumRows(pResult)), Rows);
    for (const auto& [Place, strCell] : Cells) {
      EXPECT_EQ(Cell(ZAMODBFetchField(pResult, Place.first, Place.second.c_str())), strCell);
    }
  }
  ZAMODBFreeResult(pResult);
}

// The second output of cameras with any wiring.
void Axis(const string& strFirst, const string& strSecond, const string& strThird) {
  const string strBytes = strFirst + strSecond + strThird, strWire = UpToNul(strBytes);
  string strNew = "\2" + (strWire.size() < 2 ? "\1" : strWire.substr(1));
  strNew[2] = strNew[2] == '\2' ? '\1' : strNew[2];
  if (strNew.find('\'') != string::npos) {
    return;  // becomes another SQL text, whose effect is SQLite's
  }
  const string strOld = Hex(strBytes), strHex = Hex(strNew);
  const string strMake =
      "CREATE TABLE camera (id, vendor, model, id_on_rec_server, owner_ds_id, connected_wire); "
      "CREATE TABLE camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name); "
      "INSERT INTO camera (id, model, id_on_rec_server) VALUES (1, 'A8105-E', 7), (3, 'A', 7), "
      "(2, 'A8105-E', NULL); UPDATE camera SET vendor = 'AXIS', "
      "owner_ds_id = id_on_rec_server + 1, connected_wire = x'" +
      strOld + "'";
  const char szShow[] =
      "SELECT group_concat(hex(connected_wire)) || (SELECT group_concat(' ' || cam_id || type || "
      "cam_id_on_rec_server || owner_ds_id || idx || name) FROM camdeviceoutput) n FROM camera";
  DBResult* pResult = nullptr;
  WriteFile(NAME, "");
  KiDB::Execute(KiDB::DBI_SYSTEM, strMake, nullptr, false);
  EXPECT_EQ(UpdateAxisA8105E(), 0);
  KiDB::Execute(KiDB::DBI_SYSTEM, szShow, &pResult, false);
  EXPECT_EQ(Cell(ZAMODBFetchField(pResult, 0, "n")),
            "=" + strHex + "," + strOld + "," + strHex + " 11781DO 2, 21001DO 2");
  ZAMODBFreeResult(pResult);
}

// The helpers for texts.
void Helpers(const string& strSet, const string& strNew, const string& strText) {
  static const string ALNUM = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  const string strZero = UpToNul(strText), strChars = UpToNul(strSet), strHash = strText + ALNUM;
  const auto IsIn = [](char It, const string& strOf) { return strOf.find(It) != string::npos; };
  string strUrl, strErased, strReplaced, strBits, strBase64, strIs;
  for (const char It : strText) {
    const bool blStays = IsIn(It, ALNUM) || IsIn(It, "_~()*,-.") || IsIn(It, strSet);
    strUrl += IsIn(It, " \t\n\v\f\r") ? "%20" : blStays ? string(1, It) : "%" + Hex({It});
    strErased += It == strChars[0] ? "" : string(1, It);
    strBits += std::bitset<8>(static_cast<unsigned char>(It)).to_string();
  }
  EXPECT_EQ(urlEncoding(strText, strSet), strUrl);
  EXPECT_EQ(GetBaseName(strText), std::regex_replace(strText, std::regex("[^]*[/\\\\]"), ""));
  EXPECT_EQ(UnsignedHashToStr(reinterpret_cast<const unsigned char*>(strHash.data())),
            Hex(strHash.substr(0, 16), "0123456789abcdef"));
  for (size_t Pos = 0; Pos < strText.size();) {
    const bool blFound = !strSet.empty() && strText.compare(Pos, strSet.size(), strSet) == 0;
    strReplaced += blFound ? strNew : string(1, strText[Pos]);
    Pos += blFound ? strSet.size() : 1;
  }
  ReplaceSubstr(strIs = strText, strSet, strNew);
  EXPECT_EQ(strIs, strReplaced);
  StringEraseCharacter(strIs = strText, strChars[0]);
  EXPECT_EQ(strIs, strErased);

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

  const string strHex = "00" + strText + strSet, strStart = strHex.substr(0, 2 + strSet.size());
  EXPECT_EQ(Hex2Dec(strHex.data(), static_cast<int32_t>(strStart.size())),
            static_cast<int32_t>(std::stoull(strStart, nullptr, 16)));

  const size_t Size = strNew.size();
  string strCopy(Size, 'x'), strCut = strZero.substr(0, std::max<size_t>(Size, 1) - 1);
  Strncpy(strCopy.data(), strText.c_str(), Size);
  strCut.resize(Size);
  EXPECT_EQ(strCopy, strCut);

  std::vector<int32_t> Numbers;
  for (size_t Pos = 0; !strChars.empty() && Pos < strZero.size(); ++Pos) {
    if (!IsIn(strZero[Pos], strChars) && (Pos == 0 || IsIn(strZero[Pos - 1], strChars))) {
      const size_t End = strZero.find_first_of(strChars, Pos);
      std::istringstream(strZero.substr(Pos, End - Pos)) >> Numbers.emplace_back();
    }
  }
  EXPECT_EQ(String2IntVector(strText, strChars), Numbers);
}

TEST_F(Appliance, TextsAreTakenAsASlowVersionTakesThem) {
  std::map<string, decltype(&KeyVal)> Functions;
  Functions = {{"KeyVal", KeyVal}, {"CapKeys", CapKeys}, {"Axis", Axis}};
  Functions.insert({{"Statements", Statements}, {"Helpers", Helpers}});
  RunCommand("prlimit -p $PPID -n24");  // too few for one that is left open each time
  for (const Lines& Row : ReadTable("inputs.tsv")) {
    SCOPED_TRACE(::testing::PrintToString(Row));
    Functions.at(Row[0])(Row[1], Row[2], Row[3]);
  }
}
