#include "ipc/plovo-command.h"

#include "common/usb-device.h"
#include "common/utility.h"

namespace Plovo {
namespace {

// Every command starts the same way; the object is emptied first so that
// nothing a caller left in it is sent along.
void Begin(const char* action, PObject& request) {
  request.clear();
  request["action"] = action;
  request["need_ack"] = 1;
}

int TaskIdCmd(const char* action, unsigned long task_id, PObject& request) {
  Begin(action, request);
  request["task_id"] = task_id;
  return 0;
}

// The settings both creation and editing send; the strategy is the
// caller's business.
void PutTaskFields(const TaskSetting& task, PObject& request) {
  request["task_type"] = static_cast<int>(task.task_type);
  request["task_name"] = task.task_name;
  request["usb_folder_path"] = task.usb_folder_path;
  request["nas_folder_path"] = task.nas_folder_path;
  request["nas_share_name"] = task.nas_share_name;
  request["keep_dir_structure"] = task.keep_dir_structure;
  request["smart_create_date_dir"] = task.smart_create_date_dir;
  request["rename_photo_video"] = task.rename_photo_video;
  request["remove_src_file"] = task.remove_src_file;
  request["conflict_policy"] = static_cast<int>(task.conflict_policy);
  request["enable_rotation"] = task.enable_rotation;
  request["max_version_count"] = static_cast<unsigned long>(task.max_version_count);
  request["rotation_policy"] = static_cast<int>(task.rotation_policy);
}

void PutTriggerFields(const TriggerTimeSetting& trigger, PObject& request) {
  request["run_when_plug_in"] = trigger.run_when_plug_in;
  request["eject_when_task_done"] = trigger.eject_when_task_done;
  request["schedule_enabled"] = trigger.schedule_enabled;
  request["schedule_json_str"] = JsonToString(trigger.schedule);
}

void PutFilterFields(const FilterSetting& filter, PObject& request) {
  AppendJsonArrayToPObject(filter.white_name, "white_name", request);
  AppendJsonArrayToPObject(filter.white_ext, "white_ext", request);
  AppendJsonArrayToPObject(filter.black_name, "black_name", request);
  AppendJsonArrayToPObject(filter.black_ext, "black_ext", request);
  AppendJsonArrayToPObject(filter.custom_name, "custom_name", request);
  AppendJsonArrayToPObject(filter.custom_ext, "custom_ext", request);
}

}  // namespace

void AppendJsonArrayToPObject(const Json::Value& array, const std::string& key, PObject& object) {
  PObject::array_type& out = object[key].asArray();
  if (!array.isArray()) return;
  for (const Json::Value& item : array) {
    if (item.isString()) out.emplace_back(item.asString());
  }
}

int CreateTaskCmd(const TaskSetting& task, const TriggerTimeSetting& trigger,
                  const FilterSetting& filter, PObject& request) {
  USBDevice device;
  if (ResolveUSBDevice(task.usb_share_name, device) < 0) return -1;
  Begin("add_task", request);
  request["uuid"] = device.uuid;
  request["usb_share_path"] = device.share_path;
  request["producer"] = device.producer;
  request["product"] = device.product;
  PutTaskFields(task, request);
  request["copy_strategy"] = static_cast<int>(task.copy_strategy);
  PutTriggerFields(trigger, request);
  PutFilterFields(filter, request);
  return 0;
}

int EnableTaskCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("enable_task", task_id, request);
}

int DisableTaskCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("disable_task", task_id, request);
}

int StartTaskCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("run_task", task_id, request);
}

int StopTaskCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("cancel_task", task_id, request);
}

int DeleteTaskCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("remove_task", task_id, request);
}

int GetTaskSettingCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("get_task_setting", task_id, request);
}

int GetFilterSettingCmd(unsigned long task_id, PObject& request) {
  return TaskIdCmd("get_filter_setting", task_id, request);
}

int SetTaskSettingCmd(unsigned long task_id, const TaskSetting& task, PObject& request) {
  TaskIdCmd("set_task_setting", task_id, request);
  PutTaskFields(task, request);
  return 0;
}

int SetTriggerTimeSettingCmd(unsigned long task_id, const TriggerTimeSetting& trigger,
                             PObject& request) {
  TaskIdCmd("set_trigger_time_setting", task_id, request);
  PutTriggerFields(trigger, request);
  return 0;
}

int SetFilterSettingCmd(unsigned long task_id, const FilterSetting& filter, PObject& request) {
  TaskIdCmd("set_filter_setting", task_id, request);
  PutFilterFields(filter, request);
  return 0;
}

int ListTaskCmd(PObject& request) {
  Begin("list_task", request);
  return 0;
}

int ListEntryCmd(PObject& request) {
  Begin("list_entry", request);
  return 0;
}

int SetGlobalSettingCmd(bool beep, PObject& request) {
  Begin("set_global_setting", request);
  request["beep_on_task_start_end"] = beep;
  return 0;
}

}  // namespace Plovo
