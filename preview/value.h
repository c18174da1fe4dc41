// One value of a row, written so that it can be told from every other.
#pragma once

#include <sqlite3.h>

#include <string>

// Whether type and bytes are the same.
bool IsSame(sqlite3_value* pA, sqlite3_value* pB);

// Text with a backslash before ' and \, and each byte that is not printable ASCII as \xHH.
std::string Escaped(const std::string& strText);

// The bytes in hexadecimal.
std::string Hex(const std::string& strBytes);

// As a person reads it: NULL, 12, 0.5, 'text' escaped, x'0102' for a blob.
std::string Shown(sqlite3_value* pValue);

// As an SQL expression that gives exactly this value on every machine.
std::string SqlLiteral(sqlite3_value* pValue);

// As JSON: null, a number or a string; {"text": HEX} for text that is no UTF-8, {"blob": HEX}, and
// {"real": "Inf"} for what JSON has no number for.
std::string Json(sqlite3_value* pValue);
std::string JsonText(const std::string& strText);

// Text and blobs, as they are stored.
std::string Bytes(sqlite3_value* pValue);
