#include "updater/updater-v1.h"

#include <json/json.h>

#include <list>
#include <string>
#include <utility>
#include <vector>

#include "common/file-op.h"
#include "common/log.h"
#include "db/task-db-schema.h"
#include "db/task-db.h"
#include "service/schedule.h"
#include "updater/updater-utils.h"

namespace {

const char* const kWorkingCopySuffix = ".bkp_v1";
// Where a replaced file database waits until the task database is replaced.
const char* const kKeptSuffix = ".old_v1";

// The old path indexes of a file database give way to the names the copy
// engine creates.
const char* const kFileDBScript =
    "DROP INDEX IF EXISTS file_info_table_src_path_idx; "
    "DROP INDEX IF EXISTS file_info_table_dst_path_idx; "
    "CREATE INDEX IF NOT EXISTS file_info_src_path_idx on file_info_table(source_path); "
    "CREATE INDEX IF NOT EXISTS file_info_dst_path_idx on file_info_table(destination_path); ";

// The task table rebuilt with the version 2 columns: rename_photo_file
// becomes rename_photo_video and the new columns get their defaults. The
// device trigger names the task table in its body, which the rename would
// point at the old table; it is made again once the new table stands.
const char* const kTaskDBScript =
    "DROP TRIGGER IF EXISTS usb_info_delete_trigger;"
    "ALTER TABLE task_info_table RENAME TO task_info_table_old;"
    PLOVO_TASK_INFO_TABLE
    " INSERT INTO task_info_table ( "
    " id, usb_id, is_enable, task_name, task_type, "
    " usb_folder_path, nas_folder_path, nas_share_name, last_copied_time, copy_strategy, "
    " keep_dir_structure, smart_create_date_dir, conflict_policy, error, "
    " rename_photo_video, remove_src_file, enable_rotation, max_version_count, rotation_policy, schedule_id ) "
    " SELECT id, usb_id, is_enable, task_name, task_type, "
    " usb_folder_path, nas_folder_path, nas_share_name, last_copied_time, copy_strategy, "
    " keep_dir_structure, smart_create_date_dir, conflict_policy, error, "
    " rename_photo_file, "
    "0, 0, 256, 1, -1"
    " FROM task_info_table_old; "
    // The old table's id counter goes on, so that the id of a task deleted
    // before the migration is never given again (its folder may remain).
    " DELETE FROM sqlite_sequence WHERE name = 'task_info_table'; "
    " UPDATE sqlite_sequence SET name = 'task_info_table' WHERE name = 'task_info_table_old'; "
    " DROP TABLE IF EXISTS task_info_table_old; "
    PLOVO_TASK_INFO_INDEXES
    PLOVO_USB_INFO_DELETE_TRIGGER
    PLOVO_TASK_INFO_DELETE_TRIGGER
    " INSERT or REPLACE into config_table VALUES ('version', 2); ";

std::string TaskDBPath(const std::string& repoPath) { return repoPath + "/db/" + "task-db.sqlite"; }

std::string FileDBPath(const std::string& repoPath, uint64_t taskId) {
  return repoPath + "/task/" + std::to_string(taskId) + "/file-db.sqlite";
}

std::string WorkingCopy(const std::string& path) { return path + kWorkingCopySuffix; }

void ReadTaskInfoV1(sqlite3_stmt* statement, TaskInfoV1& info) {
  info.id = sqlite3_column_uint64(statement, 0);
  info.usb_id = sqlite3_column_uint64(statement, 1);
  info.task_name = sqlite3_column_string(statement, 2);
  info.task_type = static_cast<Registry::TASK_TYPE>(sqlite3_column_int(statement, 3));
}

// A task's timetable until its owner sets one: every day at midnight, from
// today. The entry is made disabled, so it does not run.
int DefaultScheduleContent(std::string& content) {
  std::string today;
  if (GetTimeStr("%Y/%m/%d", today) != 0) {
    PLOVO_LIB_ERR("Failed to get time str\n");
    return -1;
  }
  Json::Value schedule(Json::objectValue);
  schedule["date_type"] = 0;
  schedule["week_day"] = "0,1,2,3,4,5,6";
  schedule["date"] = today;
  schedule["repeat_date"] = 0;
  schedule["hour"] = 0;
  schedule["minute"] = 0;
  schedule["repeat_hour"] = 0;
  schedule["last_work_hour"] = 0;
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  content = Json::writeString(builder, schedule);
  return 0;
}

// Removes the working copies and the kept old files whatever happened:
// after a successful replace there is no copy left, and a kept file that
// was put back is gone too.
class WorkingCopies {
 public:
  ~WorkingCopies() {
    for (const std::string& file : files_) RemoveDBFiles(file);
  }
  const std::string& Add(const std::string& live) {
    files_.push_back(WorkingCopy(live));
    return files_.back();
  }
  void AddKept(const std::string& kept) { files_.push_back(kept); }
  // Leaves the file in place.
  void Release(const std::string& file) { files_.remove(file); }

 private:
  std::list<std::string> files_;  // references stay valid as files are added
};

}  // namespace

bool UpdaterV1::IsNeedV1Update(unsigned int version) { return version == 1; }

bool UpdaterV1::IsDefaultTask(const std::string& uuid) {
  return uuid == "PLOVO_DEFAULT_USB_UUID" || uuid == "PLOVO_DEFAULT_SD_UUID";
}

int UpdaterV1::Run() {
  const std::string path = TaskDBPath(GetRepoPath());
  if (!IsFileExist(path)) {
    PLOVO_LIB_ERR("UpdaterV1: task db '%s' does not exist\n", path.c_str());
    return -1;
  }
  unsigned int version = 0;
  if (GetDBVersion(path, version) != 1) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to get task db version '%s'\n", path.c_str());
    return -1;
  }
  if (!IsNeedV1Update(version)) {
    PLOVO_LIB_INFO("UpdaterV1: task_db_version (%u) \n", version);
    return 0;
  }
  return MigrateAll(path);
}

int UpdaterV1::MigrateAll(const std::string& path) {
  // Every working copy is made and changed before any live file is
  // replaced, so that a failure up to then leaves every database as it was.
  // The task database goes last: its version 2 says the migration is done.
  // The file databases replaced before it are kept aside until then and put
  // back if it fails.
  WorkingCopies copies;
  std::list<uint64_t> ids;
  if (ListIncrementalTasks(path, ids) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to update file db\n");
    return -1;
  }
  std::vector<std::pair<uint64_t, std::string>> fileDBs;
  for (uint64_t id : ids) {
    std::string fileDB = FileDBPath(GetRepoPath(), id);
    if (CheckFileDB(fileDB) != 0) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db\n");
      return -1;
    }
    if (PrepareFileDB(fileDB, copies.Add(fileDB)) != 0) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db for task '%lu'\n", static_cast<unsigned long>(id));
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db\n");
      return -1;
    }
    fileDBs.emplace_back(id, fileDB);
  }
  const std::string& taskCopy = copies.Add(path);
  if (PrepareTaskDB(path, taskCopy) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to update task db '%s'\n", path.c_str());
    return -1;
  }
  std::vector<std::string> replaced;
  int rc = 0;
  for (const auto& [id, fileDB] : fileDBs) {
    copies.AddKept(fileDB + kKeptSuffix);
    if (MoveBack(WorkingCopy(fileDB), fileDB, fileDB + kKeptSuffix) != 0) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db for task '%lu'\n", static_cast<unsigned long>(id));
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db\n");
      rc = -1;
      break;
    }
    replaced.push_back(fileDB);
  }
  if (rc == 0 && MoveBack(taskCopy, path) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to update task db '%s'\n", path.c_str());
    rc = -1;
  }
  if (rc != 0) {
    for (const std::string& fileDB : replaced) {
      // Put back or not, the old file stays where it is kept until then.
      if (RestoreDB(fileDB + kKeptSuffix, fileDB) != 0) copies.Release(fileDB + kKeptSuffix);
    }
  }
  return rc;
}

int UpdaterV1::UpdateFileDB() {
  const std::string path = TaskDBPath(GetRepoPath());
  std::list<uint64_t> ids;
  if (ListIncrementalTasks(path, ids) != 0) return -1;
  for (uint64_t id : ids) {
    std::string fileDB = FileDBPath(GetRepoPath(), id);
    if (CheckFileDB(fileDB) != 0) return -1;
    if (UpdateFileDB(fileDB) != 0) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to update file db for task '%lu'\n", static_cast<unsigned long>(id));
      return -1;
    }
  }
  return 0;
}

int UpdaterV1::UpdateFileDB(const std::string& path) {
  WorkingCopies copies;
  const std::string& copy = copies.Add(path);
  if (PrepareFileDB(path, copy) != 0) return -1;
  return MoveBack(copy, path);
}

int UpdaterV1::UpdateTaskDB(const std::string& path) {
  WorkingCopies copies;
  const std::string& copy = copies.Add(path);
  if (PrepareTaskDB(path, copy) != 0) return -1;
  return MoveBack(copy, path);
}

int UpdaterV1::ListIncrementalTasks(const std::string& taskDB, std::list<uint64_t>& ids) {
  std::string sql = "SELECT id FROM task_info_table WHERE copy_strategy = " +
                    std::to_string(Registry::COPY_STRATEGY_INCREMENTAL);
  int rc = ListDBRecord<uint64_t>(
      taskDB, sql, [](sqlite3_stmt* statement, uint64_t& id) { id = sqlite3_column_uint64(statement, 0); },
      ids);
  if (rc != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to list incbkp task info\n");
    return -1;
  }
  return 0;
}

int UpdaterV1::CheckFileDB(const std::string& path) {
  if (!IsFileExist(path)) {
    PLOVO_LIB_ERR("UpdaterV1: file db '%s' does not exist\n", path.c_str());
    return -1;
  }
  unsigned int version = 0;
  if (GetDBVersion(path, version) != 1) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to get file db version '%s'\n", path.c_str());
    return -1;
  }
  return 0;
}

int UpdaterV1::PrepareFileDB(const std::string& path, const std::string& copy) {
  if (BackupDB(path, copy) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to backup file db '%s' -> '%s'\n", path.c_str(), copy.c_str());
    return -1;
  }
  if (UpdateDB(copy, kFileDBScript) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to update file db '%s'\n", copy.c_str());
    return -1;
  }
  return 0;
}

int UpdaterV1::PrepareTaskDB(const std::string& path, const std::string& copy) {
  if (BackupDB(path, copy) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to backup task db '%s' -> '%s'\n", path.c_str(), copy.c_str());
    return -1;
  }
  if (UpdateDB(copy, kTaskDBScript) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to update task db '%s'\n", copy.c_str());
    return -1;
  }
  std::list<TaskInfoV1> tasks;
  if (ListDBRecord<TaskInfoV1>(copy, "SELECT id, usb_id, task_name, task_type FROM task_info_table;",
                               ReadTaskInfoV1, tasks) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to list all task info\n");
    return -1;
  }
  std::string content;
  if (DefaultScheduleContent(content) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to get default schedule content\n");
    return -1;
  }
  // A version 1 database names no scheduler entry: an entry of the
  // package now was made by an attempt cut short by a crash or a power cut,
  // and would run its task beside the one made below.
  if (!Plovo::RemoveAllSchedule()) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to remove schedules of an earlier attempt\n");
    return -1;
  }
  for (const TaskInfoV1& task : tasks) {
    const unsigned long id = static_cast<unsigned long>(task.id);
    // The notifier and the schedule id's update name the task by this
    // number; a row of a damaged database without a real one gets neither.
    if (static_cast<int64_t>(task.id) < 1) {
      PLOVO_LIB_ERR("UpdaterV1: Invalid task id %lld\n", static_cast<long long>(task.id));
      return -1;
    }
    const unsigned long usbId = static_cast<unsigned long>(task.usb_id);
    std::string uuid;
    if (GetDBRecord<std::string>(
            copy, "SELECT uuid FROM usb_info_table WHERE id = " + std::to_string(usbId),
            [](sqlite3_stmt* statement, std::string& value) { value = sqlite3_column_string(statement, 0); },
            uuid) != 1) {
      PLOVO_LIB_ERR("Failed to get uuid for usb id '%lu'\n", usbId);
      return -1;
    }
    if (IsDefaultTask(uuid)) continue;
    int64_t scheduleId = -1;
    if (!Plovo::CreateSchedule(id, task.task_type, task.task_name, false, content, scheduleId)) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to CreateSchedule for task '%lu', '%s'\n", id, task.task_name.c_str());
      return -1;
    }
    if (UpdateDB(copy, "UPDATE task_info_table SET schedule_id = " + std::to_string(scheduleId) +
                           " WHERE id = " + std::to_string(id) + " ;") != 0) {
      PLOVO_LIB_ERR("UpdaterV1: Failed to update schedule id for task '%lu', '%s'\n", id,
                    task.task_name.c_str());
      return -1;
    }
  }
  return 0;
}

int UpdaterV1::MoveBack(const std::string& copy, const std::string& live, const std::string& keep) {
  if (ReplaceDB(copy, live, keep) != 0) {
    PLOVO_LIB_ERR("UpdaterV1: Failed to move DB back '%s' -> '%s'.\n", copy.c_str(), live.c_str());
    return -1;
  }
  return 0;
}
