// Upgrades the recorder's camera rows and capability files for a newly installed Tessel package:
// runs every migration action whose version threshold is above the version of the package that was
// installed before.
//
// Contents: helpers of the actions, actions on camera rows, actions on capability files, the two
// action tables, main(). The actions of each kind have the order of their table. Add a new action
// at the end of its kind, and to its table by ascending threshold.

#include <dirent.h>
#include <malloc.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <initializer_list>
#include <memory>
#include <string>

#include "fileops.h"
#include "kidb.h"
#include "kidebuglog.h"
#include "strtoint32.h"
#include "utils.h"
#include "zamoc.h"

// One row of an action table. The action runs if the version before the upgrade is below
// orgVersion, or always if orgVersion is 0. A null pFuncUpdate ends the table.
typedef struct _camveld_upgrader_ {
  uint32_t orgVersion;
  int32_t (*pFuncUpdate)();
} UPD_LIST;

// The directory whose capability files are upgraded; empty if there is none.
static std::string gstrRemoteCapDir;

static int KiAtoi(const char* szText) { return szText == nullptr ? 0 : StrToInt32(szText); }

// --- Helpers of the actions ---

// Sends one record with the name of an action and the reason for its failure to syslog. Replaces
// control characters, which names and values may contain, so that a record cannot look like two. A
// record of any length might not be accepted.
static void ReportFailure(const char* szAction, std::string strReason) {
  constexpr size_t MaxReasonLen = 1000;
  strReason.resize(std::min(strReason.size(), MaxReasonLen));
  for (char& Byte : strReason) {
    Byte = iscntrl(static_cast<unsigned char>(Byte)) != 0 ? '?' : Byte;
  }
  syslog(LOG_ERR, "%s: %s", szAction, strReason.c_str());
}

// The system's reason for a failure at a path, from errno.
static std::string SystemReason(const char* szPath) {
  const char* const szReason = strerror(errno);
  return std::string(szPath) + ": " + szReason;
}

// Runs strSqlCmd as one transaction on the system database. Logs and reports a failure with the
// name of the calling action, which the default arguments supply. Returns 0 or -1.
static int RunSql(const std::string& strSqlCmd, DBResult_tag** ppResult = nullptr,
                  int LineNo = __builtin_LINE(), const char* szFunc = __builtin_FUNCTION()) {
  if (KiDB::Execute(KiDB::DBI_SYSTEM, strSqlCmd, ppResult, false) != 0) {
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, LineNo, szFunc,
             "KiDBExecute command (%s) error.\n", strSqlCmd.c_str());
    ReportFailure(szFunc, ZAMODBError());
    return -1;
  }
  return 0;
}

// Runs each statement in its own transaction and stops at the first failure. The statements before
// it stay committed.
static int RunSteps(std::initializer_list<const char*> Statements, int LineNo = __builtin_LINE(),
                    const char* szFunc = __builtin_FUNCTION()) {
  for (const char* szStatement : Statements) {
    if (RunSql(szStatement, nullptr, LineNo, szFunc) != 0) {
      return -1;
    }
  }
  return 0;
}

struct ProfileChange {
  const char* szSet;        // "UPDATE camera SET ... ", ending in a blank
  const char* szCondition;  // " AND ...;", beginning with a blank
};

// Runs all changes in one transaction. strConstraint limits each of them.
static int RunProfile(const std::string& strConstraint,
                      std::initializer_list<ProfileChange> Changes, int LineNo = __builtin_LINE(),
                      const char* szFunc = __builtin_FUNCTION()) {
  std::string strSqlCmd;
  for (const ProfileChange& Change : Changes) {
    strSqlCmd += Change.szSet + strConstraint + Change.szCondition;
  }
  return RunSql(strSqlCmd, nullptr, LineNo, szFunc);
}

// --- Camera rows, in the order of their table ---

static int RenameAbusTvip62000Reso() {
  return RunSteps({
      "UPDATE camera SET resolution = '320x240',live_resolution = '320x240' "
      "WHERE model = 'TVIP62000' AND resolution = 'QVGA'",
      "UPDATE camera SET resolution = '640x480',live_resolution = '640x480' "
      "WHERE model = 'TVIP62000' AND resolution = 'VGA'",
      "UPDATE camera SET resolution = '1600x1200',live_resolution = '1600x1200' "
      "WHERE model = 'TVIP62000' AND resolution = 'UXGA'",
  });
}

static int UpdateCameraModelConfRenameSiemens() {
  return RunSql("UPDATE camera SET vendor = 'SIEMENS' WHERE vendor = 'Siemens'");
}

static int UpdateCameraModelRenameForHIKVISION() {
  constexpr int RenameModelNum = 11;
  static const char* const strModelList[RenameModelNum][2] = {
      // old name, new name
      {"DS2CD864FWD-E", "DS-2CD864FWD-E"}, {"DS2CD853F-E", "DS-2CD853F-E"},
      {"DS2CD764FWD-E", "DS-2CD764FWD-E"}, {"DS2CD783F-E", "DS-2CD783F-E"},
      {"DS2CD883F-E", "DS-2CD883F-E"},     {"DS2CD7164-E", "DS-2CD7164-E"},
      {"DS2CD7153-E", "DS-2CD7153-E"},     {"DS2CD8153F-E", "DS-2CD8153F-E"},
      {"DS2CD8254F-EI", "DS-2CD8254F-EI"}, {"DS2CD8264FWD-EI", "DS-2CD8264FWD-EI"},
      {"DS-2CD2612F-S", "DS-2CD2612F-IS"},
  };
  for (const auto& [szOld, szNew] : strModelList) {
    char szCmd[512];
    snprintf(szCmd, sizeof(szCmd),
             "UPDATE camera SET model = '%s' WHERE vendor = 'HIKVISION' AND model = '%s'", szNew,
             szOld);
    if (RunSql(szCmd) != 0) {
      return -1;
    }
  }
  return 0;
}

static int UpdateFisheyeConfDlink6010L() {
  return RunSql(
      "UPDATE camera SET fov='Original View' "
      "WHERE vendor='D-Link' AND model='DCS-6010L' AND fov=''");
}

static int UpdateFisheyeConfMobotixQ24PixordNd636() {
  return RunSteps({
      "UPDATE camera SET fov='Original View' "
      "WHERE vendor='MOBOTIX' AND model='Q24M-Sec' AND fov=''",
      "UPDATE camera SET fov='Original View' "
      "WHERE vendor='PIXORD' AND model='ND636E' AND fov=''",
  });
}

static int UpdateFisheyeConfPanasonic438() {
  return RunSteps({
      "UPDATE camera SET fov='1.3M Original View [4:3]' "
      "WHERE vendor='Panasonic-iPro' AND model='WV-SF438' AND fov='1.3M Fisheye [4:3]'",
      "UPDATE camera SET fov='3M Original View [4:3]' "
      "WHERE vendor='Panasonic-iPro' AND model='WV-SF438' AND fov='3M Fisheye [4:3]'",
  });
}

static int RenameLeveloneFCS1141ModelName() {
  return RunSql("UPDATE camera SET model = 'FCS-1141(NTSC)' WHERE model = 'FCS-1141'");
}

static int UpdateFisheyeConfAxisM3007() {
  return RunSql(
      "UPDATE camera SET channel='Original View' "
      "WHERE vendor='AXIS' AND channel='1' "
      "AND (model='M3007' OR model='M3007-P' OR model='M3007-PV')");
}

static int UpdateMultiLensMobotixD14M12() {
  return RunSql(
      "UPDATE camera SET fov='Left Lens' "
      "WHERE vendor='MOBOTIX' AND fov='' "
      "AND (model='D14D-Sec-DNight' OR model='M12D-Sec-DNight')");
}

static int UpdateToshibaIKWD01AAndIKWB70AReso() {
  return RunSql(
      "UPDATE camera SET resolution='352x240' "
      "WHERE vendor='TOSHIBA' AND (model='IK-WD01A' OR model='IK-WB70A') "
      "AND resolution='320x240';"
      "UPDATE camera SET live_resolution='352x240' "
      "WHERE vendor='TOSHIBA' AND (model='IK-WD01A' OR model='IK-WB70A') "
      "AND live_resolution='320x240';"
      "UPDATE camera SET mobile_resolution='352x240' "
      "WHERE vendor='TOSHIBA' AND (model='IK-WD01A' OR model='IK-WB70A') "
      "AND mobile_resolution='320x240';");
}

static int UpdateTrendNetAdoFmt() {
  return RunSql(
      "UPDATE camera SET audio_format=2 "
      "WHERE vendor='TRENDNet' AND (model='TV-IP312WN' OR model='TV-IP312W' OR model='TV-IP312' "
      "OR model='TV-IP422W' OR model='TV-IP422' OR model='TV-IP262P' OR model='TV-IP262PI')");
}

static int UpdateFisheyeCamStreamNo() {
  return RunSql(
      "UPDATE camera SET rec_stream_no=1 "
      "WHERE vendor='Vivotek' AND rec_stream_no=0 "
      "AND (model='FE8171V' OR model='FE8172' OR model='FE8172V' OR model = 'FE8173');"
      "UPDATE camera SET live_stream_no=2 "
      "WHERE vendor='Vivotek' AND live_stream_no=0 "
      "AND (model='FE8171V' OR model='FE8172' OR model='FE8172V' OR model = 'FE8173');"
      "UPDATE camera SET rec_stream_no=1 "
      "WHERE vendor='PIXORD' AND rec_stream_no=0 "
      "AND (model='PB670' OR model='PB670E' OR model='PD637' OR model = 'PD637E');"
      "UPDATE camera SET live_stream_no=1 "
      "WHERE vendor='PIXORD' AND live_stream_no=0 "
      "AND (model='PB670' OR model='PB670E' OR model='PD637' OR model = 'PD637E');");
}

static int UpdatePanasonicRTSPProtocol() {
  return RunSql(
      "UPDATE camera SET rtsp_protocol=1 "
      "WHERE vendor='Panasonic' AND (model='BB-HCM527' OR model='BL-C111' OR model='BL-C131' "
      "OR model='BB-HCM715' OR model='BB-HCM735' OR model='BB-HCM515' OR model='BB-HCM547') "
      "AND rtsp_protocol <> 1");
}

static int UpdateGrandstreamGXV36Series() {
  return RunSql(
      "UPDATE camera SET rec_stream_no=1 "
      "WHERE vendor='Grandstream' AND (model='GXV3651_FHD' OR model='GXV3662_FHD') "
      "AND rec_stream_no=0;"
      "UPDATE camera SET live_stream_no=1 "
      "WHERE vendor='Grandstream' AND (model='GXV3651_FHD' OR model='GXV3662_FHD') "
      "AND live_stream_no=0;"
      "UPDATE camera SET mobile_stream_no=1 "
      "WHERE vendor='Grandstream' AND (model='GXV3651_FHD' OR model='GXV3662_FHD') "
      "AND mobile_stream_no=0;"
      "UPDATE camera SET resolution='1920x1080' "
      "WHERE vendor='Grandstream' "
      "AND (model='GXV3651_FHD' OR model='GXV3662_FHD' OR model='GXV3672_FHD') "
      "AND video_type=3 AND resolution='1920x1088';"
      "UPDATE camera SET live_resolution='1920x1080' "
      "WHERE vendor='Grandstream' "
      "AND (model='GXV3651_FHD' OR model='GXV3662_FHD' OR model='GXV3672_FHD') "
      "AND video_type=3 AND live_resolution='1920x1088';"
      "UPDATE camera SET mobile_resolution='1920x1080' "
      "WHERE vendor='Grandstream' "
      "AND (model='GXV3651_FHD' OR model='GXV3662_FHD' OR model='GXV3672_FHD') "
      "AND video_type=3 AND mobile_resolution='1920x1088';");
}

static int UpdateSonyGen5MDParam() {
  return RunSql(
      "UPDATE camera SET motion_sensitivity=100-motion_threshold, motion_threshold=0 "
      "WHERE vendor='Sony' AND model='SNC-CH210' AND motion_threshold > 0");
}

static int UpdateBoschVJR811IWCVTvStandard() {
  return RunSql(
      "UPDATE camera SET tv_standard=1 "
      "WHERE vendor='BOSCH' AND model='VJR-811-IWCV' AND tv_standard=0");
}

static int UpdatePanasonicSFN631L() {
  return RunSql(
      "UPDATE camera SET osd_position=2 "
      "WHERE vendor='Panasonic-iPro' AND model='WV-SFN631L' AND osd_position<>6");
}

// Sets the bit rate of a stream before its resolution, because both conditions test the old
// resolution.
static int UpdateDAHUASD4XC212S() {
  const std::string strConstraint =
      "WHERE vendor='DAHUA' "
      "AND (model='SD40212S-HN' OR model='SD42212S-HN' OR model='SD42C212S-HN')";
  return RunProfile(
      strConstraint,
      {
          // both trailing blanks are intended
          {"UPDATE camera SET rec_cbr_bitrate=2048, fps_2=10  ",
           " AND (resolution='1280x960' OR resolution='640x480') AND rec_bitrate_ctrl=2;"},
          {"UPDATE camera SET resolution='1280x720' ",
           " AND (resolution='1280x960' OR resolution='640x480');"},
          {"UPDATE camera SET live_cbr_bitrate=2048, live_fps=10 ",
           " AND (live_resolution='1280x960' OR live_resolution='640x480')"
           " AND live_bitrate_ctrl=2;"},
          {"UPDATE camera SET live_resolution='1280x720' ",
           " AND (live_resolution='1280x960' OR live_resolution='640x480');"},
          {"UPDATE camera SET mobile_cbr_bitrate=2048, mobile_fps=10 ",
           " AND (mobile_resolution='1280x960' OR mobile_resolution='640x480')"
           " AND mobile_bitrate_ctrl=2;"},
          {"UPDATE camera SET mobile_resolution='1280x720' ",
           " AND (mobile_resolution='1280x960' OR mobile_resolution='640x480');"},
      });
}

static int UpdateWVSC385() {
  const std::string strConstraint = "WHERE vendor='Panasonic-iPro' AND model='WV-SC385'";
  return RunProfile(
      strConstraint,
      {
          {"UPDATE camera SET fov='16:9', "
           "live_stream_no=1, rec_stream_no=1, mobile_stream_no=1, ui_stream_no='1,1,1' ",
           " AND (video_type=1);"},
          {"UPDATE camera SET fov='4:3 (VGA)', "
           "live_stream_no=2, rec_stream_no=2, mobile_stream_no=2, ui_stream_no='2,2,2' ",
           " AND (video_type=2);"},
          {"UPDATE camera SET fov='16:9', "
           "live_stream_no=2, rec_stream_no=2, mobile_stream_no=2, ui_stream_no='2,2,2' ",
           " AND (video_type=3);"},
      });
}

static int UpdateTRENDNetIP311PI() {
  const std::string strConstraint = "WHERE vendor='TRENDNet' AND model='TV-IP311PI'";
  return RunProfile(
      strConstraint,
      {
          {"UPDATE camera SET "
           "live_stream_no=1, rec_stream_no=1, mobile_stream_no=1, ui_stream_no='1,1,1' ",
           " AND video_type=3 AND rec_stream_no=0;"},
          {"UPDATE camera SET "
           "live_stream_no=2, rec_stream_no=2, mobile_stream_no=2, ui_stream_no='2,2,2' ",
           " AND video_type=1 AND rec_stream_no=0;"},
          {"UPDATE camera SET "
           "rec_cbr_bitrate=12288, live_cbr_bitrate=12288, mobile_cbr_bitrate=12288 ",
           " AND rec_cbr_bitrate>12288 AND video_type=3;"},
      });
}

static int UpdatePanasoniciPro2Panasonic() {
  return RunSql("UPDATE camera SET vendor='Panasonic' WHERE vendor='Panasonic-iPro';");
}

static int RenameFoscamFI9828PModelName() {
  return RunSql("UPDATE camera SET model = 'FI9828P V2' WHERE model = 'FI9828P'");
}

static int UpdateYCamBulletHDCodec() {
  return RunSql(
      "UPDATE camera SET video_type=3 "
      "WHERE vendor='Y-CAM' AND model='BULLET HD' AND video_type=2;");
}

static int UpdateHjtICZX23Model() {
  return RunSql("UPDATE camera SET model='ICZX230' WHERE vendor='HJT' AND model='ICZX23';");
}

static int UpdateSharpLZ0P432Model() {
  return RunSql("UPDATE camera SET model='LZ0P432' WHERE vendor='SHARP' AND model='LZ0P432B';");
}

static int UpdateSharpModelNames() {
  return RunSql(
      "UPDATE camera SET model='LZ0P436' WHERE vendor='SHARP' AND model='LZ0P436B';"
      "UPDATE camera SET model='LZ0P421' WHERE vendor='SHARP' AND model='LZ0P421A';"
      "UPDATE camera SET model='LZ0P422' WHERE vendor='SHARP' AND model='LZ0P422A';"
      "UPDATE camera SET model='QG-B20C' WHERE vendor='SHARP' AND model='QB-G20C';");
}

static int UpdateTpLinkNC450() {
  return RunSql(
      "UPDATE camera SET firmware='1.20' "
      "WHERE vendor='TP-LINK' AND model='NC450' AND firmware='';");
}

// connected_wire is a string of bytes with small values, not of digits.
static std::string AddSecondOutput(std::string strConnectedWire) {
  const size_t Len = strConnectedWire.size();
  if (Len < 2) {
    return "\2\1";
  }
  strConnectedWire[0] = 2;
  if (Len > 2 && strConnectedWire[2] == 2) {
    strConnectedWire[2] = 1;
  }
  return strConnectedWire;
}

// Releases the result set on every path. KiDBFreeResult accepts null.
struct ResultOwner {
  ResultOwner() = default;
  ~ResultOwner() { KiDB::KiDBFreeResult(pResult); }
  ResultOwner(const ResultOwner&) = delete;
  ResultOwner& operator=(const ResultOwner&) = delete;
  DBResult_tag* pResult = nullptr;
};

// Runs each statement in its own transaction. Every run adds another "DO 2" row to each camera:
// only the version threshold prevents a second run.
static int UpdateAxisA8105E() {
  ResultOwner Result;
  if (RunSql("SELECT id,id_on_rec_server,owner_ds_id,connected_wire from camera "
             "WHERE vendor='AXIS' AND model='A8105-E';",
             &Result.pResult) != 0) {
    return -1;
  }
  const auto Rows = static_cast<int>(ZAMODBNumRows(Result.pResult));
  if (Rows <= 0) {
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
             "There's no info in camera table.\n");
    return 0;
  }
  for (int Idx = 0; Idx < Rows; ++Idx) {
    DBRow Row = 0;
    if (ZAMODBFetchRow(Result.pResult, &Row) != 0) {
      KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
               "Failed to get camera info.\n");
      ReportFailure(__func__, "a row of the result is missing");
      return -1;
    }
    const char* szWire = ZAMODBFetchField(Result.pResult, Row, "connected_wire");
    const std::string strConnectedWire = AddSecondOutput(szWire == nullptr ? "" : szWire);
    const int Id = KiAtoi(ZAMODBFetchField(Result.pResult, Row, "id"));
    const int IdOnRecServer = KiAtoi(ZAMODBFetchField(Result.pResult, Row, "id_on_rec_server"));
    const int OwnerDsId = KiAtoi(ZAMODBFetchField(Result.pResult, Row, "owner_ds_id"));

    if (RunSql("UPDATE camera SET connected_wire='" + strConnectedWire +
               "' WHERE vendor='AXIS' AND model='A8105-E' AND id=" + itos(Id) + ";") != 0) {
      return -1;
    }
    if (RunSql("INSERT INTO camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, "
               "name) VALUES (" +
               itos(Id) + ", " + itos(IdOnRecServer) + ", " + itos(OwnerDsId) +
               ", 1, 1, 'DO 2');") != 0) {
      return -1;
    }
  }
  return 0;
}

static int UpdateFoscam3MReso() {
  return RunSql(
      "UPDATE camera SET resolution='2304x1296' "
      "WHERE vendor='FOSCAM' AND model IN ('FI9901EP','R4') AND resolution='2048x1536';"
      "UPDATE camera SET live_resolution='2304x1296' "
      "WHERE vendor='FOSCAM' AND model IN ('FI9901EP','R4') AND live_resolution='2048x1536';"
      "UPDATE camera SET mobile_resolution='2304x1296' "
      "WHERE vendor='FOSCAM' AND model IN ('FI9901EP','R4') AND mobile_resolution='2048x1536';");
}

static int RenameASUSAiCamNightViewModel() {
  return RunSql(
      "UPDATE camera SET model='AiCam 2' WHERE vendor='ASUS' AND model='AiCam NightView';");
}

static int UpdateReolinkRLC411And423Series() {
  return RunSql(
      "UPDATE camera SET fov='4MP' "
      "WHERE vendor='Reolink' AND model IN ('RLC-423','RLC-411','RLC-411S','RLC-411WS') "
      "AND fov='';");
}

// --- Capability files ---

// The value of strKey, at most 511 bytes of it; empty if the file has no such key.
static std::string GetConfKeyValue(const ZAMOCFile& File, const std::string& strKey) {
  char szValue[512];
  snprintf(szValue, sizeof(szValue), "%s", File.Get(strKey).c_str());
  return szValue;
}

static DIR* OpenDir(const char* szDir) {
  const fileops::NoCancel Guard;  // a cancelled open would lose its descriptor
  return opendir(szDir);
}

struct DirCloser {
  void operator()(DIR* pDir) const {
    const fileops::NoCancel Guard;
    closedir(pDir);
  }
};

// The next entry other than "." and "..". Null at the end, with errno 0, and after an error.
static const dirent* NextEntry(DIR* pDir) {
  const dirent* pEntry = nullptr;
  do {
    errno = 0;
    pEntry = readdir(pDir);
  } while (pEntry != nullptr &&
           (strcmp(pEntry->d_name, ".") == 0 || strcmp(pEntry->d_name, "..") == 0));
  return pEntry;
}

// Calls pUpgradeFile for every entry of the capability directory, of any type and name, until a
// call fails. Returns -1 if a call failed or if there is no capability directory. A directory that
// cannot be opened counts as empty; a read error counts as its end, and so does a file that cannot
// be saved because another program keeps the directory locked. Reports each failure with the name
// of the calling action, which the default argument supplies.
static int ForEachCapFile(int (*pUpgradeFile)(ZAMOCFile& File),
                          const char* szAction = __builtin_FUNCTION()) {
  static ZAMOCPatience Patience;  // all walks of a run together wait so long
  if (gstrRemoteCapDir.empty()) {
    ReportFailure(szAction, "there is no capability directory");
    return -1;
  }
  char szCapPath[512];  // deliberately truncates longer names
  snprintf(szCapPath, sizeof(szCapPath), "%s", gstrRemoteCapDir.c_str());
  const std::unique_ptr<DIR, DirCloser> pDir(OpenDir(szCapPath));
  if (pDir == nullptr) {
    ReportFailure(szAction, SystemReason(szCapPath));
    return 0;
  }
  while (const dirent* pEntry = NextEntry(pDir.get())) {
    const std::string strName = pEntry->d_name;
    ZAMOCFile File(szCapPath + ("/" + strName), &Patience);
    const int Err = pUpgradeFile(File);
    const bool blEnds = Err != 0 || File.StayedLocked();
    if (!File.Error().empty()) {
      const char* szEnd = blEnds ? "; later files are left alone" : "";
      ReportFailure(szAction, strName + ": " + File.Error() + szEnd);
    }
    if (blEnds) {
      return Err == 0 ? 0 : -1;
    }
  }
  if (errno != 0) {
    ReportFailure(szAction, SystemReason(szCapPath));
  }
  return 0;
}

// Saves all changes of a file together. If only the removal of the marker were done, the next run
// would turn a continuous axis into a stepping one.
static int UpgradeOnvifConfForPtzContinuousMove() {
  return ForEachCapFile([](ZAMOCFile& File) {
    const bool blPtzContinuousMove = GetConfKeyValue(File, "ptz_continuous_move") == "yes";
    if (blPtzContinuousMove) {
      File.Remove("ptz_continuous_move");
    }
    for (const char* szAxis : {"pan", "tilt", "zoom"}) {
      if (GetConfKeyValue(File, szAxis) == "yes") {
        File.Set(szAxis, blPtzContinuousMove ? "continuous" : "step", "%s= %s\n");
      }
    }
    const int Err = File.Save();
    return blPtzContinuousMove ? Err : 0;  // only the removal of the marker must succeed
  });
}

static int UpgradeOnvifConfForContinuousPtzSpeed() {
  return ForEachCapFile([](ZAMOCFile& File) {
    if (!GetConfKeyValue(File, "ptz_speed_max").empty()) {
      return 0;
    }
    const bool blSupportPtzSpeed = GetConfKeyValue(File, "pan") == "continuous" ||
                                   GetConfKeyValue(File, "tilt") == "continuous";
    if (blSupportPtzSpeed) {
      File.Set("ptz_speed_max", "1", "%s = %s\n");
    }
    File.Save();
    return 0;
  });
}

// --- The action tables ---

// True if the thresholds ascend, every row but the last has an action, and {0, nullptr} is the
// last. Rows that always run (threshold 0) may be anywhere.
template <size_t Rows>
static constexpr bool IsActionTable(const UPD_LIST (&rgTable)[Rows]) {
  uint32_t Highest = 0;
  for (size_t Idx = 0; Idx + 1 < Rows; ++Idx) {
    const UPD_LIST& Row = rgTable[Idx];
    if (Row.orgVersion != 0 && Row.orgVersion < Highest) {
      return false;
    }
    // Under UndefinedBehaviorSanitizer, GCC folds the comparison of null with null into a constant,
    // but not that of a function with null.
    if (__builtin_constant_p(Row.pFuncUpdate == nullptr) && Row.pFuncUpdate == nullptr) {
      return false;
    }
    Highest = std::max(Highest, Row.orgVersion);
  }
  return rgTable[Rows - 1].orgVersion == 0 && rgTable[Rows - 1].pFuncUpdate == nullptr;
}

static constexpr UPD_LIST grgCamveldDBUpgradeAction[] = {
    {83, RenameAbusTvip62000Reso},
    {86, UpdateCameraModelConfRenameSiemens},
    {301, UpdateCameraModelRenameForHIKVISION},
    {303, UpdateFisheyeConfDlink6010L},
    {304, UpdateFisheyeConfMobotixQ24PixordNd636},
    {309, UpdateFisheyeConfPanasonic438},
    {309, RenameLeveloneFCS1141ModelName},
    {310, UpdateFisheyeConfAxisM3007},
    {323, UpdateMultiLensMobotixD14M12},
    {359, UpdateToshibaIKWD01AAndIKWB70AReso},
    {365, UpdateTrendNetAdoFmt},
    {418, UpdateFisheyeCamStreamNo},
    {421, UpdatePanasonicRTSPProtocol},
    {435, UpdateGrandstreamGXV36Series},
    {435, UpdateSonyGen5MDParam},
    {500, UpdateBoschVJR811IWCVTvStandard},
    {536, UpdatePanasonicSFN631L},
    {564, UpdateDAHUASD4XC212S},
    {582, UpdateWVSC385},
    {612, UpdateTRENDNetIP311PI},
    {802, UpdatePanasoniciPro2Panasonic},
    {823, RenameFoscamFI9828PModelName},
    {827, UpdateYCamBulletHDCodec},
    {1204, UpdateHjtICZX23Model},
    {2073, UpdateSharpLZ0P432Model},
    {2321, UpdateSharpModelNames},
    {2350, UpdateTpLinkNC450},
    {2401, UpdateAxisA8105E},
    {2428, UpdateFoscam3MReso},
    {2473, RenameASUSAiCamNightViewModel},
    {2475, UpdateReolinkRLC411And423Series},
    {0, nullptr},
};
static_assert(IsActionTable(grgCamveldDBUpgradeAction),
              "list the actions by ascending threshold, then {0, nullptr}");

static constexpr UPD_LIST grgCamveldRemoteCapUpgradeAction[] = {
    {68, UpgradeOnvifConfForPtzContinuousMove},
    {80, UpgradeOnvifConfForContinuousPtzSpeed},
    {0, nullptr},
};
static_assert(IsActionTable(grgCamveldRemoteCapUpgradeAction),
              "list the actions by ascending threshold, then {0, nullptr}");

static int DoAction(const UPD_LIST* pAction, uint32_t orgVer, int Idx) {
  const UPD_LIST& Row = pAction[Idx];
  if (Row.orgVersion != 0 && orgVer >= Row.orgVersion) {
    return 0;
  }
  return Row.pFuncUpdate();
}

// Runs the selected actions in order. A failed action does not stop the later ones. Returns -1 if
// any action failed, else 0.
static int DoActions(const UPD_LIST* pAction, uint32_t orgVer) {
  int Err = 0;
  for (int Idx = 0; pAction[Idx].pFuncUpdate != nullptr; ++Idx) {
    if (DoAction(pAction, orgVer, Idx) < 0) {
      Err = -1;
    }
  }
  return Err;
}

static std::string GetDefaultCapDir() {
  struct stat Stat;
  if (stat("/var/packages/Camveld/target/@camveld", &Stat) != 0 || !S_ISDIR(Stat.st_mode)) {
    return "";
  }
  return "/var/packages/Camveld/target/@camveld/@KICapInfo";
}

static void Usage() {
  ZAMOCCopyright();
  puts("Usage:\ntesselupgrader {pre-upgrade-version}|{--updateCap remote-cap-dir}");
}

int main(int argc, char* argv[]) {
  // Keep freed heap, up to 2 MB a transaction, so that the next need not ask the kernel again. That
  // saves 4 % of an upgrade of 20,000 cameras, and nothing with 160.
  mallopt(M_TRIM_THRESHOLD, 4 * 1024 * 1024);
  int Err = 0;
  if (argc == 2) {
    const auto orgVer = static_cast<uint32_t>(KiAtoi(argv[1]));
    KiPrintf(KI_LOG, nullptr, nullptr, __FILE__, __LINE__, __func__,
             "TESSEL pre-upgrade version: %u\n", orgVer);
    Err = DoActions(grgCamveldDBUpgradeAction, orgVer);
    gstrRemoteCapDir = GetDefaultCapDir();
    if (DoActions(grgCamveldRemoteCapUpgradeAction, orgVer) < 0) {
      Err = -1;
    }
    return Err;
  }
  if (argc == 3 && strcmp(argv[1], "--updateCap") == 0) {
    gstrRemoteCapDir = argv[2];
    return DoActions(grgCamveldRemoteCapUpgradeAction, 0);
  }
  Usage();
  return 1;
}
