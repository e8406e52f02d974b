#include "service/schedule.h"

#include <json/json.h>
#include <velt/sched.h>

#include <algorithm>
#include <iterator>
#include <memory>
#include <utility>

#include "common/log.h"
#include "common/paths.h"

namespace Plovo {

const char* const kScheduleApp = "VELT.QXS.Plovo.Application";

namespace {

// The scheduler keeps each entry in a file of its own, read whole when the
// package's entries are listed: one entry too large to read would stop
// show, hide and remove for every entry. Task names and timetables are far
// shorter than these.
constexpr size_t kMaxNameBytes = 1024;
constexpr size_t kMaxTimetableBytes = 16 * 1024;

struct SchedTaskFree {
  void operator()(PVELTSCHEDTASK task) const { VELTSchedTaskFree(task); }
};
using SchedTask = std::unique_ptr<VELTSCHEDTASK, SchedTaskFree>;

struct SchedListFree {
  void operator()(PVELTSCHEDTASKLIST list) const { VELTSchedTaskListFree(list); }
};
using SchedList = std::unique_ptr<VELTSCHEDTASKLIST, SchedListFree>;

// The desktop shows the entry with the icon of the task's kind.
const char* IconKey(int taskType) {
  switch (taskType) {
    case 1: return "#type:icon_import_general#";
    case 2: return "#type:icon_export_general#";
    case 3: return "#type:icon_import_photo#";
    default: return "";
  }
}

std::string CompactJson(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

// The web interface's timetable in the scheduler's words, set on task.
bool ConvertScheduleJson(const std::string& scheduleJson, PVELTSCHEDTASK task) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value input;
  std::string errors;
  const char* begin = scheduleJson.data();
  if (scheduleJson.size() > kMaxTimetableBytes ||
      !reader->parse(begin, begin + scheduleJson.size(), &input, &errors) || !input.isObject()) {
    PLOVO_LIB_ERR("parse json[%s] failed\n", scheduleJson.c_str());
    return false;
  }
  Json::Value converted(Json::objectValue);
  Json::Value& schedule = converted["schedule"] = input;
  for (const auto& [from, to] : {std::pair<const char*, const char*>{"minute", "min"},
                                 {"week_day", "week_name"},
                                 {"repeat_date", "repeat"}}) {
    if (input.isMember(from)) schedule[to] = input[from];
  }
  schedule.removeMember("minute");
  if (VELTSchedTaskConvertFromJson_Schedule(converted, task) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskConvertFromJson_Schedule() failed, converted_json[%s]\n",
                  CompactJson(converted).c_str());
    return false;
  }
  return true;
}

bool IsPackageEntry(const VELTSCHEDTASK* task) {
  std::string app;
  return VELTSchedCTaskGetApp(task, app) >= 0 && app == kScheduleApp;
}

// Visits every entry of the package with visit; false when the list cannot
// be read.
template <typename Visit>
bool ForEachPackageEntry(Visit visit) {
  PVELTSCHEDTASKLIST raw = nullptr;
  if (VELTSchedTaskListGet(&raw, IsPackageEntry) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskListGet() failed\n");
    return false;
  }
  SchedList list(raw);
  while (PVELTSCHEDTASK task = VELTSchedTaskNext(list.get())) visit(task);
  return true;
}

bool SetAllListable(bool listable) {
  return ForEachPackageEntry([listable](PVELTSCHEDTASK task) {
    if (VELTSchedTaskIsListable(task) == listable) return;
    int64_t id = -1;
    VELTSchedCTaskGetID(task, &id);
    if (VELTSchedCTaskSetListable(task, listable ? 1 : 0) < 0 || VELTSchedTaskSave(task) < 0) {
      PLOVO_LIB_ERR("Failed to set listable %d of schedule %lld\n", listable ? 1 : 0,
                    static_cast<long long>(id));
    }
  });
}

// Allocates and loads the entry id; null after the log line.
SchedTask LoadEntry(int64_t scheduleId) {
  SchedTask task(VELTSchedTaskAlloc());
  if (!task) {
    PLOVO_LIB_ERR("VELTSchedTaskAlloc() failed.\n");
    return nullptr;
  }
  if (VELTSchedTaskLoad(scheduleId, task.get()) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskLoad() failed.\n");
    return nullptr;
  }
  return task;
}

bool IsUsableName(const std::string& name) {
  if (name.size() > kMaxNameBytes || name.find('\0') != std::string::npos) {
    PLOVO_LIB_ERR("Invalid schedule name of %zu bytes\n", name.size());
    return false;
  }
  return true;
}

bool SaveEntry(PVELTSCHEDTASK task) {
  if (VELTSchedTaskSave(task) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskSave() failed.\n");
    return false;
  }
  return true;
}

}  // namespace

bool CreateSchedule(unsigned long taskId, int taskType, const std::string& name, bool enabled,
                    const std::string& scheduleJson, int64_t& scheduleId) {
  if (!IsUsableName(name)) return false;
  SchedTask task(VELTSchedTaskAlloc());
  if (!task) {
    PLOVO_LIB_ERR("VELTSchedTaskAlloc() failed\n");
    return false;
  }
  if (!ConvertScheduleJson(scheduleJson, task.get())) {
    PLOVO_LIB_ERR("ConvertScheduleJson() failed\n");
    return false;
  }
  std::string command = Path::NotifierProgram() + " --execute-task " + std::to_string(taskId);
  PVELTSCHEDTASK t = task.get();
  // The entry belongs to root and to the package: the user may run it but
  // neither rename it, give it away nor delete it.
  const int results[] = {
      VELTSchedCTaskSetApp(t, kScheduleApp),
      VELTSchedCTaskSetAppName(t, "#common:app_name#"),
      VELTSchedCTaskSetName(t, name.c_str()),
      VELTSchedCTaskSetAction(t, IconKey(taskType)),
      VELTSchedCTaskSetCommand(t, command.c_str()),
      VELTSchedCTaskSetState(t, enabled ? 1 : 0),
      VELTSchedCTaskSetCanRunAppSameTime(t, 1),
      VELTSchedCTaskSetCanRunTaskSameTime(t, 1),
      VELTSchedCTaskSetCanRunFromUI(t, 1),
      VELTSchedCTaskSetOwner(t, 0),
      VELTSchedCTaskSetCanEditName(t, 0),
      VELTSchedCTaskSetCanEditOwner(t, 0),
      VELTSchedCTaskSetCanDeleteFromUI(t, 0),
  };
  const bool failed = std::any_of(std::begin(results), std::end(results), [](int r) { return r < 0; });
  if (failed) {
    PLOVO_LIB_ERR("Failed to set the fields of the schedule of task %lu\n", taskId);
    return false;
  }
  if (VELTSchedTaskSave(t) < 0) {
    PLOVO_LIB_ERR("VELTSchedTaskSave() failed\n");
    return false;
  }
  if (VELTSchedCTaskGetID(t, &scheduleId) < 0) {
    PLOVO_LIB_ERR("VELTSchedCTaskGetID() failed\n");
    return false;
  }
  return true;
}

bool UpdateScheduleName(int64_t scheduleId, const std::string& name) {
  if (!IsUsableName(name)) return false;
  SchedTask task = LoadEntry(scheduleId);
  if (!task) return false;
  if (VELTSchedCTaskSetName(task.get(), name.c_str()) < 0) {
    PLOVO_LIB_ERR("Failed to set the name of schedule %lld\n", static_cast<long long>(scheduleId));
    return false;
  }
  return SaveEntry(task.get());
}

bool UpdateScheduleContent(int64_t scheduleId, bool enabled, const std::string& scheduleJson) {
  SchedTask task = LoadEntry(scheduleId);
  if (!task) return false;
  if (VELTSchedCTaskSetState(task.get(), enabled ? 1 : 0) < 0) {
    PLOVO_LIB_ERR("Failed to set the state of schedule %lld\n", static_cast<long long>(scheduleId));
    return false;
  }
  if (!ConvertScheduleJson(scheduleJson, task.get())) {
    PLOVO_LIB_ERR("ConvertScheduleJson() failed.\n");
    return false;
  }
  return SaveEntry(task.get());
}

bool ShowAllSchedule() { return SetAllListable(true); }

bool HideAllSchedule() { return SetAllListable(false); }

bool RemoveSchedule(int64_t scheduleId) {
  if (VELTSchedTaskRemove(scheduleId) < 0 && VLIBCErrGet() != VLIBC_ERR_NOT_FOUND) {
    PLOVO_LIB_ERR("Failed to remove schedule %lld\n", static_cast<long long>(scheduleId));
    return false;
  }
  return true;
}

bool RemoveAllSchedule() {
  return ForEachPackageEntry([](PVELTSCHEDTASK task) {
    int64_t id = -1;
    if (VELTSchedCTaskGetID(task, &id) < 0 || VELTSchedTaskRemove(id) < 0) {
      PLOVO_LIB_ERR("Failed to remove schedule %lld\n", static_cast<long long>(id));
    }
  });
}

}  // namespace Plovo
