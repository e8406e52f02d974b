#include "daemon/task-store.h"

#include <json/json.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <map>
#include <sstream>

#include "common/file-op.h"
#include "common/log.h"
#include "filter/file-filter.h"
#include "service/schedule.h"

namespace plovod {

namespace {

const char* const kUserConfig = "user.config";
const char* const kBlackList = "blacklist.filter";
const char* const kWhiteList = "whitelist.filter";
// Written beside the real files first, so that a failed write leaves the
// task's lists as they were.
const char* const kNew = ".new";

// Whether the web interface's timetable names one: "{}" (or nothing) means
// the task has none. False for text that is not a JSON object.
bool ParseTimetable(const std::string& text, bool& present) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  if (text.empty()) {
    present = false;
    return true;
  }
  if (!reader->parse(text.data(), text.data() + text.size(), &value, &errors) || !value.isObject()) {
    return false;
  }
  present = !value.empty();
  return true;
}

Json::Value JsonList(const std::vector<std::string>& items) {
  Json::Value list(Json::arrayValue);
  for (const std::string& item : items) list.append(item);
  return list;
}

bool WriteText(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::trunc);
  out << text;
  out.close();
  return !out.fail();
}

}  // namespace

int TaskStore::Open() {
  const std::string path = repo_ + "/db/task-db.sqlite";
  if (db_.Initialize(path) != 0) {
    PLOVO_LOG(LOG_ERR, "cannot open the task database at '%s'", path.c_str());
    return -1;
  }
  return 0;
}

std::string TaskStore::TaskDir(unsigned long id) const { return repo_ + "/task/" + std::to_string(id); }

Code TaskStore::List(std::vector<StoredTask>& tasks) {
  std::list<TaskDB::TaskInfo> rows;
  std::list<TaskDB::USBInfo> devices;
  if (db_.ListTaskInfo(rows) != 0 || db_.ListUSBInfo(devices) != 0) return kFailed;
  std::map<unsigned long, TaskDB::USBInfo> byId;
  for (const TaskDB::USBInfo& device : devices) byId[device.id] = device;
  tasks.clear();
  for (const TaskDB::TaskInfo& row : rows) tasks.push_back({row, byId[row.usb_id]});
  std::sort(tasks.begin(), tasks.end(),
            [](const StoredTask& a, const StoredTask& b) { return a.info.id < b.info.id; });
  return kOk;
}

Code TaskStore::Get(unsigned long id, StoredTask& task) {
  const int found = db_.GetTaskInfo(id, task.info);
  if (found < 0) return kFailed;
  if (found == 0) return kNoSuchTask;
  if (db_.GetUSBInfo(task.info.usb_id, task.device) < 0) return kFailed;
  return kOk;
}

Code TaskStore::NameTaken(const std::string& name, unsigned long except) {
  std::list<TaskDB::TaskInfo> rows;
  if (db_.ListTaskInfo(rows) != 0) return kFailed;
  for (const TaskDB::TaskInfo& row : rows) {
    if (row.id != except && row.task_name == name) return kConflict;
  }
  return kOk;
}

Code TaskStore::Add(const TaskDB::USBInfo& device, TaskDB::TaskInfo& info, const Trigger& trigger,
                    const Filters& filters) {
  if (Code taken = NameTaken(info.task_name, 0)) return taken;
  bool present = false;
  if (!ParseTimetable(trigger.schedule_json, present)) return kBadRequest;

  TaskDB::USBInfo row = device;
  row.run_when_plug_in = trigger.run_when_plug_in;
  row.eject_when_task_done = trigger.eject_when_task_done;
  TaskDB::USBInfo known;
  const int found = db_.GetUSBInfoByUUID(device.uuid, known);
  if (found < 0) return kFailed;
  if (found == 0 && db_.AddUSBInfo(row, row.id) != 0) return kFailed;
  if (found == 1) row.id = known.id;

  info.usb_id = row.id;
  info.schedule_id = -1;
  if (db_.AddTaskInfo(info, info.id) != 0) {
    if (found == 0) db_.RemoveUSBInfo(row.id);
    return kFailed;
  }
  // From here on a failure removes the task again; the trigger removes a
  // device row that it leaves without tasks.
  const std::string dir = TaskDir(info.id);
  auto undo = [&](Code code) {
    db_.RemoveTaskInfo(info.id);
    FSRemove(dir, true);
    return code;
  };
  if (FSMKDir(dir, true, -1, -1) != 0) {
    PLOVO_LOG(LOG_ERR, "cannot create the task folder '%s'", dir.c_str());
    return undo(kFailed);
  }
  if (Code failed = WriteFilters(dir, filters)) return undo(failed);
  long scheduleId = -1;
  if (Code failed = CreateEntry(info, trigger, scheduleId)) return undo(failed);
  if (scheduleId != -1) {
    info.schedule_id = scheduleId;
    if (db_.UpdateTaskInfo(info) != 0) {
      Plovo::RemoveSchedule(scheduleId);
      return undo(kFailed);
    }
  }
  if (found == 1 && db_.UpdateUSBInfo(row) != 0) {
    if (scheduleId != -1) Plovo::RemoveSchedule(scheduleId);
    return undo(kFailed);
  }
  return kOk;
}

Code TaskStore::Update(const TaskDB::TaskInfo& info) {
  std::lock_guard<std::mutex> lock(rowMutex_);
  StoredTask old;
  if (Code missing = Get(info.id, old)) return missing;
  if (Code taken = NameTaken(info.task_name, info.id)) return taken;
  // The settings are the caller's; what runs, triggers and enable wrote
  // meanwhile is kept.
  TaskDB::TaskInfo row = info;
  row.usb_id = old.info.usb_id;
  row.is_enable = old.info.is_enable;
  row.schedule_id = old.info.schedule_id;
  row.last_copied_time = old.info.last_copied_time;
  row.error = old.info.error;
  const bool renamed = row.schedule_id != -1 && row.task_name != old.info.task_name;
  if (renamed && !Plovo::UpdateScheduleName(row.schedule_id, row.task_name)) return kFailed;
  if (db_.UpdateTaskInfo(row) != 0) {
    if (renamed) Plovo::UpdateScheduleName(row.schedule_id, old.info.task_name);
    return kFailed;
  }
  return kOk;
}

Code TaskStore::CreateEntry(const TaskDB::TaskInfo& info, const Trigger& trigger, long& scheduleId) {
  bool present = false;
  if (!ParseTimetable(trigger.schedule_json, present)) return kBadRequest;
  scheduleId = -1;
  if (!present) return kOk;
  int64_t created = -1;
  if (!Plovo::CreateSchedule(info.id, info.task_type, info.task_name, trigger.schedule_enabled,
                             trigger.schedule_json, created)) {
    return kBadRequest;
  }
  scheduleId = created;
  return kOk;
}

Code TaskStore::SetTrigger(unsigned long id, const Trigger& trigger, long& scheduleId) {
  std::lock_guard<std::mutex> lock(rowMutex_);
  StoredTask task;
  if (Code missing = Get(id, task)) return missing;
  bool present = false;
  if (!ParseTimetable(trigger.schedule_json, present)) return kBadRequest;
  // The device's settings first: they are put back when the entry or the
  // row cannot follow, so that the three never disagree.
  const TaskDB::USBInfo oldDevice = task.device;
  task.device.run_when_plug_in = trigger.run_when_plug_in;
  task.device.eject_when_task_done = trigger.eject_when_task_done;
  if (db_.UpdateUSBInfo(task.device) != 0) return kFailed;
  auto undo = [&](Code code) {
    db_.UpdateUSBInfo(oldDevice);
    return code;
  };
  const long old = task.info.schedule_id;
  scheduleId = old;
  if (present && old != -1) {
    return Plovo::UpdateScheduleContent(old, trigger.schedule_enabled, trigger.schedule_json) ? kOk
                                                                                              : undo(kBadRequest);
  }
  if (present) {
    if (Code refused = CreateEntry(task.info, trigger, scheduleId)) return undo(refused);
    task.info.schedule_id = scheduleId;
    if (db_.UpdateTaskInfo(task.info) != 0) {
      Plovo::RemoveSchedule(scheduleId);
      return undo(kFailed);
    }
    return kOk;
  }
  if (old == -1) return kOk;
  // No timetable any more: the row lets go of the entry before it goes, and
  // takes it back if it cannot go.
  task.info.schedule_id = scheduleId = -1;
  if (db_.UpdateTaskInfo(task.info) != 0) return undo(kFailed);
  if (!Plovo::RemoveSchedule(old)) {
    task.info.schedule_id = scheduleId = old;
    db_.UpdateTaskInfo(task.info);
    return undo(kFailed);
  }
  return kOk;
}

Code TaskStore::WriteFilters(const std::string& dir, const Filters& filters) {
  Json::Value config(Json::objectValue);
  config["user_defined_names"] = JsonList(filters.custom_name);
  config["user_defined_extensions"] = JsonList(filters.custom_ext);
  const std::string white = dir + "/" + kWhiteList, black = dir + "/" + kBlackList,
                    user = dir + "/" + kUserConfig;
  // The members were checked when the request was read: what fails here
  // is the disk.
  Code result = kOk;
  if (WriteWhiteList(white + kNew, filters.white_name, filters.white_ext) != 0 ||
      WriteBlackList(black + kNew, filters.black_name, filters.black_ext) != 0 ||
      !WriteText(user + kNew, Json::FastWriter().write(config))) {
    result = kFailed;
  } else {
    for (const std::string& path : {white, black, user}) {
      if (rename((path + kNew).c_str(), path.c_str()) != 0) result = kFailed;
    }
  }
  for (const std::string& path : {white, black, user}) unlink((path + kNew).c_str());
  if (result != kOk) PLOVO_LOG(LOG_ERR, "cannot write the lists of '%s'", dir.c_str());
  return result;
}

Code TaskStore::SetFilters(unsigned long id, const Filters& filters) {
  StoredTask task;
  if (Code missing = Get(id, task)) return missing;
  return WriteFilters(TaskDir(id), filters);
}

Code TaskStore::GetFilters(unsigned long id, Filters& filters) {
  StoredTask task;
  if (Code missing = Get(id, task)) return missing;
  const std::string dir = TaskDir(id);
  if (ReadWhiteList(dir + "/" + kWhiteList, filters.white_name, filters.white_ext) != 0 ||
      ReadBlackList(dir + "/" + kBlackList, filters.black_name, filters.black_ext) != 0) {
    return kFailed;
  }
  std::ifstream in(dir + "/" + kUserConfig);
  Json::Value config;
  Json::CharReaderBuilder builder;
  std::string errors;
  if (!in || !Json::parseFromStream(builder, in, &config, &errors) || !config.isObject()) return kFailed;
  for (const auto& [key, list] : {std::pair{"user_defined_names", &filters.custom_name},
                                  std::pair{"user_defined_extensions", &filters.custom_ext}}) {
    for (const Json::Value& item : config[key]) {
      if (item.isString()) list->push_back(item.asString());
    }
  }
  return kOk;
}

Code TaskStore::Enable(unsigned long id, bool enable) {
  StoredTask task;
  if (Code missing = Get(id, task)) return missing;
  return db_.EnableTaskInfo(id, enable) == 0 ? kOk : kFailed;
}

Code TaskStore::Remove(unsigned long id) {
  StoredTask task;
  if (Code missing = Get(id, task)) return missing;
  if (db_.RemoveTaskInfo(id) != 0) return kFailed;
  // The row is what makes a task; an entry or folder left behind by a
  // failure here is logged and harmless (the entry's run finds no task).
  if (task.info.schedule_id != -1) Plovo::RemoveSchedule(task.info.schedule_id);
  if (FSRemove(TaskDir(id), true) != 0) PLOVO_LOG(LOG_ERR, "cannot remove the folder of task %lu", id);
  return kOk;
}

void TaskStore::ForgetCopies(unsigned long id) {
  for (const char* suffix : {"", "-wal", "-shm"}) unlink((TaskDir(id) + "/file-db.sqlite" + suffix).c_str());
}

void TaskStore::RecordRun(unsigned long id, int error, unsigned int finishTime) {
  std::lock_guard<std::mutex> lock(rowMutex_);
  if (db_.UpdateTaskInfo(id, error, finishTime) != 0) PLOVO_LOG(LOG_ERR, "cannot record the run of task %lu", id);
}

}  // namespace plovod
