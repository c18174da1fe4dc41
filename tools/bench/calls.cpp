// calls [--benchmark_...] | calls --times N CALL
//
// Times each of the library's calls, CALL/ours, beside what its caller would otherwise use,
// CALL/PEER, after comparing their results. With --times makes the one call N times, for a tool
// that counts what it costs. scripts/bench runs it where /var is private, and makes the files.

#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <fcntl.h>
#include <glib.h>
#include <ini.h>
#include <openssl/evp.h>
#include <sys/file.h>
#include <unistd.h>

#include <cstring>
#include <functional>
#include <map>
#include <string>

#include "fileutils.h"
#include "kidebuglog.h"
#include "strtoint32.h"
#include "utils.h"

namespace {

using std::string;
using KeyValMap = std::map<string, string>;

constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";
constexpr const char* SETTINGS = "/var/settings";
constexpr const char* KEY_FILE = "/var/settings.ini";  // the same with a "[settings]" in front
constexpr const char* LAST_KEY = "camera1999";
const string LOG_LINE =
    "Nov 24 12:00:00 [12345][utils][error] fileutils.cpp:123:GetKeyVals(): Failed to open file "
    "[/var/packages/Camveld/etc/f] with errno [2]\n";

// A text of some 4 KiB.
const string TEXT = [] {
  string strText;
  for (int Time = 0; Time < 85; ++Time) {
    strText += "/volume1/Front door & yard/2023-11-14 22:13.mp4?";
  }
  return strText;
}();
const int TEXT_LEN = static_cast<int>(TEXT.size());

string Take(char* szText, void (*Free)(void*)) {
  string strText = szText;
  Free(szText);
  return strText;
}

int TakeLast(void* pVal, const char* /*szSection*/, const char* szKey, const char* szVal) {
  if (strcmp(szKey, LAST_KEY) == 0) {
    *static_cast<string*>(pVal) = szVal;
  }
  return 1;
}

int TakeAll(void* pKeyVals, const char* /*szSection*/, const char* szKey, const char* szVal) {
  (*static_cast<KeyValMap*>(pKeyVals))[szKey] = szVal;
  return 1;
}

string LastAndCount(const KeyValMap& KeyVals) {
  return KeyVals.at(LAST_KEY) + itos(static_cast<int>(KeyVals.size()));
}

using CallFunc = std::function<string()>;

const struct {
  string strCall;
  CallFunc Ours;
  string strPeer;
  CallFunc Theirs;
} rgCall[] = {
    {"KiPrintf",
     [] {
       KiPrintf(KI_LOG, "utils", "error", "dir/fileutils.cpp", 123, "GetKeyVals",
                "Failed to open file [%s] with errno [%d]\n", "/var/packages/Camveld/etc/f", 2);
       return string();
     },
     "system calls",
     [] {
       const int Fd = open(LOG_FILE, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
       flock(Fd, LOCK_EX | LOCK_NB);
       const ssize_t Written = write(Fd, LOG_LINE.data(), LOG_LINE.size());
       flock(Fd, LOCK_UN);
       close(Fd);
       return Written > 0 ? string() : "not written";
     }},
    {"HttpBase64Encode", [] { return Take(HttpBase64Encode(TEXT.c_str()), free); }, "OpenSSL",
     [] {
       auto* pOut = static_cast<unsigned char*>(malloc(TEXT.size() * 4 / 3 + 4));
       EVP_EncodeBlock(pOut, reinterpret_cast<const unsigned char*>(TEXT.data()), TEXT_LEN);
       return Take(reinterpret_cast<char*>(pOut), free);
     }},
    {"urlEncoding", [] { return urlEncoding(TEXT, ""); }, "libcurl",
     [] { return Take(curl_easy_escape(nullptr, TEXT.data(), TEXT_LEN), curl_free); }},
    {"KiFileGetVal",
     [] {
       string strVal;
       KiFileGetVal(SETTINGS, LAST_KEY, strVal);
       return strVal;
     },
     "libinih",
     [] {
       string strVal;
       ini_parse(SETTINGS, TakeLast, &strVal);
       return strVal;
     }},
    {"KiFileGetAllKeyVals",
     [] {
       KeyValMap KeyVals;
       KiFileGetAllKeyVals(SETTINGS, KeyVals);
       return LastAndCount(KeyVals);
     },
     "libinih",
     [] {
       KeyValMap KeyVals;
       ini_parse(SETTINGS, TakeAll, &KeyVals);
       return LastAndCount(KeyVals);
     }},
    {"KiFileSetVals",
     [] {
       return itos(KiFileSetVals(SETTINGS, {{LAST_KEY, "new"}}, false));
     },
     "GKeyFile",
     [] {
       GKeyFile* pKeyFile = g_key_file_new();
       g_key_file_load_from_file(pKeyFile, KEY_FILE, G_KEY_FILE_NONE, nullptr);
       g_key_file_set_string(pKeyFile, "settings", LAST_KEY, "new");
       const int Saved = g_key_file_save_to_file(pKeyFile, KEY_FILE, nullptr);
       g_key_file_unref(pKeyFile);
       return itos(Saved - 1);
     }},
};

void Register(string strName, const string& strWay, const CallFunc& Call, const CallFunc& Other) {
  strName.append("/").append(strWay);
  benchmark::RegisterBenchmark(strName.c_str(), [=](benchmark::State& State) {
    if (Call() != Other()) {
      State.SkipWithError("the results differ");
    }
    for ([[maybe_unused]] auto _ : State) {
      benchmark::DoNotOptimize(Call());
    }
  });
}

}  // namespace

int main(int argc, char** argv) {
  const bool blTimes = argc == 4 && strcmp(argv[1], "--times") == 0;
  for (const auto& [strCall, Ours, strPeer, Theirs] : rgCall) {
    Register(strCall, "ours", Ours, Theirs);
    Register(strCall, strPeer, Theirs, Ours);
    for (int Times = blTimes && strCall == argv[3] ? StrToInt32(argv[2]) : 0; Times > 0; --Times) {
      Ours();
    }
  }
  benchmark::Initialize(&argc, argv);
  if (!blTimes && benchmark::RunSpecifiedBenchmarks() == 0) {
    return 1;
  }
  return 0;
}
