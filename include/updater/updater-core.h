// Prepares the task database when the package service starts, before the
// daemon runs: on a new install it creates the database and the default
// tasks of the devices the model supports; on an existing database it runs
// the migration its version needs. No state; every call stands alone.
//
// Results are 0 or -1; failures are logged as "[ERR] updater-core(<line>): ...".
#ifndef PLOVO_UPDATER_UPDATER_CORE_H
#define PLOVO_UPDATER_UPDATER_CORE_H

#include <string>

#include "db/task-db.h"

class UpdaterCore {
 public:
  UpdaterCore() {}
  ~UpdaterCore() {}

  // repoPath is the package's repository folder (".../@Plovo"), holding
  // "db/task-db.sqlite" and one "task/<id>" folder per task.
  int Update(const std::string& repoPath);

  // Both default tasks: the USB drives' ("plovo"), then the SD cards'
  // ("tarnel"); a failure of the first stops before the second.
  int PrepareDefaultTasks(const std::string& repoPath);
  // One default task, when "/etc.defaults/veltinfo.conf" has supportKey
  // "yes" and its device row (uuid) does not exist yet. A copy folder kept
  // under folderKey in "/etc/veltinfo.conf" by the platform's old copy
  // feature becomes the task's destination share, and the key is removed.
  int PrepareDefaultTask(const std::string& repoPath, const std::string& supportKey,
                         const std::string& folderKey, const std::string& uuid,
                         const std::string& taskName);
  // The device row, the task row and the task's folder with its three files.
  int PrepareDefaultTaskConfig(TaskDB& db, const std::string& repoPath, const std::string& taskName,
                               const std::string& uuid, const std::string& shareName,
                               const std::string& folderPath, bool enable);
  int CreateDefaultUsbInfo(TaskDB& db, const std::string& uuid, unsigned long& usbId);
  int CreateDefaultTaskInfo(TaskDB& db, unsigned long usbId, const std::string& taskName,
                            const std::string& folderPath, const std::string& shareName, bool enable,
                            unsigned long& taskId);
  // Makes taskDir with "user.config" (no names, no extensions), a black list
  // holding the devices' own configuration file and a white list admitting
  // everything.
  int CreateDefaultTaskFilter(const std::string& taskDir);
};

#endif
