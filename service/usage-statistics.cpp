#include "service/usage-statistics.h"

#include <json/value.h>
#include <json/writer.h>

#include <cstdio>
#include <list>

#include "common/file-op.h"
#include "common/log.h"
#include "common/no-throw.h"
#include "db/task-db.h"
#include "service/global-setting.h"

namespace {

constexpr int kCollectorVersion = 2;
constexpr const char* kPackageVersion = "0057";

Json::Value TaskOptions(const TaskDB::TaskInfo& task) {
  Json::Value t(Json::objectValue);
  t["task_type"] = task.task_type;
  t["is_enable"] = task.is_enable;
  t["last_copied_time"] = Json::UInt(task.last_copied_time);
  t["copy_strategy"] = task.copy_strategy;
  t["keep_dir_structure"] = task.keep_dir_structure;
  t["smart_create_date_dir"] = task.smart_create_date_dir;
  t["rename_photo_video"] = task.rename_photo_video;
  t["remove_src_file"] = task.remove_src_file;
  t["conflict_policy"] = task.conflict_policy;
  t["enable_rotation"] = task.enable_rotation;
  t["max_version_count"] = Json::UInt64(task.max_version_count);
  t["rotation_policy"] = task.rotation_policy;
  return t;
}

int Collect() {
  const std::string repo = Plovo::GlobalSetting::GetRepoVolumePath();
  const std::string path = repo + "/@Plovo/db" + "/" + "task-db.sqlite";
  // Without a recorded volume the path would name a folder at the top of
  // the system, which is no repository; and a database opened where there
  // is none would be created, and the next start would take it for an
  // install that already has its default tasks.
  TaskDB db;
  if (repo.empty() || !IsFileExist(path) || db.Initialize(path) != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to init task db at '%s'\n", path.c_str());
    return -1;
  }
  std::list<TaskDB::USBInfo> devices;
  if (db.ListUSBInfo(devices) != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to list all usb info\n");
    return -1;
  }

  Json::Value doc(Json::objectValue);
  doc["collector_version"] = kCollectorVersion;
  Json::Value& data = doc["collect_data"] = Json::Value(Json::arrayValue);
  doc["package_version"] = kPackageVersion;
  doc["beep"] = Plovo::GlobalSetting::GetBeep();
  for (const TaskDB::USBInfo& device : devices) {
    Json::Value d(Json::objectValue);
    d["usb_id"] = Json::UInt64(device.id);
    d["uuid"] = device.uuid;
    d["run_when_plug_in"] = device.run_when_plug_in;
    d["eject_when_task_done"] = device.eject_when_task_done;
    d["producer"] = device.producer;
    d["product"] = device.product;
    Json::Value& tasks = d["task_info"] = Json::Value(Json::arrayValue);
    std::list<TaskDB::TaskInfo> rows;
    if (db.ListTaskInfo(device.id, rows) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to list all task info\n");
      return -1;
    }
    for (const TaskDB::TaskInfo& task : rows) tasks.append(TaskOptions(task));
    data.append(d);
  }
  std::printf("%s", Json::StyledWriter().write(doc).c_str());
  std::fflush(stdout);
  return 0;
}

}  // namespace

int CollectUageStatistics(void) { return Plovo::NoThrow(Collect, -1); }
