// The daemon's command set: the settings records the web handlers fill and
// the builders that turn them into complete request maps for
// DaemonIPC::SendCommand.
//
// Every builder fills the caller's object with "action", then "need_ack" 1,
// then its own keys, and returns 0. Only CreateTaskCmd can fail (-1, after
// one error line naming the failing step); its object may then be partly
// filled and must not be sent. Booleans travel as 0 or 1, the enumerations
// as their numbers, task ids and max_version_count as unsigned integers,
// the filter lists as arrays of strings. The builders keep no state and may
// be called from several threads.
#ifndef PLOVO_IPC_PLOVO_COMMAND_H
#define PLOVO_IPC_PLOVO_COMMAND_H

#include <json/value.h>

#include <cstdint>
#include <string>

#include "common/registry.h"
#include "ipc/pobject.h"

namespace Plovo {

// A task's copy settings.
struct TaskSetting {
  std::string usb_share_name;   // the device's share; used to find the device, not sent
  std::string nas_share_name;
  std::string usb_folder_path;
  std::string nas_folder_path;
  std::string task_name;
  Registry::TASK_TYPE task_type = Registry::TASK_TYPE_IMPORT_GENERAL;
  Registry::COPY_STRATEGY copy_strategy = Registry::COPY_STRATEGY_VERSIONING;  // creation only
  bool keep_dir_structure = true;
  bool smart_create_date_dir = false;
  bool rename_photo_video = false;
  bool remove_src_file = false;
  Registry::CONFLICT_POLICY conflict_policy = Registry::CONFLICT_POLICY_RENAME;
  bool enable_rotation = false;
  uint64_t max_version_count = 256;
  Registry::ROTATION_POLICY rotation_policy = Registry::ROTATION_POLICY_OLDEST_VERSION;
};

// When a task runs.
struct TriggerTimeSetting {
  bool run_when_plug_in = false;
  bool eject_when_task_done = true;
  bool schedule_enabled = false;
  Json::Value schedule{Json::objectValue};  // sent as compact JSON text
};

// The name and extension lists of a task's filters, each a JSON array of
// strings.
struct FilterSetting {
  Json::Value white_name{Json::arrayValue};
  Json::Value white_ext{Json::arrayValue};
  Json::Value black_name{Json::arrayValue};
  Json::Value black_ext{Json::arrayValue};
  Json::Value custom_name{Json::arrayValue};
  Json::Value custom_ext{Json::arrayValue};
};

// Makes object[key] an array (empty when the JSON value holds no string)
// and appends each string element of array to it, in order; other elements
// are passed over.
void AppendJsonArrayToPObject(const Json::Value& array, const std::string& key, PObject& object);

// "add_task": resolves the device behind task.usb_share_name (its mount
// point, block device, identity, producer and product) and sends the three
// records. A device without an identity gets a new one, stored in the
// device's configuration file first so that later tasks find the same one.
int CreateTaskCmd(const TaskSetting& task, const TriggerTimeSetting& trigger,
                  const FilterSetting& filter, PObject& request);
int EnableTaskCmd(unsigned long task_id, PObject& request);
int DisableTaskCmd(unsigned long task_id, PObject& request);
int StartTaskCmd(unsigned long task_id, PObject& request);
int StopTaskCmd(unsigned long task_id, PObject& request);
int DeleteTaskCmd(unsigned long task_id, PObject& request);
int GetTaskSettingCmd(unsigned long task_id, PObject& request);
int GetFilterSettingCmd(unsigned long task_id, PObject& request);
// Never carries "copy_strategy": a task's strategy is fixed at creation.
int SetTaskSettingCmd(unsigned long task_id, const TaskSetting& task, PObject& request);
int SetTriggerTimeSettingCmd(unsigned long task_id, const TriggerTimeSetting& trigger,
                             PObject& request);
int SetFilterSettingCmd(unsigned long task_id, const FilterSetting& filter, PObject& request);
int ListTaskCmd(PObject& request);
int ListEntryCmd(PObject& request);
int SetGlobalSettingCmd(bool beep, PObject& request);

}  // namespace Plovo

#endif
