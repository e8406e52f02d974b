// "get_global_setting" and "set_global_setting": the repository volume, the
// beep at a task's start and end, and how many log records are kept. Both
// run as root for their whole length; the gate lets them through in state
// 1 too, so that a user can choose a volume when none was found.
#include <sys/stat.h>
#include <velt/mount.h>

#include "common/file-op.h"
#include "common/log.h"
#include "common/run-as.h"
#include "db/log-db.h"
#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"
#include "service/global-setting.h"
#include "service/repo-volume.h"
#include "service/service-ctrl.h"
#include "webapi/plovo.h"

namespace {

// Opens the volume's log database and reads how many records it keeps. A
// failure answers 412 naming the step that failed.
bool OpenLogDB(const std::string& volume, LogDB& db, unsigned long& count,
               VELT::APIResponse* response) {
  const char* failed = nullptr;
  if (db.Initialize(volume + "/@Plovo/db" + "/" + "log-db.sqlite") != 0) {
    failed = "Failed to init log db";
  } else if (db.GetRotationCount(count) != 0) {
    failed = "Failed to get log rotation count";
  }
  if (!failed) return true;
  PLOVO_LOG(LOG_ERR, "%s", failed);
  response->SetError(412, Json::Value(failed));
  return false;
}

// Adds one entry's size to the total in context; symbolic links add
// nothing, since what they point to may lie outside the repository.
int AccumulateSize(const std::string& path, void* context) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    PLOVO_LOG(LOG_ERR, "Error stat file");
    return -1;
  }
  if (!S_ISLNK(st.st_mode)) *static_cast<unsigned long long*>(context) += st.st_size;
  return 0;
}

// Whether the volume target has room for the repository now on current.
bool HasSpaceFor(const std::string& current, const std::string& target) {
  PVELTMOUNTVOLINFO info = nullptr;
  if (VELTMountVolInfoGet(target.c_str(), &info) != 0) {
    PLOVO_LOG(LOG_ERR, "repo NOT mounted '%s'", target.c_str());
    return false;
  }
  const unsigned long long avail = info->freeBytes;
  VELTMountVolInfoFree(info);
  unsigned long long need = 0;
  if (TraverseDir(current + "/@Plovo", AccumulateSize, &need) != 0) {
    PLOVO_LOG(LOG_ERR, "traverse accumulate size fail");
    return false;
  }
  if (avail < need) {
    PLOVO_LOG(LOG_ERR, "Target vol space not enough, need[%llu] avail[%llu]", need, avail);
    return false;
  }
  return true;
}

}  // namespace

void PlovoHandle::GetGlobalSetting() {
  PLOVO_RUN_AS_ROOT(runAs);
  if (!runAs.ok()) {
    PLOVO_LOG(LOG_ERR, "Failed to run as root");
    response->SetError(401);
    return;
  }
  std::string volume = Plovo::GlobalSetting::GetRepoVolumePath();
  if (!IsRepoMounted(volume)) volume.clear();
  Json::Value data(Json::objectValue);
  data["repo_volume_path"] = volume;
  data["beep_on_task_start_end"] = Plovo::GlobalSetting::GetBeep();
  if (volume.empty()) {
    PLOVO_LOG(LOG_WARNING, "No repo volume path");
    response->SetSuccess(data);
    return;
  }
  LogDB db;
  unsigned long count = 0;
  if (!OpenLogDB(volume, db, count, response)) return;
  data["log_rotate_count"] = Json::UInt64(count);
  response->SetSuccess(data);
}

void PlovoHandle::SetGlobalSetting() {
  const auto path = request->GetAndCheckString("repo_volume_path", VELT::PARAM_REQUIRED, nullptr);
  const auto beep = request->GetAndCheckBool("beep_on_task_start_end", VELT::PARAM_REQUIRED, nullptr);
  const auto rotate =
      request->GetAndCheckIntegral<uint64_t>("log_rotate_count", VELT::PARAM_REQUIRED, nullptr);
  if (path.IsInvalid() || beep.IsInvalid() || rotate.IsInvalid()) {
    PLOVO_LOG(LOG_ERR, "Invalid parameter");
    response->SetError(402);
    return;
  }
  // "/volume2/" names the volume "/volume2": compared as written, it would
  // look like another volume and set off a move onto itself.
  std::string requested = path.Get();
  while (requested.size() > 1 && requested.back() == '/') requested.pop_back();

  PLOVO_RUN_AS_ROOT(runAs);
  if (!runAs.ok()) {
    PLOVO_LOG(LOG_ERR, "Failed to run as root");
    response->SetError(401);
    return;
  }
  if (!Plovo::GlobalSetting::SetBeep(beep.Get())) {
    PLOVO_LOG(LOG_ERR, "SetBeep() failed");
    response->SetError(401);
    return;
  }
  ServiceStatus status;
  if (GetServiceStatus(status) != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to get service status");
    response->SetError(401);
    return;
  }
  if (status.state == PLOVO_SERVICE_STATUS_RUNNING) {
    PObject command;
    if (Plovo::SetGlobalSettingCmd(beep.Get(), command) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to get daemon command");
      response->SetError(401);
      return;
    }
    PObject reply;
    if (DaemonIPC().SendCommand(command, reply) < 0) {
      PLOVO_LOG(LOG_ERR, "Failed to send command, res=[%s]", DaemonIPC::LogText(reply).c_str());
      response->SetError(GetErrorCodeFromResponse(reply));
      return;
    }
  }

  const std::string current = Plovo::GlobalSetting::GetRepoVolumePath();
  // The count lives in the repository's log database; a volume that is gone
  // has none to keep it, and must not stop the user choosing another.
  if (IsRepoMounted(current)) {
    LogDB db;
    unsigned long count = 0;
    if (!OpenLogDB(current, db, count, response)) return;
    if (count != rotate.Get() && db.UpdateRotationCount(rotate.Get()) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to set log rotation count");
      response->SetError(412, Json::Value("Failed to set log rotation count"));
      return;
    }
  }
  if (requested == current) {
    response->SetSuccess();
    return;
  }

  // The recorded path is read back through a buffer of fixed size: a longer
  // one would come back cut and name no volume.
  if (requested.size() > Plovo::GlobalSetting::kMaxRepoVolumePath || !IsRepoValid(requested)) {
    PLOVO_LOG(LOG_ERR, "check_volume() failed, volume=[%s]", requested.c_str());
    response->SetError(408);
    return;
  }
  if (IsRepoMounted(current) && !HasSpaceFor(current, requested)) {
    PLOVO_LOG(LOG_ERR, "%s has no enough space", requested.c_str());
    response->SetError(409);
    return;
  }
  if (!ChangeRepoVolume(current, requested)) {
    PLOVO_LOG(LOG_ERR, "ChangeRepoVolume() failed, from [%s] to [%s]", current.c_str(),
              requested.c_str());
    response->SetError(401);
    return;
  }
  if (!current.empty()) {
    PLOVO_LOG(LOG_ERR, "User move repo volume from [%s] to [%s].", current.c_str(),
              requested.c_str());
  } else {
    PLOVO_LOG(LOG_ERR, "User create repo volume [%s].", requested.c_str());
  }
  response->SetSuccess();
}
