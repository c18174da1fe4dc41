#include "files.h"

#include <cstdio>

#include "value.h"
#include "zamoc.h"

namespace {

std::string Content(const Statement& Row, int Column) {
  const void* const pBytes = sqlite3_column_blob(Row.Get(), Column);
  const auto Size = static_cast<size_t>(sqlite3_column_bytes(Row.Get(), Column));
  return {static_cast<const char*>(pBytes), Size};
}

}  // namespace

void RestoreFiles(const Database& Changes, const std::string& strDir, bool blDryRun,
                  Counts* pCounts) {
  ZAMOCPatience Patience;
  // A name with a slash would lead out of the directory.
  Statement Files(Changes, "SELECT name, before, after FROM file WHERE name NOT LIKE '%/%'");
  while (Files.Step()) {
    const std::string strBefore = Content(Files, 1);
    const std::string strAfter = Content(Files, 2);
    std::string strNow = "none";
    int64_t* pCount = &pCounts->Left;
    const auto Restore = [&](const std::string& strText) {
      strNow = std::to_string(strText.size()) + " bytes";
      pCount = strText == strBefore  ? &pCounts->Done
               : strText == strAfter ? &pCounts->Back
                                     : &pCounts->Left;
      return pCount == &pCounts->Back && !blDryRun ? strBefore : strText;
    };
    bool blStayedLocked = false;
    std::string strReason =
        ZAMOCChangeText(strDir + "/" + Files.Text(0), &Patience, Restore, &blStayedLocked);
    if (strReason.empty() && pCount == &pCounts->Left) {
      strReason = "it has been changed since";
    }
    if (!strReason.empty()) {
      pCount = &pCounts->Left;
      printf("left: file %s: before %zu bytes, after %zu bytes, now %s (%s)\n",
             Name(Files.Text(0)).c_str(), strBefore.size(), strAfter.size(), strNow.c_str(),
             Name(strReason).c_str());
    }
    ++*pCount;
  }
}
