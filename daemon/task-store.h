// The daemon's tasks as they are kept: a row per task and a row per device
// in the repository's task database, a folder per task ("<repo>/task/<id>")
// with the task's list files and "user.config", and an entry in the
// platform's scheduler for a task that runs on a timetable. The store
// keeps the three in step: a change that fails half way is undone, so
// that no row lacks its folder and no entry outlives its task.
//
// The plug-in and eject settings belong to the device row, so a device's
// tasks share them. A timetable lives in the scheduler entry alone; the
// task row keeps the entry's id.
//
// Results are the daemon's codes (codes.h). Not thread-safe: the daemon
// calls it under its command lock. RecordRun may be called beside it, from
// the runs' threads.
#ifndef PLOVO_DAEMON_TASK_STORE_H
#define PLOVO_DAEMON_TASK_STORE_H

#include <mutex>
#include <string>
#include <vector>

#include "daemon/codes.h"
#include "db/task-db.h"

namespace plovod {

// The six lists of a task's filter, extensions without the dot.
struct Filters {
  std::vector<std::string> white_name, white_ext, black_name, black_ext, custom_name, custom_ext;
};

struct Trigger {
  bool run_when_plug_in = false;
  bool eject_when_task_done = true;
  bool schedule_enabled = false;
  std::string schedule_json = "{}";  // the web interface's timetable; "{}" for none
};

struct StoredTask {
  TaskDB::TaskInfo info;
  TaskDB::USBInfo device;
};

class TaskStore {
 public:
  // repo is the repository folder, "<volume>/@Plovo".
  explicit TaskStore(std::string repo) : repo_(std::move(repo)) {}

  // Opens "<repo>/db/task-db.sqlite"; 0 or -1 (logged).
  int Open();
  void Close() { db_.Destroy(); }

  std::string TaskDir(unsigned long id) const;
  // Removes the task's incremental memory ("file-db.sqlite"): its next
  // run copies as a first one.
  void ForgetCopies(unsigned long id);

  Code List(std::vector<StoredTask>& tasks);
  Code Get(unsigned long id, StoredTask& task);
  // Adds the task (info.id receives its id) on the device named by
  // device.uuid, whose row is created on its first task; a device already
  // known takes device's names and trigger's plug-in and eject settings.
  Code Add(const TaskDB::USBInfo& device, TaskDB::TaskInfo& info, const Trigger& trigger,
           const Filters& filters);
  // Rewrites the task's settings from info (its id names it) and renames
  // its scheduler entry with it; its enable state, entry and last run are
  // kept as stored.
  Code Update(const TaskDB::TaskInfo& info);
  // Creates, changes or (for "{}") removes the task's scheduler entry and
  // sets its device's plug-in and eject settings; scheduleId receives the
  // entry's id, -1 for none.
  Code SetTrigger(unsigned long id, const Trigger& trigger, long& scheduleId);
  Code SetFilters(unsigned long id, const Filters& filters);
  Code GetFilters(unsigned long id, Filters& filters);
  Code Enable(unsigned long id, bool enable);
  // Removes the row (the device row goes with its last task), the
  // scheduler entry and the folder.
  Code Remove(unsigned long id);
  // A run's outcome: its error, and its finish time when not 0.
  void RecordRun(unsigned long id, int error, unsigned int finishTime);

 private:
  Code NameTaken(const std::string& name, unsigned long except);
  Code WriteFilters(const std::string& dir, const Filters& filters);
  // A new entry for trigger's timetable; scheduleId -1 when it has none.
  Code CreateEntry(const TaskDB::TaskInfo& info, const Trigger& trigger, long& scheduleId);

  std::string repo_;
  TaskDB db_;
  // Held where a task's row is read and written back whole, and by
  // RecordRun, so that neither undoes the other.
  std::mutex rowMutex_;
};

}  // namespace plovod

#endif
