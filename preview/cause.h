// Finds the row that makes an SQL text fail.
#pragma once

#include <string>

// Runs strSqlCmd on a copy of the database with fewer and fewer rows of a table. Returns the name
// of the one row that is enough to make it fail, such as "camera 31". Returns "" if there is none,
// for example if the text fails without any row, or only because of several. The copy stays as it
// is.
std::string FindCause(const std::string& strCopy, const std::string& strSqlCmd);
