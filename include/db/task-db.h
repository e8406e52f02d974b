// The copy daemon's task database, "task-db.sqlite" in the repository's
// database folder: one row per removable device that has tasks
// (usb_info_table), one row per copy task (task_info_table) and the schema
// version (config_table).
//
// Every operation is one SQL statement run under the object's mutex, so one
// instance may be used from several threads once Initialize has returned.
// The daemon writes the same file from its own process; the connection
// waits up to five minutes for the daemon's write lock.
//
// Results: writes and lists 0 or -1; single-row reads 1 found, 0 not found
// (the record is left as it was), -1 failure. Every failure is logged.
#ifndef PLOVO_DB_TASK_DB_H
#define PLOVO_DB_TASK_DB_H

#include <pthread.h>
#include <sqlite3.h>

#include <cstdint>
#include <list>
#include <string>

#include "db/sqlite-owner.h"

// Column readers for the current row of a statement.
std::string sqlite3_column_string(sqlite3_stmt* statement, int column);  // NULL gives ""
bool sqlite3_column_bool(sqlite3_stmt* statement, int column);
uint32_t sqlite3_column_uint32(sqlite3_stmt* statement, int column);  // truncated to 32 bits
uint64_t sqlite3_column_uint64(sqlite3_stmt* statement, int column);  // reinterpreted as unsigned

// The SQL literal of s: in single quotes, each single quote doubled; "" if
// it cannot be formatted.
std::string GetEscapedString(const std::string& s);
// A LIKE pattern (ESCAPE '\') that matches s literally: '%' and '_' get a
// backslash. A backslash of s is not doubled, so it escapes what follows.
// No quotes are added.
std::string GetEscapedLIKEString(const std::string& s);
// A GLOB pattern that matches s literally: '?', '*' and '[' become "[?]",
// "[*]" and "[[]". No quotes are added.
std::string GetEscapedGLOBString(const std::string& s);

class TaskDB {
 public:
  // One device row.
  struct USBInfo {
    USBInfo() { Clear(); }
    void Clear();

    unsigned long id;
    std::string uuid;
    bool run_when_plug_in;
    bool eject_when_task_done;
    std::string producer;
    std::string product;
  };

  // One task row. The enumerations are Registry's numbers.
  struct TaskInfo {
    TaskInfo() { Clear(); }
    void Clear();

    unsigned long id;
    unsigned long usb_id;
    long schedule_id;  // -1: no schedule
    bool is_enable;
    std::string task_name;
    int task_type;
    std::string usb_folder_path;
    std::string nas_folder_path;
    std::string nas_share_name;
    unsigned int last_copied_time;  // seconds since the epoch, 0 never
    int copy_strategy;
    bool keep_dir_structure;
    bool smart_create_date_dir;
    bool rename_photo_video;
    bool remove_src_file;
    int conflict_policy;
    bool enable_rotation;
    unsigned long max_version_count;
    int rotation_policy;
    int error;  // the task's last error code, 0 none
  };

  // The process-wide instance, built on first use.
  static TaskDB& GetInstance();

  TaskDB();
  ~TaskDB();
  TaskDB(const TaskDB&) = delete;
  TaskDB& operator=(const TaskDB&) = delete;

  // Opens (creating when absent) the database at path and makes its schema,
  // version 2. On an open instance it only logs and returns 0, whatever the
  // path. Not locked: call it before the instance is shared. 0 or -1.
  int Initialize(const std::string& path);
  // Closes the connection; the instance may be initialised again.
  void Destroy();
  // The mutex every operation holds; failures are logged, not returned.
  void Lock();
  void Unlock();

  // The record's id is ignored; newId receives the row's id.
  int AddUSBInfo(const USBInfo& info, unsigned long& newId);
  int UpdateUSBInfo(const USBInfo& info);
  int GetUSBInfo(unsigned long id, USBInfo& info);
  int GetUSBInfoByUUID(const std::string& uuid, USBInfo& info);
  // Removes the device and, through a trigger, its tasks.
  int RemoveUSBInfo(unsigned long id);
  int ListUSBInfo(std::list<USBInfo>& list);

  int AddTaskInfo(const TaskInfo& info, unsigned long& newId);
  // Rewrites every column of the task info.id.
  int UpdateTaskInfo(const TaskInfo& info);
  // Sets the task's error and, when lastCopiedTime is not 0, its last copy
  // time.
  int UpdateTaskInfo(unsigned long id, int error, unsigned int lastCopiedTime);
  int EnableTaskInfo(unsigned long id, bool enable);
  // Renames a share in every task that uses it.
  int UpdateNASShareName(const std::string& oldName, const std::string& newName);
  int GetTaskInfo(unsigned long id, TaskInfo& info);
  // Removes the task and, through a trigger, its device when no task of the
  // device is left.
  int RemoveTaskInfo(unsigned long id);
  // Lists empty the list first; on a failure while stepping the rows read so
  // far stay in it.
  int ListTaskInfo(std::list<TaskInfo>& list);
  int ListTaskInfo(unsigned long usbId, std::list<TaskInfo>& list);
  int ListTaskInfo(const std::string& shareName, std::list<TaskInfo>& list);

  // Fill a record from the current row of a statement whose columns are in
  // the order of this class's SELECTs.
  static void GetUSBInfoFromDBRecord(sqlite3_stmt* statement, USBInfo& info);
  static void GetTaskInfoFromDBRecord(sqlite3_stmt* statement, TaskInfo& info);

 private:
  // False, after the log line, when sqlite3_mprintf failed to format.
  static bool Formatted(const Plovo::SqliteText& sql, const char* format);
  int Exec(const char* sql);
  // A formatted write: Formatted, then Exec.
  int Write(const Plovo::SqliteText& sql, const char* format);
  template <typename Record>
  int GetOne(const Plovo::SqliteText& sql, const char* format, Record& record,
             void (*read)(sqlite3_stmt*, Record&));
  template <typename Record>
  int ListAll(const std::string& sql, std::list<Record>& list,
              void (*read)(sqlite3_stmt*, Record&));

  pthread_mutex_t mutex;
  sqlite3* handle = nullptr;
};

#endif
