#include "files.h"

#include <cstdio>
#include <optional>
#include <string_view>

#include "capfile.h"
#include "value.h"

namespace {

using Content = std::optional<std::string_view>;  // none: there is no such file

// The bytes live until the next step of the statement.
Content Bytes(const Statement& Row, int Column) {
  if (sqlite3_column_type(Row.Get(), Column) == SQLITE_NULL) {
    return {};
  }
  const auto* pBytes = static_cast<const char*>(sqlite3_column_blob(Row.Get(), Column));
  const auto Size = static_cast<size_t>(sqlite3_column_bytes(Row.Get(), Column));
  return Size == 0 ? std::string_view() : std::string_view(pBytes, Size);
}

std::string Described(const Content& Bytes) {
  return Bytes ? std::to_string(Bytes->size()) + " bytes" : "none";
}

class File {
 public:
  File(const std::string& strDir, const Statement& Row)
      : m_strName(Row.Text(0)),
        m_strFile(strDir + "/" + m_strName),
        m_Before(Bytes(Row, 1)),
        m_After(Bytes(Row, 2)) {}

  void Restore(bool blDryRun, Counts* pCounts) {
    if (const std::string strReason = Try(blDryRun, pCounts); !strReason.empty()) {
      ++pCounts->Left;
      printf("left: file %s: before %s, after %s, now %s (%s)\n", Name(m_strName).c_str(),
             Described(m_Before).c_str(), Described(m_After).c_str(), Described(m_Now).c_str(),
             strReason.c_str());
    }
  }

 private:
  // Returns why the file is left, or "".
  std::string Try(bool blDryRun, Counts* pCounts) {
    capfile::LockedFile Locked;
    if (m_strName.find('/') != std::string::npos) {
      return "no name of a capability file";
    }
    if (!blDryRun && Locked.Lock(m_strFile.c_str()) != 0) {
      return SystemFailure(Locked.Step()).what();
    }
    if (!ReadNow()) {
      return SystemFailure("cannot be read").what();
    }
    if (m_Now == m_Before) {
      ++pCounts->Done;
      return "";
    }
    if (m_Now != m_After) {
      return "it has been changed since";
    }
    if (!blDryRun && (m_Before ? Locked.Replace(*m_Before, m_Stat) : Locked.Remove()) != 0) {
      return SystemFailure(Locked.Step()).what();
    }
    ++pCounts->Back;
    return "";
  }

  bool ReadNow() {
    if (capfile::Read(m_strFile, &m_strNow, &m_Stat) == capfile::ReadResult::Read) {
      m_Now = m_strNow;
    }
    return m_Now || errno == ENOENT;
  }

  const std::string m_strName;
  const std::string m_strFile;
  const Content m_Before;
  const Content m_After;
  std::string m_strNow;
  Content m_Now;
  struct stat m_Stat = {};
};

}  // namespace

void RestoreFiles(const Database& Changes, const std::string& strDir, bool blDryRun,
                  Counts* pCounts) {
  Statement Files(Changes, "SELECT name, before, after FROM file ORDER BY name");
  while (Files.Step()) {
    File(strDir, Files).Restore(blDryRun, pCounts);
  }
}
