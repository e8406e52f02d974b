#include "service/global-setting.h"

#include <strings.h>
#include <velt/vlibc.h>

#include "common/log.h"
#include "common/paths.h"

namespace Plovo {
namespace {

constexpr size_t kRepoPathSize = GlobalSetting::kMaxRepoVolumePath + 1;
constexpr size_t kBeepSize = 5;

void LogReadFailure(const char* file, int line) {
  LogWrite(LOG_ERR, "%s:%d VLIBCFileGetKeyValue() failed[0x%04X %s:%d]", file, line,
           static_cast<unsigned>(VLIBCErrGet()), VLIBCErrorGetFile(), VLIBCErrorGetLine());
}

}  // namespace

std::string GlobalSetting::GetRepoVolumePath() {
  char value[kRepoPathSize] = {};
  if (VLIBCFileGetKeyValue(Path::SettingFile().c_str(), "repo_vol_path", value, sizeof(value),
                           0) < 0) {
    LogReadFailure(PLOVO_FILE_NAME, __LINE__);
    return "";
  }
  return value;
}

bool GlobalSetting::GetBeep() {
  char value[kBeepSize] = {};
  if (VLIBCFileGetKeyValue(Path::SettingFile().c_str(), "beep", value, sizeof(value), 0) < 0) {
    LogReadFailure(PLOVO_FILE_NAME, __LINE__);
    return false;
  }
  return strcasecmp(value, "yes") == 0;
}

bool GlobalSetting::SetBeep(bool enable) {
  if (VLIBCFileSetKeyValue(Path::SettingFile().c_str(), "beep", enable ? "yes" : "no",
                           "%s=\"%s\"\n") < 0) {
    PLOVO_LOG(LOG_ERR, "VLIBCFileSetKeyValue() failed, beep=[%d],[0x%04X %s:%d]", enable ? 1 : 0,
              static_cast<unsigned>(VLIBCErrGet()), VLIBCErrorGetFile(), VLIBCErrorGetLine());
    return false;
  }
  return true;
}

bool GlobalSetting::InitBeep() {
  char value[kBeepSize] = {};
  const int found =
      VLIBCFileGetKeyValue(Path::SettingFile().c_str(), "beep", value, sizeof(value), 0);
  if (found < 0) {
    LogReadFailure(PLOVO_FILE_NAME, __LINE__);
    return false;
  }
  return found > 0 || SetBeep(true);
}

}  // namespace Plovo

bool init_global_setting() { return Plovo::GlobalSetting::InitBeep(); }
