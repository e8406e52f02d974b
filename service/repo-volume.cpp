#include "service/repo-volume.h"

#include <fcntl.h>
#include <json/writer.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <cerrno>
#include <cstdio>

#include "common/error-text.h"
#include "common/file-op.h"
#include "common/log.h"
#include "common/no-throw.h"
#include "common/paths.h"
#include "common/unique-fd.h"
#include "service/global-setting.h"
#include "service/service-ctrl.h"

namespace {

constexpr unsigned kUnchangedId = static_cast<unsigned>(-1);

// Replaces the whole content of file with text through a temporary file in
// the same folder, so the package manager never reads half a line.
bool ReplaceFile(const std::string& file, const std::string& text) {
  const size_t slash = file.rfind('/');
  if (slash != std::string::npos && slash > 0 &&
      FSMKDir(file.substr(0, slash), true, kUnchangedId, kUnchangedId) != 0) {
    return false;
  }
  // A link in the temporary file's place is not followed out of the folder.
  const std::string tmp = file + ".tmp";
  std::remove(tmp.c_str());
  Plovo::UniqueFd fd(open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!fd) return false;
  const bool written = write(fd.get(), text.data(), text.size()) == static_cast<ssize_t>(text.size());
  if (!written || std::rename(tmp.c_str(), file.c_str()) != 0) {
    std::remove(tmp.c_str());
    return false;
  }
  return true;
}

// Starts "rm -rf path" without waiting for it: deleting a large tree must
// not hold up the service's start.
void RemoveInBackground(const std::string& path) {
  if (VLIBCBackgroundExec("/bin/rm", "-rf", path.c_str(), nullptr, nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: rm -rf %s", path.c_str());
  }
}

// Runs "rm -rf path" and waits for it. A staging place is cleared this way
// before use: cp or mv onto a folder left there would put the new tree
// inside the old one, and a symbolic link is removed, not followed.
bool RemoveNow(const std::string& path) {
  if (VLIBCExec("/bin/rm", "-rf", path.c_str(), nullptr, nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: rm -rf %s", path.c_str());
    return false;
  }
  return true;
}

// An empty volume would make every path below one at the top of the
// system.
bool IsVolumePath(const std::string& volume) {
  if (!volume.empty()) return true;
  PLOVO_LOG(LOG_ERR, "invalid volume path [%s].", volume.c_str());
  return false;
}

bool MoveRepo(const std::string& from, const std::string& to) {
  if (!IsVolumePath(from) || !IsVolumePath(to)) return false;
  const std::string src = from + "/@Plovo";
  const std::string dst = to + "/@Plovo";
  const std::string dstTmp = to + "/@tmp" + "/@Plovo";

  // mv onto an existing folder would put the copy inside it, and the move
  // would report success with the old folder in the repository's place.
  if (IsFileExist(dst)) {
    PLOVO_LOG(LOG_ERR, "FAIL: %s already exists", dst.c_str());
    return false;
  }
  // A volume need not have its temporary folder yet.
  if (FSMKDir(to + "/@tmp", false, kUnchangedId, kUnchangedId) != 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: mkdir %s", (to + "/@tmp").c_str());
    return false;
  }
  if (!RemoveNow(dstTmp)) return false;
  if (VLIBCExec("/bin/cp", "-rf", src.c_str(), dstTmp.c_str(), nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: cp -rf %s %s", src.c_str(), dstTmp.c_str());
    RemoveInBackground(dstTmp);
    return false;
  }
  if (VLIBCExec("/bin/mv", dstTmp.c_str(), dst.c_str(), nullptr, nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: mv %s %s", dstTmp.c_str(), dst.c_str());
    return false;
  }
  return true;
}

}  // namespace

void RetireRepo(const std::string& from) {
  if (!IsVolumePath(from)) return;
  const std::string src = from + "/@Plovo";
  const std::string srcTmp = from + "/@tmp" + "/@Plovo";
  // Without its temporary folder (a volume gone read-only, say) the old
  // repository cannot be moved aside; the rename below then fails, which
  // is logged, and the copy in use is unaffected.
  if (FSMKDir(from + "/@tmp", false, kUnchangedId, kUnchangedId) != 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: mkdir %s", (from + "/@tmp").c_str());
  } else {
    RemoveNow(srcTmp);
  }
  if (VLIBCExec("/bin/mv", src.c_str(), srcTmp.c_str(), nullptr, nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "FAIL: mv %s %s", src.c_str(), srcTmp.c_str());
  }
  RemoveInBackground(srcTmp);
}

namespace {

// Marks a failed change: state 7, with an empty tag.
bool FailChange() {
  ServiceStatus status;
  status.state = PLOVO_SERVICE_STATUS_ERROR;
  if (SetServiceStatus(status) != 0) PLOVO_LOG(LOG_ERR, "fail to SetServiceStatus()");
  return false;
}

bool ChangeRepo(const std::string& from, const std::string& to) {
  if (to.empty()) {
    PLOVO_LOG(LOG_ERR, "error: to_volume is empty");
    return false;
  }
  if (from == to) return true;

  ServiceLock lock;
  if (!lock.locked()) return false;
  // Another request may have moved the repository while this one waited:
  // its "from" would then name a volume that holds none any more.
  const std::string recorded = Plovo::GlobalSetting::GetRepoVolumePath();
  if (recorded == to) return true;
  if (recorded != from) {
    PLOVO_LOG(LOG_ERR, "repo volume is [%s] now, not [%s]", recorded.c_str(), from.c_str());
    return false;
  }

  if (StatusService() == 0 && StopServiceLocked() != 0) {
    PLOVO_LOG(LOG_ERR, "failed to StopService()");
    return false;
  }

  // A volume that is gone (unmounted, removed) holds nothing to copy: the
  // user has chosen where to begin again, and the old repository stays
  // where it is for the day the volume comes back.
  const bool hasRepo = !from.empty() && IsFileExist(from + "/@Plovo");
  if (!from.empty() && !hasRepo) {
    PLOVO_LOG(LOG_ERR, "repo volume [%s] holds no repository, create one on [%s].", from.c_str(),
              to.c_str());
  }
  if (hasRepo) {
    ServiceStatus moving;
    moving.state = PLOVO_SERVICE_STATUS_MOVING_REPO;
    if (SetServiceStatus(moving) != 0) {
      PLOVO_LOG(LOG_ERR, "fail to SetServiceStatus()");
      return false;
    }
    if (!move_repo_volume(from, to)) {
      PLOVO_LOG(LOG_ERR, "failed to move_repo_volume(), from=[%s], to=[%s]", from.c_str(),
                to.c_str());
      // The old repository is whole and still recorded: a user is better
      // served by the package running where it was than by a stopped one.
      if (StartServiceLocked() != 0) {
        PLOVO_LOG(LOG_ERR, "failed to StartService()");
        return FailChange();
      }
      return false;
    }
  } else if (MakeRepo(to) != 0) {
    PLOVO_LOG(LOG_ERR, "failed to MakeRepo(), volume=[%s]", to.c_str());
    return false;
  }

  // The old repository goes only once the new one is recorded: until then
  // it is the one the record names.
  if (!SetRepoVolumePath(to)) return FailChange();
  if (hasRepo) RetireRepo(from);
  if (StartServiceLocked() != 0) {
    PLOVO_LOG(LOG_ERR, "failed to StartService()");
    return FailChange();
  }
  return true;
}

}  // namespace

int MakeRepo(const std::string& volumePath) {
  if (!IsVolumePath(volumePath)) return -1;
  const std::string repo = volumePath + "/@Plovo";
  if (FSMKDir(repo, true, kUnchangedId, kUnchangedId) != 0) {
    PLOVO_LOG(LOG_ERR, "fail to create plovo repo [%s].", repo.c_str());
    return -1;
  }
  if (FSMKDir(repo + "/db", true, kUnchangedId, kUnchangedId) != 0) {
    PLOVO_LOG(LOG_ERR, "fail to create plovo db folder [%s].", (repo + "/db").c_str());
    return -1;
  }
  if (FSMKDir(repo + "/task", true, kUnchangedId, kUnchangedId) != 0) {
    PLOVO_LOG(LOG_ERR, "fail to create plovo task folder [%s].", (repo + "/task").c_str());
    return -1;
  }
  return 0;
}

bool SetRepoVolumePath(const std::string& volumePath) {
  return Plovo::NoThrow(
      [&] {
        if (VLIBCFileSetKeyValue(Plovo::Path::SettingFile().c_str(), "repo_vol_path",
                                 volumePath.c_str(), "%s=\"%s\"\n") < 0) {
          PLOVO_LOG(LOG_ERR, "VLIBCFileSetKeyValue() failed, path=[%s],[0x%04X %s:%d]",
                    volumePath.c_str(), static_cast<unsigned>(VLIBCErrGet()),
                    VLIBCErrorGetFile(), VLIBCErrorGetLine());
          return false;
        }
        Json::Value volumes(Json::arrayValue);
        volumes.append(volumePath);
        const std::string file = Plovo::Path::RegVolumeFile();
        if (!ReplaceFile(file, Json::FastWriter().write(volumes))) {
          PLOVO_LOG(LOG_ERR, "fail to write [%s]: %s", file.c_str(), Plovo::ErrorText(errno).c_str());
          return false;
        }
        return true;
      },
      false);
}

bool move_repo_volume(const std::string& from, const std::string& to) {
  return Plovo::NoThrow([&] { return MoveRepo(from, to); }, false);
}

bool ChangeRepoVolume(const std::string& from, const std::string& to) {
  return Plovo::NoThrow([&] { return ChangeRepo(from, to); }, false);
}
