// calls [--benchmark_...] | calls --workload=NAME
//
// Times the library's calls beside what their caller would otherwise have taken, each way of doing
// it under NAME/SIZE/WAY; WAY is "ours" for the library. A way is first checked to give the right
// result. With --workload does the one of that name twice, the second time in a function of its
// own, Workload, for a tool that counts instructions. Runs in tools/private-var only.

#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <fcntl.h>
#include <glib.h>
#include <ini.h>
#include <openssl/evp.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <boost/algorithm/string/replace.hpp>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "fileutils.h"
#include "kidebuglog.h"
#include "utils.h"

using std::string;
using KEY_VAL_MAP = std::map<string, string>;

// What --toggle-collect of callgrind is given.
extern "C" __attribute__((noinline)) void Workload(const std::function<void()>& Run) { Run(); }

namespace {

constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";

std::map<string, std::function<void()>> g_Workloads;

// Adds a way. Expected makes what Run needs, and returns what Run is to return.
template <typename EXPECTED, typename RUN>
void Add(const char* szName, int Size, const char* szWay, EXPECTED Expected, RUN Run) {
  const string strName = string(szName) + "/" + itos(Size) + "/" + szWay;
  g_Workloads[strName] = [=] {
    Expected();
    Run();
    Workload([=] { benchmark::DoNotOptimize(Run()); });
  };
  benchmark::RegisterBenchmark(strName.c_str(), [=](benchmark::State& State) {
    const auto& Wanted = Expected();
    if (!(Run() == Wanted)) {
      State.SkipWithError("wrong result");
    }
    for ([[maybe_unused]] auto _ : State) {
      benchmark::DoNotOptimize(Run());
    }
  });
}

// --- The log ---

// A log that a line was written to. It is compared by the end of its last line.
struct LOGGED {
  bool operator==(const string& strEnd) const {
    std::ifstream File(LOG_FILE);
    const string strText(std::istreambuf_iterator<char>(File), {});
    return strText.size() > strEnd.size() &&
           strText.compare(strText.size() - strEnd.size(), strEnd.size(), strEnd) == 0;
  }
};

void AddLog() {
  static const string strLine =
      "Nov 24 12:00:00 [12345][utils][error] fileutils.cpp:123:GetKeyVals(): Failed to open file "
      "[/var/packages/Camveld/etc/f] with errno [2]\n";
  const auto End = [] {
    std::ofstream(LOG_FILE).flush();
    return strLine.substr(strLine.find("[utils]"));
  };
  Add("KiPrintf", 1, "ours", End, [] {
    KiPrintf(KI_LOG, "utils", "error", "dir/fileutils.cpp", 123, "GetKeyVals",
             "Failed to open file [%s] with errno [%d]\n", "/var/packages/Camveld/etc/f", 2);
    return LOGGED();
  });
  Add("KiPrintf", 1, "bare", End, [] {
    const int Fd = open(LOG_FILE, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
    if (flock(Fd, LOCK_EX | LOCK_NB) != 0 || write(Fd, strLine.data(), strLine.size()) == -1) {
      abort();
    }
    flock(Fd, LOCK_UN);
    close(Fd);
    return LOGGED();
  });
}

// A thousand times a gate. Returns how often it was open.
template <typename GATE>
auto Thousand(GATE Gate) {
  return [Gate] {
    int Passed = 0;
    for (int Time = 0; Time < 1000; ++Time) {
      Gate(Passed);
      benchmark::ClobberMemory();  // what it reads, others may have changed
    }
    return Passed;
  };
}

void AddGate() {
  const LOG_LEVEL* pLevel = reinterpret_cast<LOG_LEVEL*>(g_pDbgLogCfg) + 1 + LOG_CATEG_UTILS;
  const auto None = [] { return 0; };
  Add("Gate", 1000, "ours", None,
      Thousand([](int& Passed) { KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_DEBUG, "%d\n", ++Passed); }));
  Add("Gate", 1000, "load", None, Thousand([pLevel](int& Passed) {
        if (__atomic_load_n(pLevel, __ATOMIC_RELAXED) >= LOG_LEVEL_DEBUG) {
          KiDbgPrintf(LOG_CATEG_UTILS, LOG_LEVEL_DEBUG, "", 0, "", "%d\n", ++Passed);
        }
      }));
}

// --- Texts ---

// Released with FREE, which the one who made it asks for.
template <void (*FREE)(void*)>
struct TEXT {
  explicit TEXT(char* pText) : szText(pText) {}
  TEXT(const TEXT&) = delete;
  TEXT& operator=(const TEXT&) = delete;
  ~TEXT() { FREE(szText); }
  bool operator==(const string& strText) const { return strText == szText; }
  char* const szText;
};

// The first Size bytes of strPattern again and again.
string Repeat(const string& strPattern, int Size) {
  string strText;
  while (strText.size() < static_cast<size_t>(Size)) {
    strText += strPattern;
  }
  strText.resize(static_cast<size_t>(Size));
  return strText;
}

void AddEncoding(int Size) {
  const string strText = Repeat("/volume1/Front door & yard/2023-11-14 22:13.mp4?", Size);
  const auto Base64 = [strText] {
    const size_t Len = strlen(strText.c_str());
    auto* const pOut = static_cast<unsigned char*>(malloc(Len / 3 * 4 + 5));
    EVP_EncodeBlock(pOut, reinterpret_cast<const unsigned char*>(strText.c_str()),
                    static_cast<int>(Len));
    return TEXT<free>(reinterpret_cast<char*>(pOut));
  };
  const auto Base64Text = [Base64] { return string(Base64().szText); };
  Add("HttpBase64Encode", Size, "ours", Base64Text,
      [strText] { return TEXT<free>(HttpBase64Encode(strText.c_str())); });
  Add("HttpBase64Encode", Size, "openssl", Base64Text, Base64);

  const auto Escape = [strText, Size] {
    return TEXT<curl_free>(curl_easy_escape(nullptr, strText.data(), Size));
  };
  const auto Escaped = [Escape] { return string(Escape().szText); };
  Add("urlEncoding", Size, "ours", Escaped, [strText] { return urlEncoding(strText, ""); });
  Add("urlEncoding", Size, "curl", Escaped, Escape);
}

// Where one byte in ten is a match. Each edits a copy of the text.
void AddEditing(int Size) {
  const auto On = [strText = Repeat("it's a day", Size)](auto Edit) {
    return [strText, Edit] {
      string strEdited = strText;
      Edit(strEdited);
      return strEdited;
    };
  };
  const auto Replace =
      On([](string& strEdited) { boost::replace_all(strEdited, string("'"), string("''")); });
  Add("ReplaceSubstr", Size, "ours", Replace,
      On([](string& strEdited) { ReplaceSubstr(strEdited, "'", "''"); }));
  Add("ReplaceSubstr", Size, "boost", Replace, Replace);

  const auto Erase = On([](string& strEdited) {
    strEdited.erase(std::remove(strEdited.begin(), strEdited.end(), '\''), strEdited.end());
  });
  Add("StringEraseCharacter", Size, "ours", Erase,
      On([](string& strEdited) { StringEraseCharacter(strEdited, '\''); }));
  Add("StringEraseCharacter", Size, "std", Erase, Erase);
}

// --- Key-value files ---

// Writes the file of so many lines anew: in the order of the keys, as the library leaves one, and
// with the group's line, which GKeyFile asks for and the others pass over. Returns its pairs.
const KEY_VAL_MAP& WritePairs(const string& strFile, int Lines) {
  static std::map<int, KEY_VAL_MAP> Made;
  KEY_VAL_MAP& KeyVals = Made[Lines];
  for (int Line = static_cast<int>(KeyVals.size()); Line < Lines; ++Line) {
    KeyVals["camera" + itos(1000000 + Line)] = "the setting of " + itos(Line);
  }
  std::ofstream File(strFile);
  File << "[settings]\n";
  for (const auto& [strKey, strVal] : KeyVals) {
    File << strKey << '=' << strVal << '\n';
  }
  return KeyVals;
}

// A file that was changed.
struct CHANGED {
  bool operator==(const KEY_VAL_MAP& Wanted) const {
    KEY_VAL_MAP KeyVals;
    KiFileGetAllKeyVals(szFile, KeyVals);
    return KeyVals == Wanted;
  }
  const char* szFile;
};

// The settings of a file as GLib has them, and one of them.
using KeyFile = std::unique_ptr<GKeyFile, decltype(&g_key_file_unref)>;

KeyFile LoadKeyFile(const char* szFile) {
  KeyFile pKeyFile(g_key_file_new(), g_key_file_unref);
  g_key_file_load_from_file(pKeyFile.get(), szFile, G_KEY_FILE_NONE, nullptr);
  return pKeyFile;
}

TEXT<g_free> GetString(const KeyFile& pKeyFile, const char* szKey) {
  return TEXT<g_free>(g_key_file_get_string(pKeyFile.get(), "settings", szKey, nullptr));
}

// Handlers of libinih. The first looks for the one key in the map.
int TakeVal(void* pUser, const char* /*szSection*/, const char* szKey, const char* szVal) {
  auto& [strKey, strVal] = *static_cast<KEY_VAL_MAP*>(pUser)->begin();
  if (strKey == szKey) {
    strVal = szVal;
  }
  return 1;
}

int TakeAll(void* pUser, const char* /*szSection*/, const char* szKey, const char* szVal) {
  (*static_cast<KEY_VAL_MAP*>(pUser))[szKey] = szVal;
  return 1;
}

void AddKeyVal(int Lines) {
  static std::map<int, string> Names;
  const char* const szFile = (Names[Lines] = "/var/settings" + itos(Lines)).c_str();
  const string strLast = "camera" + itos(1000000 + Lines - 1);
  const auto Pairs = [=]() -> const KEY_VAL_MAP& { return WritePairs(szFile, Lines); };
  const auto Last = [=] { return Pairs().at(strLast); };
  const auto Changed = [=] {
    KEY_VAL_MAP KeyVals = Pairs();
    KeyVals[strLast] = "new";
    return KeyVals;
  };

  Add("KiFileGetVal", Lines, "ours", Last, [=] {
    string strVal;
    KiFileGetVal(szFile, strLast.c_str(), strVal);
    return strVal;
  });
  Add("KiFileGetVal", Lines, "gkeyfile", Last,
      [=] { return GetString(LoadKeyFile(szFile), strLast.c_str()); });
  Add("KiFileGetVal", Lines, "inih", Last, [=] {
    KEY_VAL_MAP KeyVals = {{strLast, ""}};
    ini_parse(szFile, TakeVal, &KeyVals);
    return KeyVals[strLast];
  });

  const auto Filled = [=](auto Fill) {
    return [=] {
      KEY_VAL_MAP KeyVals;
      Fill(KeyVals);
      return KeyVals;
    };
  };
  Add("KiFileGetAllKeyVals", Lines, "ours", Pairs,
      Filled([=](KEY_VAL_MAP& KeyVals) { KiFileGetAllKeyVals(szFile, KeyVals); }));
  Add("KiFileGetAllKeyVals", Lines, "gkeyfile", Pairs, Filled([=](KEY_VAL_MAP& KeyVals) {
        const KeyFile pKeyFile = LoadKeyFile(szFile);
        char** const rgKey = g_key_file_get_keys(pKeyFile.get(), "settings", nullptr, nullptr);
        for (char** pszKey = rgKey; *pszKey != nullptr; ++pszKey) {
          KeyVals[*pszKey] = GetString(pKeyFile, *pszKey).szText;
        }
        g_strfreev(rgKey);
      }));
  Add("KiFileGetAllKeyVals", Lines, "inih", Pairs,
      Filled([=](KEY_VAL_MAP& KeyVals) { ini_parse(szFile, TakeAll, &KeyVals); }));

  Add("KiFileSetVals", Lines, "ours", Changed, [=] {
    KiFileSetVals(szFile, {{strLast, "new"}}, false);
    return CHANGED{szFile};
  });
  Add("KiFileSetVals", Lines, "gkeyfile", Changed, [=] {
    const KeyFile pKeyFile = LoadKeyFile(szFile);
    g_key_file_set_string(pKeyFile.get(), "settings", strLast.c_str(), "new");
    g_key_file_save_to_file(pKeyFile.get(), szFile, nullptr);
    return CHANGED{szFile};
  });
}

// Makes the directories and the segment of an appliance.
bool Enter() {
  std::filesystem::create_directories("/var/log/camveld");
  std::filesystem::create_directories("/var/packages/Camveld/etc");
  if (shmget(KiShmDbgLogIPCKey(), sizeof(KiDbgLogCfg), IPC_CREAT | 0600) == -1) {
    return false;
  }
  InitDbgCfg();
  g_pDbgLogCfg->Init(KiShmDbgLogIPCKey());
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  const string WORKLOAD = "--workload=";
  if (getenv("TESSEL_PRIVATE_VAR") == nullptr || !Enter()) {
    fputs("calls: run it in tools/private-var\n", stderr);
    return 125;
  }
  AddLog();
  AddGate();
  for (const int Size : {64, 4096, 65536}) {
    AddEncoding(Size);
  }
  for (const int Size : {10000, 100000, 1000000}) {
    AddEditing(Size);
  }
  for (const int Lines : {10, 1000, 10000, 100000, 1000000}) {
    AddKeyVal(Lines);
  }

  const string strOption = argc == 2 ? argv[1] : "";
  if (strOption.rfind(WORKLOAD, 0) == 0) {
    const auto It = g_Workloads.find(strOption.substr(WORKLOAD.size()));
    if (It == g_Workloads.end()) {
      fputs("calls: no such workload\n", stderr);
      return 1;
    }
    It->second();
    return 0;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 1;
  }
  benchmark::RunSpecifiedBenchmarks();
  return 0;
}
