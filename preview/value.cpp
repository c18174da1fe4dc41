#include "value.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "database.h"

namespace {

bool IsPrintable(char Char) { return Char >= 0x20 && Char <= 0x7e; }

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

// SQLite reads numbers with few digits and small exponents exactly. On a processor without wider
// floating-point numbers, it may read others inexactly. Those are written as a whole number
// multiplied or divided by powers of two.
std::string SqlReal(double Real) {
  if (std::isinf(Real)) {
    return Real > 0 ? "9e999" : "-9e999";
  }
  std::string strReal = ShownReal(Real);
  const double Magnitude = std::fabs(Real);
  if (strReal.size() <= 16 && (Magnitude == 0 || (Magnitude > 1e-5 && Magnitude < 1e15))) {
    return strReal;
  }
  constexpr int MaxShift = 62;
  int Exponent = 0;
  const auto Mantissa = static_cast<int64_t>(std::ldexp(std::frexp(Real, &Exponent), 53));
  strReal = "(" + std::to_string(Mantissa) + ".0";
  for (int Left = Exponent - 53; Left != 0;) {
    const int Shift = std::min(std::abs(Left), MaxShift);
    strReal += (Left < 0 ? " / " : " * ") + std::to_string(int64_t{1} << Shift) + ".0";
    Left += Left < 0 ? Shift : -Shift;
  }
  return strReal + ")";
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

}  // namespace

bool IsSame(sqlite3_value* pA, sqlite3_value* pB) {
  const int Type = sqlite3_value_type(pA);
  if (Type != sqlite3_value_type(pB)) {
    return false;
  }
  if (Type == SQLITE_NULL) {
    return true;
  }
  if (Type == SQLITE_INTEGER) {
    return sqlite3_value_int64(pA) == sqlite3_value_int64(pB);
  }
  if (Type == SQLITE_FLOAT) {
    return sqlite3_value_double(pA) == sqlite3_value_double(pB);
  }
  // Fetch the bytes first: SQLite gives the size of what was fetched last.
  const void* pBytesA = sqlite3_value_blob(pA);
  const void* pBytesB = sqlite3_value_blob(pB);
  const int Size = sqlite3_value_bytes(pA);
  return Size == sqlite3_value_bytes(pB) &&
         (Size == 0 || memcmp(pBytesA, pBytesB, static_cast<size_t>(Size)) == 0);
}

std::string Bytes(sqlite3_value* pValue) {
  const void* pBytes = sqlite3_value_type(pValue) == SQLITE_BLOB ? sqlite3_value_blob(pValue)
                                                                 : sqlite3_value_text(pValue);
  const auto Size = static_cast<size_t>(sqlite3_value_bytes(pValue));
  return pBytes == nullptr ? "" : std::string(static_cast<const char*>(pBytes), Size);
}

std::string Escaped(const std::string& strText) {
  std::string strEscaped;
  for (const char Char : strText) {
    if (!IsPrintable(Char)) {
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

std::string Hex(const std::string& strBytes) {
  constexpr const char* DIGITS = "0123456789abcdef";
  std::string strHex;
  for (const char Char : strBytes) {
    const auto Byte = static_cast<unsigned char>(Char);
    strHex += {DIGITS[Byte >> 4U], DIGITS[Byte & 15U]};
  }
  return strHex;
}

std::string Shown(sqlite3_value* pValue) {
  switch (sqlite3_value_type(pValue)) {
    case SQLITE_INTEGER:
      return std::to_string(sqlite3_value_int64(pValue));
    case SQLITE_FLOAT:
      return ShownReal(sqlite3_value_double(pValue));
    case SQLITE_TEXT:
      return "'" + Escaped(Bytes(pValue)) + "'";
    case SQLITE_BLOB:
      return "x'" + Hex(Bytes(pValue)) + "'";
    default:
      return "NULL";
  }
}

std::string SqlLiteral(sqlite3_value* pValue) {
  const int Type = sqlite3_value_type(pValue);
  if (Type == SQLITE_FLOAT) {
    return SqlReal(sqlite3_value_double(pValue));
  }
  if (Type == SQLITE_INTEGER && sqlite3_value_int64(pValue) == INT64_MIN) {
    return "(-9223372036854775807 - 1)";  // SQLite reads 9223372036854775808 as a real number
  }
  if (Type != SQLITE_TEXT) {
    return Shown(pValue);
  }
  std::string strLiteral = "'";
  for (const char Char : Bytes(pValue)) {
    if (!IsPrintable(Char)) {
      return "CAST(x'" + Hex(Bytes(pValue)) + "' AS TEXT)";
    }
    strLiteral.append(Char == '\'' ? 2 : 1, Char);
  }
  return strLiteral + "'";
}

std::string JsonText(const std::string& strText) {
  if (!IsUtf8(strText)) {
    return "{\"text\":\"" + Hex(strText) + "\"}";
  }
  static const Database Memory(":memory:", SQLITE_OPEN_READWRITE);
  static Statement Quote(Memory, "SELECT json_quote(?)");
  Quote.Bind(1, strText);
  Quote.Step();
  return Quote.Text(0);
}

std::string Json(sqlite3_value* pValue) {
  switch (sqlite3_value_type(pValue)) {
    case SQLITE_FLOAT:
      if (const double Real = sqlite3_value_double(pValue); std::isinf(Real)) {
        return Real > 0 ? "{\"real\":\"Inf\"}" : "{\"real\":\"-Inf\"}";
      }
      return Shown(pValue);
    case SQLITE_TEXT:
      return JsonText(Bytes(pValue));
    case SQLITE_BLOB:
      return "{\"blob\":\"" + Hex(Bytes(pValue)) + "\"}";
    case SQLITE_NULL:
      return "null";
    default:
      return Shown(pValue);
  }
}
