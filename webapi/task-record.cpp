// "list" and "get": the daemon's task maps as the web interface's task
// records, and the enumeration strings they carry.
#include <velt/sched.h>

#include <memory>

#include "common/log.h"
#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"
#include "webapi/plovo.h"

const std::string PlovoHandle::TYPE_IMPORT = "import_general";
const std::string PlovoHandle::TYPE_EXPORT = "export_general";
const std::string PlovoHandle::TYPE_IMPORT_PHOTO = "import_photo";
const std::string PlovoHandle::STRATEGY_VERSION = "versioning";
const std::string PlovoHandle::STRATEGY_MIRROR = "mirror";
const std::string PlovoHandle::STRATEGY_INCBKP = "incremental";
const std::string PlovoHandle::CONFLICT_RENAME = "rename";
const std::string PlovoHandle::CONFLICT_OVERWRITE = "overwrite";
const std::string PlovoHandle::ROTATION_OLDEST_VERSION = "oldest_version";
const std::string PlovoHandle::ROTATION_SMART_RECYCLE = "smart_recycle";

namespace {

// The default tasks of the front USB port and the SD card slot carry these
// in place of a device identity.
constexpr const char* kDefaultUsbUuid = "PLOVO_DEFAULT_USB_UUID";
constexpr const char* kDefaultSdUuid = "PLOVO_DEFAULT_SD_UUID";

// One enumeration's strings, indexed by value - 1.
template <typename Enum, size_t N>
Enum ToEnum(const std::string* const (&names)[N], const std::string& value) {
  for (size_t i = 0; i < N; ++i) {
    if (*names[i] == value) return static_cast<Enum>(i + 1);
  }
  return static_cast<Enum>(0);
}

template <size_t N>
std::string ToString(const std::string* const (&names)[N], int32_t value) {
  if (value < 1 || static_cast<size_t>(value) > N) return "";
  return *names[value - 1];
}

const std::string* const kTypeNames[] = {&PlovoHandle::TYPE_IMPORT, &PlovoHandle::TYPE_EXPORT,
                                         &PlovoHandle::TYPE_IMPORT_PHOTO};
const std::string* const kStrategyNames[] = {&PlovoHandle::STRATEGY_VERSION,
                                             &PlovoHandle::STRATEGY_MIRROR,
                                             &PlovoHandle::STRATEGY_INCBKP};
const std::string* const kConflictNames[] = {&PlovoHandle::CONFLICT_RENAME,
                                             &PlovoHandle::CONFLICT_OVERWRITE};
const std::string* const kRotationNames[] = {&PlovoHandle::ROTATION_OLDEST_VERSION,
                                             &PlovoHandle::ROTATION_SMART_RECYCLE};

// A device-side path as the web interface shows it: under the device's
// share when mounted, under "[USB]" when not; the device root is the share
// itself.
std::string DevicePathDisplay(const PObject& task, const std::string& path) {
  std::string shown =
      task["is_usb_mounted"].asBool() ? "/" + task["usb_share_name"].asString() : "[USB]";
  if (path != "/") shown += path;
  return shown;
}

struct SchedTaskFree {
  void operator()(PVELTSCHEDTASK task) const { VELTSchedTaskFree(task); }
};

}  // namespace

Registry::TASK_TYPE PlovoHandle::convertToEnumTT(const std::string& value) {
  return ToEnum<Registry::TASK_TYPE>(kTypeNames, value);
}
std::string PlovoHandle::convertToStringTT(Registry::TASK_TYPE value) {
  return ToString(kTypeNames, value);
}
Registry::COPY_STRATEGY PlovoHandle::convertToEnumCS(const std::string& value) {
  return ToEnum<Registry::COPY_STRATEGY>(kStrategyNames, value);
}
std::string PlovoHandle::convertToStringCS(Registry::COPY_STRATEGY value) {
  return ToString(kStrategyNames, value);
}
Registry::CONFLICT_POLICY PlovoHandle::convertToEnumCP(const std::string& value) {
  return ToEnum<Registry::CONFLICT_POLICY>(kConflictNames, value);
}
std::string PlovoHandle::convertToStringCP(Registry::CONFLICT_POLICY value) {
  return ToString(kConflictNames, value);
}
Registry::ROTATION_POLICY PlovoHandle::convertToEnumRP(const std::string& value) {
  return ToEnum<Registry::ROTATION_POLICY>(kRotationNames, value);
}
std::string PlovoHandle::convertToStringRP(Registry::ROTATION_POLICY value) {
  return ToString(kRotationNames, value);
}

Json::Value PlovoHandle::convertToJsonArray(const std::vector<PObject>& values) {
  Json::Value array(Json::arrayValue);
  for (const PObject& value : values) array.append(value.asString());
  return array;
}

std::string PlovoHandle::GetNextRunTime(int64_t scheduleId) {
  std::string next = "N/A";
  if (scheduleId == -1) return next;
  std::unique_ptr<VELTSCHEDTASK, SchedTaskFree> task(VELTSchedTaskAlloc());
  if (!task) {
    PLOVO_LIB_ERR("VELTSchedTaskAlloc() failed.\n");
    return next;
  }
  if (VELTSchedTaskLoad(scheduleId, task.get()) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskLoad() failed.\n");
  } else if (VELTSchedTaskIsEnabled(task.get())) {
    next = VELTSchedTaskGetNextTriggerTime(task.get());
  }
  return next;
}

void PlovoHandle::setJsonTask(const PObject& task, Json::Value& out) {
  const std::string uuid = task["uuid"].asString();
  const auto type = static_cast<Registry::TASK_TYPE>(task["type"].asInt32());
  out["id"] = Json::UInt64(task["id"].asUInt64());
  out["is_default_task"] = task["is_default_task"].asBool();
  out["default_device_port"] =
      uuid == kDefaultUsbUuid ? "USB" : uuid == kDefaultSdUuid ? "SD_CARD" : "NA";
  out["type"] = convertToStringTT(type);
  out["name"] = task["task_name"].asString();
  out["status"] = task["task_status"].asString();
  out["copy_file_path"] = task["copy_file_path"].asString();
  out["is_usb_mounted"] = task["is_usb_mounted"].asBool();
  out["is_nas_mounted"] = task["is_nas_mounted"].asBool();
  out["is_task_runnable"] = task["is_task_runnable"].asBool();
  out["latest_finish_time"] = Json::UInt(task["latest_finish_time"].asUInt32());
  out["error_code"] = Json::Int64(task["error_code"].asInt64());

  const std::string source = task["source_path"].asString();
  const std::string destination = task["destination_path"].asString();
  switch (type) {
    case Registry::TASK_TYPE_IMPORT_GENERAL:
    case Registry::TASK_TYPE_IMPORT_PHOTO:
      out["source_path"] = DevicePathDisplay(task, source);
      // A default task whose destination is still the root has not been
      // given one by the user yet: show it empty.
      out["destination_path"] =
          task["is_default_task"].asBool() && destination == "/" ? "" : destination;
      break;
    case Registry::TASK_TYPE_EXPORT_GENERAL:
      out["source_path"] = source;
      out["destination_path"] = DevicePathDisplay(task, destination);
      break;
    default:
      break;
  }

  out["run_when_plug_in"] = task["run_when_plug_in"].asBool();
  out["eject_when_task_done"] = task["eject_when_task_done"].asBool();
  out["copy_strategy"] =
      convertToStringCS(static_cast<Registry::COPY_STRATEGY>(task["copy_strategy"].asInt32()));
  out["not_keep_dir_structure"] = !task["keep_dir_structure"].asBool();
  out["smart_create_date_dir"] = task["smart_create_date_dir"].asBool();
  out["rename_photo_video"] = task["rename_photo_video"].asBool();
  out["remove_src_file"] = task["remove_src_file"].asBool();
  out["conflict_policy"] = convertToStringCP(
      static_cast<Registry::CONFLICT_POLICY>(task["conflict_policy"].asInt32()));
  out["enable_rotation"] = task["enable_rotation"].asBool();
  out["max_version_count"] = Json::UInt64(task["max_version_count"].asUInt64());
  out["rotation_policy"] = convertToStringRP(
      static_cast<Registry::ROTATION_POLICY>(task["rotation_policy"].asInt32()));
  const int64_t scheduleId = task["schedule_id"].asInt64();
  out["schedule_id"] = Json::Int64(scheduleId);
  out["next_run_time"] = GetNextRunTime(scheduleId);
}

int PlovoHandle::SendToDaemon(const PObject& command, PObject& reply, const char* what,
                              const char* file, int line) {
  DaemonIPC daemon;
  if (daemon.SendCommand(command, reply) >= 0) return 0;
  Plovo::LogWrite(LOG_ERR, "%s:%d Failed to send %s command, res=[%s]", Plovo::LogBaseName(file),
                  line, what, DaemonIPC::LogText(reply).c_str());
  return GetErrorCodeFromResponse(reply);
}

bool PlovoHandle::Forward(int built, const PObject& command, PObject& reply, const char* what,
                          const char* file, int line) {
  if (built != 0) {
    Plovo::LogWrite(LOG_ERR, "%s:%d Failed to get daemon command", Plovo::LogBaseName(file), line);
    response->SetError(401);
    return false;
  }
  if (int code = SendToDaemon(command, reply, what, file, line)) {
    response->SetError(code);
    return false;
  }
  return true;
}

void PlovoHandle::List() {
  Json::Value data(Json::objectValue);
  data["tasks"] = Json::Value(Json::arrayValue);
  PObject command, reply;
  if (!Forward(Plovo::ListTaskCmd(command), command, reply, "List")) return;
  Json::Value& tasks = data["tasks"];
  for (const PObject& task : reply["task_list"].asArray()) {
    Json::Value record(Json::objectValue);
    setJsonTask(task, record);
    tasks.append(std::move(record));
  }
  response->SetSuccess(data);
}

void PlovoHandle::Get() {
  const auto id = request->GetAndCheckIntegral<uint64_t>("id", VELT::PARAM_REQUIRED, nullptr);
  if (id.IsInvalid()) {
    response->SetError(402);
    return;
  }
  PObject command, reply;
  if (!Forward(Plovo::GetTaskSettingCmd(id.Get(), command), command, reply, "GetSetting")) return;
  Json::Value data(Json::objectValue);
  setJsonTask(reply, data["task"]);
  response->SetSuccess(data);
}
