#include "value.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <utility>

namespace {

// The last one is SQLITE_RESULT_SUBTYPE of SQLite 3.45, which demands it of value_json(). Older
// versions ignore it.
constexpr int FUNCTION_FLAGS = SQLITE_UTF8 | SQLITE_DETERMINISTIC | 0x1000000;

constexpr unsigned int JSON_SUBTYPE = 'J';  // tells SQLite's JSON functions that a text is JSON

std::string Hex(const std::string& strBytes) {
  constexpr const char* DIGITS = "0123456789abcdef";
  std::string strHex;
  for (const char Char : strBytes) {
    const auto Byte = static_cast<unsigned char>(Char);
    strHex += {DIGITS[Byte >> 4U], DIGITS[Byte & 15U]};
  }
  return strHex;
}

// Returns the bytes of a text or blob.
std::string Bytes(sqlite3_value* pValue) {
  const void* pBytes = sqlite3_value_type(pValue) == SQLITE_BLOB ? sqlite3_value_blob(pValue)
                                                                 : sqlite3_value_text(pValue);
  const auto Size = static_cast<size_t>(sqlite3_value_bytes(pValue));
  return pBytes == nullptr ? "" : std::string(static_cast<const char*>(pBytes), Size);
}

std::string Escaped(const std::string& strText) {
  std::string strEscaped;
  for (const char Char : strText) {
    if (Char < 0x20 || Char > 0x7e) {
      strEscaped += "\\x" + Hex({Char});
      continue;
    }
    if (Char == '\'' || Char == '\\') {
      strEscaped += '\\';
    }
    strEscaped += Char;
  }
  return strEscaped;
}

// Returns the shortest decimal number that reads back as Real.
std::string ShownReal(double Real) {
  char szReal[40];
  for (int Digits = 15; Digits <= 17; ++Digits) {
    snprintf(szReal, sizeof(szReal), "%.*g", Digits, Real);
    if (strtod(szReal, nullptr) == Real) {
      break;
    }
  }
  const std::string strReal = szReal;
  return strReal.find_first_of(".eni") == std::string::npos ? strReal + ".0" : strReal;
}

// Returns the length of the first character, or 0 if its bytes are not UTF-8.
size_t CharacterSize(const unsigned char* pByte, size_t Left) {
  const unsigned Lead = pByte[0];
  const size_t Size = Lead < 0x80 ? 1 : Lead < 0xc2 ? 0 : Lead < 0xe0 ? 2 : Lead < 0xf0 ? 3 : 4;
  if (Size == 0 || Size > Left || Lead > 0xf4) {
    return 0;
  }
  for (size_t Pos = 1; Pos < Size; ++Pos) {
    if ((pByte[Pos] & 0xc0U) != 0x80) {
      return 0;
    }
  }
  const bool blOverlong = (Lead == 0xe0 && pByte[1] < 0xa0) || (Lead == 0xf0 && pByte[1] < 0x90);
  const bool blBeyond = (Lead == 0xed && pByte[1] > 0x9f) || (Lead == 0xf4 && pByte[1] > 0x8f);
  return blOverlong || blBeyond ? 0 : Size;
}

bool IsUtf8(const std::string& strText) {
  const auto* pText = reinterpret_cast<const unsigned char*>(strText.data());
  for (size_t Pos = 0; Pos < strText.size();) {
    const size_t Size = CharacterSize(pText + Pos, strText.size() - Pos);
    if (Size == 0) {
      return false;
    }
    Pos += Size;
  }
  return true;
}

// --- SQL functions ---

std::string Plain(sqlite3_value* pValue) {
  switch (sqlite3_value_type(pValue)) {
    case SQLITE_INTEGER:
      return std::to_string(sqlite3_value_int64(pValue));
    case SQLITE_FLOAT:
      return ShownReal(sqlite3_value_double(pValue));
    case SQLITE_TEXT:
      return Escaped(Bytes(pValue));
    case SQLITE_BLOB:
      return "x'" + Hex(Bytes(pValue)) + "'";
    default:
      return "NULL";
  }
}

std::string Shown(sqlite3_value* pValue) {
  const bool blText = sqlite3_value_type(pValue) == SQLITE_TEXT;
  return blText ? "'" + Plain(pValue) + "'" : Plain(pValue);
}

std::string ShownName(sqlite3_value* pValue) { return Name(Bytes(pValue)); }

template <std::string (*pFunction)(sqlite3_value*)>
void ReturnText(sqlite3_context* pContext, int /*Count*/, sqlite3_value** ppValues) {
  const std::string strText = pFunction(ppValues[0]);
  sqlite3_result_text64(pContext, strText.data(), strText.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
}

std::string RealJson(sqlite3_value* pValue) {
  const double Real = sqlite3_value_double(pValue);
  const char* szInfinity = Real > 0 ? R"({"real":"Inf"})" : R"({"real":"-Inf"})";
  return std::isinf(Real) ? szInfinity : ShownReal(Real);
}

std::string HexJson(sqlite3_value* pValue) {
  const bool blBlob = sqlite3_value_type(pValue) == SQLITE_BLOB;
  return (blBlob ? R"({"blob":")" : R"({"text":")") + Hex(Bytes(pValue)) + "\"}";
}

void ValueJson(sqlite3_context* pContext, int Count, sqlite3_value** ppValues) {
  const int Type = sqlite3_value_type(ppValues[0]);
  if (Type == SQLITE_FLOAT) {
    ReturnText<RealJson>(pContext, Count, ppValues);
  } else if (Type == SQLITE_BLOB || (Type == SQLITE_TEXT && !IsUtf8(Bytes(ppValues[0])))) {
    ReturnText<HexJson>(pContext, Count, ppValues);
  } else {
    sqlite3_result_value(pContext, ppValues[0]);
    return;
  }
  sqlite3_result_subtype(pContext, JSON_SUBTYPE);
}

}  // namespace

std::string Name(const std::string& strText) {
  std::string strShown;
  for (size_t Pos = 0; Pos < strText.size();) {
    const auto* pByte = reinterpret_cast<const unsigned char*>(strText.data()) + Pos;
    const size_t Size = CharacterSize(pByte, strText.size() - Pos);
    // U+0080 to U+009F have the effect of an escape sequence.
    const bool blControl = *pByte < 0x20 || *pByte == 0x7f || (*pByte == 0xc2 && pByte[1] < 0xa0);
    const std::string strCharacter = strText.substr(Pos, Size == 0 ? 1 : Size);
    for (const char Char : strCharacter) {
      strShown += Size == 0 || blControl ? "\\x" + Hex({Char}) : std::string{Char};
    }
    Pos += strCharacter.size();
  }
  return strShown;
}

void AddPrintFunctions(const Database& Db) {
  for (const auto& [szName, pFunction] :
       {std::pair("shown", &ReturnText<Shown>), std::pair("plain", &ReturnText<Plain>),
        std::pair("shown_name", &ReturnText<ShownName>), std::pair("value_json", &ValueJson)}) {
    sqlite3_create_function(Db.Get(), szName, 1, FUNCTION_FLAGS, nullptr, pFunction, nullptr,
                            nullptr);
  }
}
