#include "updater/updater-core.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "common/error-text.h"
#include "common/file-op.h"
#include "common/log.h"
#include "common/paths.h"
#include "common/unique-fd.h"
#include "filter/file-filter.h"
#include "updater/updater-utils.h"
#include "updater/updater-v1.h"

namespace {

// The platform settings file keeps values in a buffer of this size.
constexpr size_t kKeyValueSize = 492;

std::string TaskDBPath(const std::string& repoPath) { return repoPath + "/db/" + "task-db.sqlite"; }

// The line Json::FastWriter gives for an object with two empty arrays.
const char* const kDefaultUserConfig = "{\"user_defined_extensions\":[],\"user_defined_names\":[]}\n";

// Written as root into the repository: a symbolic link planted in the
// file's place is refused rather than followed.
int WriteUserConfig(const std::string& path) {
  Plovo::UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
  const size_t size = std::strlen(kDefaultUserConfig);
  if (fd.get() < 0 || write(fd.get(), kDefaultUserConfig, size) != static_cast<ssize_t>(size)) {
    PLOVO_LIB_ERR("Failed to write '%s': %s\n", path.c_str(), Plovo::ErrorText(errno).c_str());
    return -1;
  }
  return 0;
}

// A folder, not a symbolic link to one: the task's files must not land
// outside the repository.
bool IsRealFolder(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

}  // namespace

int UpdaterCore::Update(const std::string& repoPath) {
  const std::string path = TaskDBPath(repoPath);
  if (!IsFileExist(path)) {
    PLOVO_LIB_WARN("UpdaterCore: new install\n");
    if (PrepareDefaultTasks(repoPath) < 0) {
      PLOVO_LIB_ERR("Failed to prepare default task at '%s'\n", repoPath.c_str());
      return -1;
    }
    return 0;
  }
  unsigned int version = 0;
  if (GetDBVersion(path, version) != 1) {
    PLOVO_LIB_ERR("UpdaterCore: Failed to get task db version '%s'\n", path.c_str());
    return -1;
  }
  if (UpdaterV1::IsNeedV1Update(version)) {
    UpdaterV1 updater(repoPath);
    if (updater.Run() != 0) {
      PLOVO_LIB_ERR("UpdaterCore: Failed to run updater v1\n");
      return -1;
    }
  }
  return 0;
}

int UpdaterCore::PrepareDefaultTasks(const std::string& repoPath) {
  if (PrepareDefaultTask(repoPath, "plovo", "plovofolder", "PLOVO_DEFAULT_USB_UUID", "Default Plovo") < 0) {
    PLOVO_LIB_ERR("Failed to prepare Plovo default task\n");
    return -1;
  }
  if (PrepareDefaultTask(repoPath, "tarnel", "tarnelfolder", "PLOVO_DEFAULT_SD_UUID", "Default Tarnel") < 0) {
    PLOVO_LIB_ERR("Failed to prepare Tarnel default task\n");
    return -1;
  }
  return 0;
}

int UpdaterCore::PrepareDefaultTask(const std::string& repoPath, const std::string& supportKey,
                                    const std::string& folderKey, const std::string& uuid,
                                    const std::string& taskName) {
  // A settings file that cannot be read (-1) supports nothing.
  if (VLIBCFileCheckKeyValue(Plovo::Path::PlatformDefaultInfoFile().c_str(), supportKey.c_str(), "yes", 0) <= 0) {
    PLOVO_LIB_DBG("Not support '%s'\n", supportKey.c_str());
    return 0;
  }
  // Read before the database is made: a new install that fails here leaves
  // no database behind, so the next start is a new install again. A
  // settings file that does not exist holds no old copy folder.
  const std::string infoFile = Plovo::Path::PlatformInfoFile();
  char folder[kKeyValueSize] = {0};
  if (VLIBCFileGetKeyValue(infoFile.c_str(), folderKey.c_str(), folder, sizeof(folder), 0) == -1 &&
      VLIBCErrGet() != VLIBC_ERR_NOT_FOUND) {
    PLOVO_LIB_ERR("Failed to get old copy folder for key '%s'\n", folderKey.c_str());
    return -1;
  }
  const std::string path = TaskDBPath(repoPath);
  TaskDB db;
  if (db.Initialize(path) < 0) {
    PLOVO_LIB_ERR("Failed to init task db at '%s'\n", path.c_str());
    return -1;
  }
  TaskDB::USBInfo existing;
  int found = db.GetUSBInfoByUUID(uuid, existing);
  if (found < 0) {
    PLOVO_LIB_ERR("Failed to get deault usb info '%s'\n", uuid.c_str());
    return -1;
  }
  if (found == 1) {
    PLOVO_LIB_DBG("default task '%s' already exist\n", uuid.c_str());
    return 0;
  }
  const std::string shareName = folder;
  if (shareName.empty()) {
    if (PrepareDefaultTaskConfig(db, repoPath, taskName, uuid, "", "", false) < 0) {
      PLOVO_LIB_ERR("Failed to prepare plovo default task '%s'\n", taskName.c_str());
      return -1;
    }
  } else if (PrepareDefaultTaskConfig(db, repoPath, taskName, uuid, shareName, "/", true) < 0) {
    PLOVO_LIB_ERR("Failed to convert old plovo config to default task '%s'\n", taskName.c_str());
    return -1;
  }
  // The old feature's folder now lives in the task; it is never read again.
  if (VLIBCFileRemoveKey(infoFile.c_str(), folderKey.c_str()) < 0) {
    PLOVO_LIB_ERR("Failed to remove key'%s'\n", folderKey.c_str());
  }
  return 0;
}

int UpdaterCore::PrepareDefaultTaskConfig(TaskDB& db, const std::string& repoPath,
                                          const std::string& taskName, const std::string& uuid,
                                          const std::string& shareName, const std::string& folderPath,
                                          bool enable) {
  unsigned long usbId = 0;
  if (CreateDefaultUsbInfo(db, uuid, usbId) < 0) {
    PLOVO_LIB_ERR("Failed to set default Plovo usb info\n");
    return -1;
  }
  unsigned long taskId = 0;
  if (CreateDefaultTaskInfo(db, usbId, taskName, folderPath, shareName, enable, taskId) < 0) {
    PLOVO_LIB_ERR("Faile to set default Plovo task info\n");
    return -1;
  }
  if (CreateDefaultTaskFilter(repoPath + "/task/" + std::to_string(taskId)) < 0) {
    PLOVO_LIB_ERR("Failed to prepare task config '%lu'\n", taskId);
    return -1;
  }
  return 0;
}

int UpdaterCore::CreateDefaultUsbInfo(TaskDB& db, const std::string& uuid, unsigned long& usbId) {
  TaskDB::USBInfo info;
  info.uuid = uuid;
  info.run_when_plug_in = false;
  info.eject_when_task_done = true;
  info.producer = "PLOVO_DEFAULT_PRODUCER";
  info.product = "PLOVO_DEFAULT_PRODUCT";
  if (db.AddUSBInfo(info, usbId) < 0) {
    PLOVO_LIB_ERR("Failed to add usb info, uuid '%s'\n", uuid.c_str());
    return -1;
  }
  return 0;
}

int UpdaterCore::CreateDefaultTaskInfo(TaskDB& db, unsigned long usbId, const std::string& taskName,
                                       const std::string& folderPath, const std::string& shareName,
                                       bool enable, unsigned long& taskId) {
  TaskDB::TaskInfo info;
  info.usb_id = usbId;
  info.is_enable = enable;
  info.task_name = taskName;
  info.task_type = Registry::TASK_TYPE_IMPORT_GENERAL;
  info.usb_folder_path = "/";
  info.nas_folder_path = folderPath;
  info.nas_share_name = shareName;
  info.last_copied_time = 0;
  info.copy_strategy = Registry::COPY_STRATEGY_VERSIONING;
  info.keep_dir_structure = true;
  info.smart_create_date_dir = false;
  info.rename_photo_video = false;
  info.remove_src_file = false;
  info.conflict_policy = Registry::CONFLICT_POLICY_RENAME;
  info.enable_rotation = false;
  info.max_version_count = 256;
  info.rotation_policy = Registry::ROTATION_POLICY_OLDEST_VERSION;
  info.schedule_id = -1;
  info.error = 0;
  if (db.AddTaskInfo(info, taskId) < 0) {
    PLOVO_LIB_ERR("Failed to add task info\n");
    return -1;
  }
  return 0;
}

int UpdaterCore::CreateDefaultTaskFilter(const std::string& taskDir) {
  const std::string tasksDir = taskDir.substr(0, taskDir.find_last_of('/'));
  if ((IsFileExist(tasksDir) && !IsRealFolder(tasksDir)) ||
      FSMKDir(taskDir, true, static_cast<unsigned>(-1), static_cast<unsigned>(-1)) < 0 ||
      !IsRealFolder(taskDir)) {
    PLOVO_LIB_ERR("Failed to create task folder '%s'\n", taskDir.c_str());
    return -1;
  }
  if (WriteUserConfig(taskDir + "/" + "user.config") < 0) return -1;
  // The devices' own configuration file is never copied.
  const std::string blackList = taskDir + "/" + "blacklist.filter";
  if (WriteBlackList(blackList, {".VeltraPlovo.config"}, {}) < 0) {
    PLOVO_LIB_ERR("Failed to write black list '%s'\n", blackList.c_str());
    return -1;
  }
  const std::string whiteList = taskDir + "/" + "whitelist.filter";
  if (WriteWhiteList(whiteList, {"*"}, {"*"}) < 0) {
    PLOVO_LIB_ERR("Failed to write white list '%s'\n", whiteList.c_str());
    return -1;
  }
  return 0;
}
