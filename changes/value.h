// Writes values and names of a database for a person and for a program.
#pragma once

#include <string>

#include "database.h"

// Returns the name of a table, column or file, or a message. What is not UTF-8 or could control a
// terminal is \xHH.
std::string Name(const std::string& strText);

// Adds SQL functions:
//   shown(X)       the value so that it differs from every other value: NULL, 12, 0.5, 'text',
//                  x'0102' for a blob. In text, ' and \ have a backslash before them, and a byte
//                  that is not printable ASCII is \xHH.
//   plain(X)       as shown, but text has no quotes around it
//   shown_name(X)  the text as Name() returns it
//   value_json(X)  the value for json_object() and json_array(). Text that is not UTF-8 becomes
//                  {"text": HEX}, a blob {"blob": HEX}, and infinity {"real": "Inf"} or
//                  {"real": "-Inf"}.
void AddPrintFunctions(const Database& Db);
