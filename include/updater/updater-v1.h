// Brings a task database of schema version 1 to version 2: the task table
// gains rename_photo_video (the old rename_photo_file), remove_src_file,
// enable_rotation, max_version_count, rotation_policy and schedule_id; every
// task outside the default devices gets a disabled scheduler entry; the
// file database of each incremental task gets its path indexes replaced.
//
// Every database is changed on a working copy (its path + ".bkp_v1"). Run
// prepares all of them, the file databases first (so that a failure there
// leaves the scheduler alone), and only then puts them in the live files'
// place: the file databases (the old files kept aside), then the task
// database, whose version 2 marks the migration done. A failure leaves
// every live database as it was (replaced file databases are put back) and
// the next start tries again; the scheduler entries it made stay until
// then, when every entry of the package is removed before new ones are
// made. No other connection may have the databases open.
//
// Results are 0 or -1; failures are logged as "[ERR] updater-v1(<line>): ...".
#ifndef PLOVO_UPDATER_UPDATER_V1_H
#define PLOVO_UPDATER_UPDATER_V1_H

#include <cstdint>
#include <list>
#include <string>

#include "common/registry.h"
#include "updater/updater-base.h"

// The columns of a version 1 task row the migration reads.
struct TaskInfoV1 {
  uint64_t id = 0;
  uint64_t usb_id = 0;
  std::string task_name;
  Registry::TASK_TYPE task_type = Registry::TASK_TYPE_UNKNOWN;
};

class UpdaterV1 : public UpdaterBase {
 public:
  explicit UpdaterV1(const std::string& repoPath) : UpdaterBase(repoPath) {}
  ~UpdaterV1() override {}

  // True exactly for version 1.
  static bool IsNeedV1Update(unsigned int version);
  // The whole migration of the repository's databases; 0 also when the task
  // database needs none.
  virtual int Run();

  // Every incremental task's file database, then one by path.
  int UpdateFileDB();
  int UpdateFileDB(const std::string& path);
  // The task database at path, with the tasks' scheduler entries.
  int UpdateTaskDB(const std::string& path);
  // True for the devices of the default tasks, which get no scheduler entry.
  static bool IsDefaultTask(const std::string& uuid);

 private:
  // The ids of the incremental tasks, whose file databases change.
  int ListIncrementalTasks(const std::string& taskDB, std::list<uint64_t>& ids);
  // The file database exists and has a version.
  int CheckFileDB(const std::string& path);
  // The changed working copy of a database, the live file untouched.
  int PrepareFileDB(const std::string& path, const std::string& copy);
  int PrepareTaskDB(const std::string& path, const std::string& copy);
  // Run's work once the task database is known to be at version 1.
  int MigrateAll(const std::string& path);
  // The working copy in the live file's place (the old file kept at keep
  // when given).
  int MoveBack(const std::string& copy, const std::string& live, const std::string& keep = "");
};

#endif
