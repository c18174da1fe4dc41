// Writes a value of a row so that it differs from every other value.
#pragma once

#include <sqlite3.h>

#include <string>

// True if type and bytes are the same.
bool IsSame(sqlite3_value* pA, sqlite3_value* pB);

// Puts a backslash before ' and \, and writes each byte that is not printable ASCII as \xHH.
std::string Escaped(const std::string& strText);

// Returns the bytes in hexadecimal.
std::string Hex(const std::string& strBytes);

// Returns the value for a person: NULL, 12, 0.5, 'text' escaped, x'0102' for a blob.
std::string Shown(sqlite3_value* pValue);

// Returns an SQL expression that gives exactly this value on every machine.
std::string SqlLiteral(sqlite3_value* pValue);

// Returns JSON: null, a number or a string. Text that is not UTF-8 becomes {"text": HEX}, a blob
// {"blob": HEX}, and infinity {"real": "Inf"}.
std::string Json(sqlite3_value* pValue);
std::string JsonText(const std::string& strText);

// Returns the stored bytes of a text or blob.
std::string Bytes(sqlite3_value* pValue);
