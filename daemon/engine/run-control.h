// One run of a task as the copy engine sees it: what it copies where, by
// which settings (fixed when it starts), and the control through which it
// is cancelled and shows its progress.
#ifndef PLOVO_DAEMON_ENGINE_RUN_CONTROL_H
#define PLOVO_DAEMON_ENGINE_RUN_CONTROL_H

#include <atomic>
#include <ctime>
#include <mutex>
#include <string>

#include "db/task-db.h"

namespace plovod {

class CopyLog;

// What one run does, fixed when it starts.
struct RunPlan {
  unsigned long id = 0;
  std::string source_root;       // the share the source lies in
  std::string source;            // the folder copied from, below source_root
  std::string destination_root;  // the share the destination lies in
  std::string destination;       // the folder copied into, below destination_root
  std::string device_share;  // the device's share: pulling it out cancels the run
  bool eject = false;        // eject the device after a run that succeeded
  TaskDB::TaskInfo task;     // the task's settings as the run started
  std::string task_folder;   // "<repo>/task/<id>": its lists and file-db.sqlite
  time_t started = 0;        // the run's start by the daemon's clock (version names, rotation)
  bool destination_fat = false;  // the destination is a FAT device: 4 GiB files and some names cannot go there
  CopyLog* log = nullptr;    // where the run's rows go; none when null
};

// What a run did, for its last log row.
struct RunStats {
  unsigned long copied = 0;   // files written
  unsigned long long bytes = 0;  // their bytes
  unsigned long linked = 0;   // files linked to the previous version
  unsigned long removed = 0;  // files removed (mirror, moved sources, rotation's versions)
  unsigned long skipped = 0;  // files that could not be copied (each has its row)
};

// A run as its job sees it. Thread-safe.
class RunControl {
 public:
  bool Cancelled() const { return reason_ != 0; }
  // Why it was cancelled: P_ERR_STOPPED by the user, P_ERR_SHARE_NOT_MOUNTED
  // when its device went away; 0 when it was not.
  int Reason() const { return reason_; }
  void Cancel(int reason);
  // The file being copied now ("" between files), shown in the task list.
  void SetCopying(const std::string& path);
  std::string Copying() const;
  RunStats stats;  // written by the run's own thread only

 private:
  std::atomic<int> reason_{0};
  mutable std::mutex mutex_;
  std::string copying_;
};

// A folder of a share as "/a/b", without empty components; "" for the
// share's root.
std::string NormalizedFolder(const std::string& folder);

// A run's folders as the page shows them: "/<share>/<folder>", the share
// being the device's or the NAS share by the task's direction.
std::string SourceShown(const RunPlan& plan);
std::string DestinationShown(const RunPlan& plan);

}  // namespace plovod

#endif
