// Writes values and names of a database for a person and for a program.
#pragma once

#include <sqlite3.h>

#include <string>

#include "database.h"

// Returns the value so that it differs from every other value: NULL, 12, 0.5, 'text', x'0102' for a
// blob. In text, ' and \ have a backslash before them, and a byte that is not printable ASCII is
// \xHH.
std::string Shown(sqlite3_value* pValue);

// As Shown, but text has no quotes around it.
std::string Plain(sqlite3_value* pValue);

// Returns the name of a table, column or file, or a message. What is not UTF-8 or could control a
// terminal is \xHH.
std::string Name(const std::string& strText);

// Adds two SQL functions for the arguments of json_object() and json_array():
//   value_json(X)  the value as JSON. Text that is not UTF-8 becomes {"text": HEX}, a blob
//                  {"blob": HEX}, and infinity {"real": "Inf"} or {"real": "-Inf"}.
//   name_json(X)   the text as Name() returns it, so that it can be a key.
void AddJsonFunctions(const Database& Db);
