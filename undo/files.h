// Takes back the changes of capability files.
#pragma once

#include <string>

#include "rows.h"

// Restores each file in strDir that is byte for byte as the upgrade has left it, and prints a line
// for each other one. Changes nothing if blDryRun. Changes is the open change file.
void RestoreFiles(const Database& Changes, const std::string& strDir, bool blDryRun,
                  Counts* pCounts);
