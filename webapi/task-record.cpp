// "list" and "get": the daemon's task maps as the web interface's task
// records.
#include <velt/sched.h>

#include <memory>

#include "common/log.h"
#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"
#include "webapi/plovo.h"

namespace {

// The default tasks of the front USB port and the SD card slot carry these
// in place of a device identity.
constexpr const char* kDefaultUsbUuid = "PLOVO_DEFAULT_USB_UUID";
constexpr const char* kDefaultSdUuid = "PLOVO_DEFAULT_SD_UUID";

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
  PObject reply;
  if (!ForwardTaskIdCmd(Plovo::GetTaskSettingCmd, reply, "GetSetting")) return;
  Json::Value data(Json::objectValue);
  setJsonTask(reply, data["task"]);
  response->SetSuccess(data);
}
