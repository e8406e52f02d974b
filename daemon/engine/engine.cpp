#include "daemon/engine/engine.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/json.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <unordered_map>
#include <unordered_set>

#include "common/log.h"
#include "daemon/engine/capture-time.h"
#include "daemon/engine/copy-log.h"
#include "daemon/engine/file-copy.h"
#include "daemon/engine/file-memory.h"
#include "daemon/engine/rotation.h"
#include "filter/file-filter.h"
#include "ipc/error-code.h"

namespace plovod {

namespace {

// The device's own configuration file (its identity): never copied to the
// NAS, never removed from the device.
const char kDeviceConfig[] = ".VeltraPlovo.config";
constexpr off_t kFatLargest = (off_t{4} << 30) - 1;
// Deeper folders are skipped with a row: no camera nests so deep, and
// the walks hold a descriptor per level.
constexpr size_t kMaxDepth = 128;
// Past this many, skipped files are counted in one last row rather than
// one row each, so that a hostile tree cannot flood the log.
constexpr unsigned long kMaxSkipRows = 1000;

std::string Join(const std::string& folder, const std::string& name) {
  return folder.empty() ? name : name.empty() ? folder : folder + "/" + name;
}

std::string Lower(std::string text) {
  for (char& c : text) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return text;
}

// The last extension of a name, without the dot; "" when it has none.
std::string Extension(const std::string& name) {
  const size_t dot = name.rfind('.');
  return dot == std::string::npos || dot == 0 ? "" : name.substr(dot + 1);
}

size_t Depth(const std::string& path) { return path.empty() ? 0 : std::count(path.begin(), path.end(), '/') + 1; }

// Whether a FAT file system can hold the name.
bool FatName(const std::string& name) {
  if (name.empty() || name.back() == '.' || name.back() == ' ') return false;
  for (unsigned char c : name) {
    if (c < 0x20 || strchr("\"*:<>?\\|", c) != nullptr) return false;
  }
  return true;
}

// The names of an open folder, sorted, without "." and ".."; false when it
// cannot be read.
bool ListNames(int dir, std::vector<std::string>& names) {
  DIR* stream = fdopendir(fcntl(dir, F_DUPFD_CLOEXEC, 0));
  if (stream == nullptr) return false;
  rewinddir(stream);
  // A listing cut short by a read error is no listing: a mirror would
  // take the missing names for files the source no longer has.
  errno = 0;
  while (const dirent* entry = readdir(stream)) {
    if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) names.push_back(entry->d_name);
  }
  const int error = errno;
  closedir(stream);
  std::sort(names.begin(), names.end());
  errno = error;
  return error == 0;
}

bool IsFolder(int dir, const std::string& name) {
  struct stat st {};
  return fstatat(dir, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode);
}

// Names no run ever copies or removes: the device's configuration, the
// platform's thumbnail folders and the temporary files of a killed run.
bool Untouchable(const std::string& name) { return name == kDeviceConfig || name == "@eaDir" || IsTemporary(name); }

// The task's lists: the black list, and the white list widened by the
// custom names and extensions. An empty white list admits everything.
class Lists {
 public:
  int Load(const std::string& taskFolder) {
    const std::string black = taskFolder + "/blacklist.filter", white = taskFolder + "/whitelist.filter";
    if (access(black.c_str(), F_OK) == 0 && filter_.LoadBlackList(black) != 0) return -1;
    std::vector<std::string> names, extensions;
    if (access(white.c_str(), F_OK) == 0) {
      if (ReadWhiteList(white, names, extensions) != 0) return -1;
      white_ = !names.empty() || !extensions.empty();
      if (white_ && filter_.LoadWhiteList(white) != 0) return -1;
    }
    Json::Value config;
    std::ifstream in(taskFolder + "/user.config");
    Json::CharReaderBuilder reader;
    bool parsed = false;
    try {
      parsed = in && Json::parseFromStream(reader, in, &config, nullptr);
    } catch (const std::exception&) {  // nested too deep for the reader
      return -1;
    }
    if (parsed && config.isObject()) {
      for (const Json::Value& name : config["user_defined_names"]) {
        if (name.isString()) customNames_.insert(Lower(name.asString()));
      }
      for (const Json::Value& extension : config["user_defined_extensions"]) {
        if (extension.isString()) customExtensions_.insert(Lower(extension.asString()));
      }
    }
    return 0;
  }
  bool AdmitsFolder(const std::string& path) const { return filter_.TestBlackList("/" + path, true) == 0; }
  bool AdmitsFile(const std::string& path, const std::string& name) const {
    if (filter_.TestBlackList("/" + path, false) != 0) return false;
    return !white_ || filter_.TestWhiteList("/" + path, false) == 0 || customNames_.count(Lower(name)) != 0 ||
           customExtensions_.count(Lower(Extension(name))) != 0;
  }

 private:
  FileFilter filter_;
  bool white_ = false;
  std::unordered_set<std::string> customNames_, customExtensions_;
};

struct SourceFile {
  std::string folder;  // relative to the source folder, "" for itself
  std::string name;
  struct stat st;
  std::string Path() const { return Join(folder, name); }
};

class Engine {
 public:
  Engine(const RunPlan& plan, RunControl& control, int destinationRoot)
      : plan_(plan),
        control_(control),
        task_(plan.task),
        placer_(destinationRoot, control,
                [this](const std::string& shown, const std::string& why) { Skip(shown, why); }),
        sourceShown_(plovod::SourceShown(plan)),
        destinationShown_(plovod::DestinationShown(plan)) {}

  int Run(int source, int destination) {
    source_ = source;
    destination_ = destination;
    if (lists_.Load(plan_.task_folder) != 0) {
      Log(Event::kFileSkipped, {plan_.task_folder, "the task's filter lists cannot be read"});
      return P_ERR_FILE_OPERATION;
    }
    Walk();
    int error = control_.Cancelled() ? control_.Reason() : rootUnreadable_ ? P_ERR_SOURCE_ROOT_MISSING : 0;
    if (error == 0) {
      error = task_.copy_strategy == 1 ? Versioning() : task_.copy_strategy == 2 ? Mirror() : Incremental();
    }
    // What is whole is put in place whatever ended the run.
    const int placed = placer_.Commit();
    if (error == 0) error = placed;
    if (memoryOpen_ && memory_.End() != 0 && error == 0) error = P_ERR_FILE_OPERATION;
    // The renames on the disk before any source goes: a power cut must
    // not leave a source gone and its copy under a temporary name.
    if (!removals_.empty() && syncfs(destination_) == 0) RemoveSources();
    if (error == 0 && task_.copy_strategy == 1 && task_.enable_rotation) Rotate();
    // A version that did not finish is no snapshot of the source: renamed
    // so that neither a later run links to it nor rotation counts it.
    if (error != 0 && !version_.empty() &&
        renameat(destination_, version_.c_str(), destination_, (version_ + ".incomplete").c_str()) != 0) {
      PLOVO_LOG(LOG_WARNING, "task %lu: version %s cut short and not marked: %s", plan_.id, version_.c_str(),
                strerror(errno));
    }
    if (control_.stats.skipped > kMaxSkipRows) {
      Log(Event::kFileSkipped, {sourceShown_, std::to_string(control_.stats.skipped - kMaxSkipRows) +
                                                  " more files could not be copied"});
    }
    return error;
  }

 private:
  void Log(Event event, const std::vector<std::string>& params, int error = 0) {
    if (plan_.log != nullptr) plan_.log->Add(plan_.id, event, params, error);
  }
  // A file not copied: its row, up to the cap.
  void Skip(const std::string& shown, const std::string& why) { Skipped(Event::kFileSkipped, {shown, why}); }
  void Skipped(Event event, const std::vector<std::string>& params) {
    if (++control_.stats.skipped <= kMaxSkipRows) Log(event, params);
  }
  // A destination folder that cannot be made: the run ends only when the
  // disk is full; otherwise the file has its row and the run goes on.
  int FolderFailed(const SourceFile& file) {
    if (errno == ENOSPC || errno == EDQUOT) return P_ERR_DEST_QUOTA_FULL;
    Skip(SourceShown(file.Path()), std::string("its folder cannot be made at the destination: ") + strerror(errno));
    return 0;
  }
  std::string SourceShown(const std::string& path) const { return sourceShown_ + "/" + path; }
  std::string DestinationShown(const std::string& path) const { return destinationShown_ + "/" + path; }
  bool SameTime(const struct timespec& a, const struct timespec& b) const {
    // FAT keeps times to two seconds.
    return plan_.destination_fat ? std::labs(a.tv_sec - b.tv_sec) <= 2 : a.tv_sec == b.tv_sec;
  }
  bool Unchanged(const struct stat& copy, const struct stat& original) const {
    return S_ISREG(copy.st_mode) && copy.st_size == original.st_size && SameTime(copy.st_mtim, original.st_mtim);
  }

  // Lists the source tree into files_ and folders_: what the lists admit,
  // folder by folder, names sorted. Anything but folders and regular files
  // gets a row and is left.
  void Walk() {
    std::vector<std::string> pending{""};
    while (!pending.empty() && !control_.Cancelled()) {
      const std::string folder = pending.back();
      pending.pop_back();
      Folder dir = OpenBelow(source_, folder, false);
      std::vector<std::string> names;
      if (!dir || !ListNames(dir->get(), names)) {
        walkIncomplete_ = true;
        if (folder.empty()) rootUnreadable_ = true;
        Skip(SourceShown(folder), std::string("the folder cannot be read: ") + strerror(errno));
        continue;
      }
      if (Depth(folder) >= kMaxDepth) {
        walkIncomplete_ = true;
        Skip(SourceShown(folder), "the folder lies too deep");
        continue;
      }
      std::vector<std::string> below;
      for (const std::string& name : names) {
        if (control_.Cancelled()) return;
        SourceFile file{folder, name, {}};
        const std::string path = file.Path();
        if (Untouchable(name) || fstatat(dir->get(), name.c_str(), &file.st, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (S_ISDIR(file.st.st_mode)) {
          if (lists_.AdmitsFolder(path)) below.push_back(path);
        } else if (lists_.AdmitsFile(path, name)) {
          if (S_ISREG(file.st.st_mode)) {
            sourceFiles_.insert(path);
            files_.push_back(std::move(file));
          } else {
            Skip(SourceShown(path), "not a regular file");
          }
        }
      }
      // Reversed onto the stack, so that folders are visited in name order.
      for (auto it = below.rbegin(); it != below.rend(); ++it) {
        folders_.push_back(*it);
        sourceFolders_.insert(*it);
        pending.push_back(*it);
      }
    }
    std::stable_sort(files_.begin(), files_.end(),
                     [](const SourceFile& a, const SourceFile& b) { return a.folder < b.folder; });
  }

  // The open source folder of a file; the last one is kept open.
  int SourceFolder(const std::string& folder) {
    if (!sourceFolder_ || sourceFolderName_ != folder) {
      sourceFolder_ = OpenBelow(source_, folder, false);
      sourceFolderName_ = folder;
    }
    return sourceFolder_ ? sourceFolder_->get() : -1;
  }

  // The open destination folder below base, made when missing; the last
  // one is kept open. In a mirror a file standing where the source has a
  // folder gives way.
  Folder DestinationFolder(int base, const std::string& folder, bool clearWay = false) {
    if (destinationFolder_ && destinationFolderName_ == folder && destinationBase_ == base) return destinationFolder_;
    Folder dir = OpenBelow(base, folder, true);
    if (!dir && clearWay && (errno == ENOTDIR || errno == ELOOP)) {
      const size_t slash = folder.rfind('/');
      Folder parent = OpenBelow(base, slash == std::string::npos ? "" : folder.substr(0, slash), true);
      if (parent && RemoveEntry(parent->get(), folder.substr(slash + 1)) == 0) dir = OpenBelow(base, folder, true);
    }
    destinationFolder_ = dir;
    destinationFolderName_ = folder;
    destinationBase_ = base;
    return dir;
  }

  // Whether the destination can hold the folder's names.
  bool FatPath(const std::string& path) const {
    if (!plan_.destination_fat) return true;
    for (size_t begin = 0; begin < path.size();) {
      size_t end = path.find('/', begin);
      if (end == std::string::npos) end = path.size();
      if (!FatName(path.substr(begin, end - begin))) return false;
      begin = end + 1;
    }
    return true;
  }

  // Whether a FAT destination refuses the file; it then has its row.
  bool FatRefuses(const SourceFile& file, const std::string& destinationPath) {
    if (!plan_.destination_fat) return false;
    if (file.st.st_size > kFatLargest) {
      Skipped(Event::kFileTooLarge, {SourceShown(file.Path()), std::to_string(file.st.st_size)});
      return true;
    }
    if (FatPath(destinationPath)) return false;
    Skipped(Event::kNameNotAllowed, {SourceShown(file.Path())});
    return true;
  }

  // Copies one file into the open folder to as name: 0, or the run's
  // error. A file that alone cannot be copied gets its row.
  int Copy(const SourceFile& file, const Folder& to, const std::string& name, bool replace,
           const Placer::Placed& placed) {
    const int from = SourceFolder(file.folder);
    std::string why;
    int error = 0;
    if (from < 0) return Skip(SourceShown(file.Path()), "the folder went away"), 0;
    const off_t size = file.st.st_size;
    auto counted = [this, size, placed] {
      ++control_.stats.copied;
      control_.stats.bytes += static_cast<unsigned long long>(size);
      if (placed) placed();
    };
    switch (placer_.Copy(from, file.name, file.st, to, name, replace, SourceShown(file.Path()), counted, why, error)) {
      case Placer::kCopied: return 0;
      case Placer::kSkipped: return Skip(SourceShown(file.Path()), why), 0;
      case Placer::kFailed: return error;
    }
    return P_ERR_FILE_OPERATION;
  }

  int Stopped() const { return control_.Cancelled() ? control_.Reason() : 0; }

  // ---- versioning --------------------------------------------------------

  int Versioning() {
    std::vector<std::string> names;
    if (!ListNames(destination_, names)) return P_ERR_FILE_OPERATION;
    std::string previous;
    time_t previousTime = 0;
    for (const std::string& name : names) {
      time_t t;
      // The latest version; of two in one second, the one made last.
      if (ParseVersionName(name, t) && IsFolder(destination_, name) &&
          (previous.empty() || t > previousTime ||
           (t == previousTime && (name.size() > previous.size() || (name.size() == previous.size() && name > previous))))) {
        previous = name;
        previousTime = t;
      }
    }
    for (int sequence = 1; version_.empty(); ++sequence) {
      const std::string name = VersionName(plan_.started, sequence);
      // Nor the name a run cut short at this time took: its mark could
      // not be put on a second one.
      struct stat st {};
      if (fstatat(destination_, (name + ".incomplete").c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) continue;
      if (mkdirat(destination_, name.c_str(), 0755) == 0) {
        version_ = name;
      } else if (errno != EEXIST) {
        return errno == ENOSPC || errno == EDQUOT ? P_ERR_DEST_QUOTA_FULL : P_ERR_FILE_OPERATION;
      }
    }
    Folder version = OpenBelow(destination_, version_, false);
    Folder before = previous.empty() ? nullptr : OpenBelow(destination_, previous, false);
    if (!version) return P_ERR_FILE_OPERATION;
    for (const std::string& folder : folders_) {
      if (!FatPath(folder)) continue;
      if (!OpenBelow(version->get(), folder, true) && (errno == ENOSPC || errno == EDQUOT)) return P_ERR_DEST_QUOTA_FULL;
    }
    Folder earlier;
    std::string earlierName = "\n";
    for (const SourceFile& file : files_) {
      if (int error = Stopped()) return error;
      if (FatRefuses(file, file.Path())) continue;
      Folder to = DestinationFolder(version->get(), file.folder);
      if (!to) {
        if (int error = FolderFailed(file)) return error;
        continue;
      }
      if (before && earlierName != file.folder) {
        earlier = OpenBelow(before->get(), file.folder, false);
        earlierName = file.folder;
      }
      struct stat st {};
      // Unchanged since the previous version: the new one shares its copy.
      if (earlier && fstatat(earlier->get(), file.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
          Unchanged(st, file.st) && linkat(earlier->get(), file.name.c_str(), to->get(), file.name.c_str(), 0) == 0) {
        ++control_.stats.linked;
        continue;
      }
      if (int error = Copy(file, to, file.name, false, nullptr)) return error;
    }
    return 0;
  }

  // Removes the versions rotation does not keep; the run's own is kept.
  void Rotate() {
    std::vector<std::string> names, versions;
    std::vector<time_t> times;
    if (!ListNames(destination_, names)) return;
    for (const std::string& name : names) {
      time_t t;
      if (ParseVersionName(name, t) && IsFolder(destination_, name)) {
        versions.push_back(name);
        times.push_back(t);
      }
    }
    for (size_t index : VersionsToRemove(times, plan_.started, task_.max_version_count, task_.rotation_policy)) {
      if (versions[index] == version_) continue;
      if (RemoveEntry(destination_, versions[index]) == 0) {
        ++control_.stats.removed;
      } else {
        PLOVO_LOG(LOG_WARNING, "task %lu: cannot remove version %s", plan_.id, versions[index].c_str());
      }
    }
  }

  // ---- mirror ------------------------------------------------------------

  int Mirror() {
    for (const std::string& folder : folders_) {
      if (!FatPath(folder)) continue;
      if (!DestinationFolder(destination_, folder, true) && (errno == ENOSPC || errno == EDQUOT)) {
        return P_ERR_DEST_QUOTA_FULL;
      }
    }
    for (const SourceFile& file : files_) {
      if (int error = Stopped()) return error;
      if (FatRefuses(file, file.Path())) continue;
      Folder to = DestinationFolder(destination_, file.folder, true);
      if (!to) {
        if (int error = FolderFailed(file)) return error;
        continue;
      }
      struct stat st {};
      if (fstatat(to->get(), file.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
        if (Unchanged(st, file.st)) continue;
        // A folder where the source has a file gives way to it.
        if (S_ISDIR(st.st_mode) && RemoveEntry(to->get(), file.name) != 0) {
          Skip(SourceShown(file.Path()), "a folder of that name cannot be removed");
          continue;
        }
      }
      if (int error = Copy(file, to, file.name, true, nullptr)) return error;
    }
    if (int error = placer_.Commit()) return error;
    // What the walk could not see may still be on the source: nothing is
    // removed on its word.
    if (!walkIncomplete_) Prune("");
    return Stopped();
  }

  // Removes from the destination folder what the source no longer has,
  // except what the lists exclude; false when something stays.
  bool Prune(const std::string& folder) {
    Folder dir = OpenBelow(destination_, folder, false);
    std::vector<std::string> names;
    if (Depth(folder) >= kMaxDepth || !dir || !ListNames(dir->get(), names)) return false;
    bool empty = true;
    for (const std::string& name : names) {
      if (control_.Cancelled()) return false;
      const std::string path = Join(folder, name);
      struct stat st {};
      if (IsTemporary(name)) {
        unlinkat(dir->get(), name.c_str(), 0);
        continue;
      }
      if (Untouchable(name) || fstatat(dir->get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        empty = false;
        continue;
      }
      if (S_ISDIR(st.st_mode)) {
        // A folder the lists exclude is left whole, as the source's would be.
        if (!lists_.AdmitsFolder(path) || !Prune(path) || sourceFolders_.count(path) != 0 ||
            unlinkat(dir->get(), name.c_str(), AT_REMOVEDIR) != 0) {
          empty = false;
        }
      } else if (sourceFiles_.count(path) != 0 || !lists_.AdmitsFile(path, name)) {
        empty = false;
      } else if (unlinkat(dir->get(), name.c_str(), 0) == 0) {
        ++control_.stats.removed;
      } else {
        empty = false;
        Skip(DestinationShown(path), std::string("cannot be removed: ") + strerror(errno));
      }
    }
    return empty;
  }

  // ---- incremental -------------------------------------------------------

  // "name (n).ext" for n from 1: the first name neither at the
  // destination nor taken by this run; "" when none is free.
  std::string FreeName(int folder, const std::string& folderPath, const std::string& name) {
    const size_t dot = name.rfind('.');
    const std::string stem = dot == std::string::npos || dot == 0 ? name : name.substr(0, dot);
    const std::string extension = stem.size() == name.size() ? "" : name.substr(dot);
    for (int n = 1; n < 10000; ++n) {
      const std::string candidate = stem + " (" + std::to_string(n) + ")" + extension;
      struct stat st {};
      if (claimed_.count(Join(folderPath, candidate)) == 0 &&
          fstatat(folder, candidate.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) {
        return candidate;
      }
    }
    return "";
  }

  int Incremental() {
    if (memory_.Open(plan_.task_folder + "/file-db.sqlite") != 0 || memory_.Load(known_, copies_) != 0 ||
        memory_.Begin() != 0) {
      Log(Event::kFileSkipped, {plan_.task_folder + "/file-db.sqlite", "the task's memory cannot be read"});
      return P_ERR_FILE_OPERATION;
    }
    memoryOpen_ = true;
    const bool media = task_.smart_create_date_dir || task_.rename_photo_video;
    for (size_t index = 0; index < files_.size(); ++index) {
      const SourceFile& file = files_[index];
      if (int error = Stopped()) return error;
      const std::string key = "/" + file.Path();
      auto known = known_.find(key);
      if (known != known_.end() && SameFile(known->second, file.st.st_size, file.st.st_mtim.tv_sec)) continue;
      std::string folder = task_.keep_dir_structure ? file.folder : "";
      std::string name = file.name;
      if (media && (IsPhoto(name) || IsVideo(name))) {
        const int from = SourceFolder(file.folder);
        const std::tm taken = CaptureTime(from, file.name, file.st.st_mtim.tv_sec);
        if (task_.smart_create_date_dir) folder = DateFolderName(taken);
        if (task_.rename_photo_video) name = CaptureName(taken, name);
      }
      Folder to = DestinationFolder(destination_, folder);
      if (!to) {
        if (int error = FolderFailed(file)) return error;
        continue;
      }
      struct stat st {};
      const bool standing = fstatat(to->get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0;
      bool replace = false;
      if (standing || claimed_.count(Join(folder, name)) != 0) {
        // Overwrite never replaces the copy of another source: with the
        // sources moved off the card it may be the only one left.
        auto copied = copies_.find("/" + Join(folder, name));
        const bool another = standing && copied != copies_.end() && copied->second != key;
        if (task_.conflict_policy == 2 && !(standing && S_ISDIR(st.st_mode)) && !another) {
          replace = true;
        } else if ((name = FreeName(to->get(), folder, name)).empty()) {
          Skip(SourceShown(file.Path()), "no free name at the destination");
          continue;
        }
      }
      const std::string target = Join(folder, name);
      if (FatRefuses(file, target)) continue;
      claimed_.insert(target);
      auto placed = [this, index, key, target] {
        const SourceFile& copied = files_[index];
        if (memory_.Remember(key, "/" + target, copied.st.st_size, copied.st.st_mtim.tv_sec, plan_.started) != 0) {
          PLOVO_LOG(LOG_WARNING, "task %lu: %s is not remembered", plan_.id, key.c_str());
        }
        lastWriter_[target] = index;
        if (task_.remove_src_file) removals_.push_back({index, target});
      };
      if (int error = Copy(file, to, name, replace, placed)) return error;
      // The memory's rows are committed with each batch put in place, so a
      // killed daemon forgets at most the renames of one batch.
      if (placer_.Empty()) memory_.End(), memory_.Begin();
    }
    return 0;
  }

  // Removes the sources whose copies are in place, synced, and not
  // replaced by a later file of the run; a source changed since it was
  // copied stays.
  void RemoveSources() {
    for (const auto& [index, target] : removals_) {
      const SourceFile& file = files_[index];
      struct stat st {};
      const int from = SourceFolder(file.folder);
      if (lastWriter_[target] != index || from < 0 ||
          fstatat(from, file.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 || st.st_ino != file.st.st_ino ||
          st.st_dev != file.st.st_dev || st.st_size != file.st.st_size ||
          st.st_mtim.tv_sec != file.st.st_mtim.tv_sec) {
        continue;
      }
      if (unlinkat(from, file.name.c_str(), 0) == 0) {
        ++control_.stats.removed;
      } else {
        Skip(SourceShown(file.Path()), std::string("copied, but the source cannot be removed: ") + strerror(errno));
      }
    }
  }

  const RunPlan& plan_;
  RunControl& control_;
  const TaskDB::TaskInfo& task_;
  Placer placer_;
  Lists lists_;
  int source_ = -1, destination_ = -1;
  std::string sourceShown_, destinationShown_;
  std::vector<SourceFile> files_;
  std::vector<std::string> folders_;  // parents before their children
  std::unordered_set<std::string> sourceFiles_, sourceFolders_;
  Folder sourceFolder_, destinationFolder_;
  std::string sourceFolderName_, destinationFolderName_;
  int destinationBase_ = -1;
  std::string version_;
  // Incremental: the memory, the names taken by this run, which file of
  // the run wrote each, and the sources to remove.
  FileMemory memory_;
  bool memoryOpen_ = false;
  std::unordered_map<std::string, FileMemory::Known> known_;
  std::unordered_map<std::string, std::string> copies_;  // destination path -> its source path
  std::unordered_set<std::string> claimed_;
  std::unordered_map<std::string, size_t> lastWriter_;
  std::vector<std::pair<size_t, std::string>> removals_;
  bool walkIncomplete_ = false;  // a folder could not be read
  bool rootUnreadable_ = false;  // the source folder itself could not
};

}  // namespace

int RunCopy(const RunPlan& plan, RunControl& control) {
  Plovo::UniqueFd sourceShare(open(plan.source_root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Plovo::UniqueFd destinationShare(open(plan.destination_root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (sourceShare.get() < 0) return P_ERR_SOURCE_ROOT_MISSING;
  if (destinationShare.get() < 0) return P_ERR_DEST_ROOT_MISSING;
  Folder source = OpenBelow(sourceShare.get(), plan.source.substr(plan.source_root.size()), false);
  if (!source) return P_ERR_SOURCE_ROOT_MISSING;
  Folder destination = OpenBelow(destinationShare.get(), plan.destination.substr(plan.destination_root.size()), true);
  if (!destination) return errno == ENOSPC || errno == EDQUOT ? P_ERR_DEST_QUOTA_FULL : P_ERR_DEST_ROOT_MISSING;
  Engine engine(plan, control, destinationShare.get());
  return engine.Run(source->get(), destination->get());
}

}  // namespace plovod
