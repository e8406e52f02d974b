#include "updater/updater-utils.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <mutex>

#include "common/error-text.h"
#include "common/file-op.h"
#include "common/log.h"
#include "common/unique-fd.h"
#include "db/task-db.h"

namespace {

// The daemon may hold the write lock; waiting is better than failing a
// service start.
constexpr int kBusyTimeoutMs = 300000;

std::mutex gFaultMutex;
std::string gFaultStep;
int gFaultCountdown = 0;

// True, once, when a test asked this step of ReplaceDB to fail and this is
// the pass it named.
bool FaultAt(const char* step) {
  std::lock_guard<std::mutex> lock(gFaultMutex);
  if (gFaultStep != step || --gFaultCountdown > 0) return false;
  gFaultStep.clear();
  errno = EIO;
  return true;
}

int Exec(sqlite3* db, const char* sql) {
  char* raw = nullptr;
  int rc = sqlite3_exec(db, sql, nullptr, nullptr, &raw);
  Plovo::SqliteText errorText(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_exec: [%d] %s\n", rc, errorText ? errorText.get() : "");
    return -1;
  }
  return 0;
}

// Folds the database's "-wal" file into the main file and empties it. 0, or
// -1 when a reader kept part of it in the log.
int Checkpoint(const std::string& path) {
  UpdaterConnection db;
  if (db.Open(path) != 0) return -1;
  // A connection learns that the database is in WAL mode only when it
  // first reads it; before that a checkpoint does nothing.
  int logFrames = -1;
  int checkpointed = -1;
  int rc = Exec(db.Handle(), "SELECT count(*) FROM sqlite_master;") != 0
               ? SQLITE_ERROR
               : sqlite3_wal_checkpoint_v2(db.Handle(), nullptr, SQLITE_CHECKPOINT_TRUNCATE,
                                           &logFrames, &checkpointed);
  if (rc != SQLITE_OK || logFrames != checkpointed || FaultAt("checkpoint")) {
    PLOVO_LIB_ERR("Failed to checkpoint db '%s'. [%d] %s\n", path.c_str(), rc,
                  sqlite3_errmsg(db.Handle()));
    return -1;
  }
  return 0;
}

int SyncPath(const std::string& path, int flags) {
  Plovo::UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | flags));
  if (fd.get() < 0 || FaultAt("sync") || fsync(fd.get()) != 0) {
    PLOVO_LIB_ERR("Failed to sync '%s': %s\n", path.c_str(), Plovo::ErrorText(errno).c_str());
    return -1;
  }
  return 0;
}

// A missing file is no failure.
int RemoveFile(const std::string& file) {
  if (unlink(file.c_str()) != 0 && errno != ENOENT) {
    PLOVO_LIB_ERR("Failed to remove '%s': %s\n", file.c_str(), Plovo::ErrorText(errno).c_str());
    return -1;
  }
  return 0;
}

std::string FolderOf(const std::string& path) {
  size_t slash = path.find_last_of('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

}  // namespace

UpdaterConnection::~UpdaterConnection() {
  if (handle_ == nullptr) return;
  int rc = sqlite3_close_v2(handle_);
  if (rc != SQLITE_OK) PLOVO_LIB_ERR("sqlite3_close_v2: [%d]\n", rc);
}

int UpdaterConnection::Open(const std::string& path) {
  // Opened as root: a symbolic link in the database's place must not make
  // root write a file elsewhere.
  int rc = sqlite3_open_v2(path.c_str(), &handle_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOFOLLOW,
                           nullptr);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to open db at '%s'. [%d] %s\n", path.c_str(), rc, sqlite3_errmsg(handle_));
    sqlite3_close_v2(handle_);  // a handle is returned even when the open fails
    handle_ = nullptr;
    return -1;
  }
  sqlite3_busy_timeout(handle_, kBusyTimeoutMs);
  // Closing the last connection would otherwise fold the "-wal" file into
  // the main file: reading a live database must leave its files as they are.
  sqlite3_db_config(handle_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  return 0;
}

int PrepareDBQuery(UpdaterConnection& db, const std::string& path, const std::string& sql,
                   Plovo::SqliteStatement& statement) {
  if (db.Open(path) != 0) return -1;
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db.Handle(), sql.c_str(), -1, &raw, nullptr);
  statement.reset(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_prepare_v2: [%d] %s\n", rc, sqlite3_errmsg(db.Handle()));
    return -1;
  }
  return 0;
}

int StepDBQuery(UpdaterConnection& db, sqlite3_stmt* statement) {
  int rc = sqlite3_step(statement);
  if (rc == SQLITE_ROW) return 1;
  if (rc == SQLITE_DONE) return 0;
  PLOVO_LIB_ERR("sqlite3_step: [%d] %s\n", rc, sqlite3_errmsg(db.Handle()));
  return -1;
}

int GetDBVersion(const std::string& path, unsigned int& version) {
  std::string text;
  int found = GetDBRecord<std::string>(
      path, "SELECT value FROM config_table WHERE key = 'version' ;",
      [](sqlite3_stmt* statement, std::string& value) {
        value = sqlite3_column_string(statement, 0);
      },
      text);
  if (found != 1) return found;
  char* end = nullptr;
  errno = 0;
  unsigned long parsed = std::strtoul(text.c_str(), &end, 10);
  // strtoul would also take blanks and a sign before the digits.
  if (text.empty() || !std::isdigit(static_cast<unsigned char>(text[0])) || *end != '\0' ||
      errno != 0 || parsed > UINT_MAX) {
    PLOVO_LIB_ERR("Invalid db version '%s' at '%s'\n", text.c_str(), path.c_str());
    return -1;
  }
  version = static_cast<unsigned int>(parsed);
  return 1;
}

int UpdateDB(const std::string& path, const std::string& sql) {
  if (path.empty() || sql.empty()) {
    PLOVO_LIB_ERR("Invalid Parameter\n");
    return -1;
  }
  UpdaterConnection db;
  if (db.Open(path) != 0) return -1;
  if (Exec(db.Handle(), "BEGIN TRANSACTION;") != 0) return -1;
  if (Exec(db.Handle(), sql.c_str()) != 0 || Exec(db.Handle(), "END TRANSACTION;") != 0) {
    Exec(db.Handle(), "ROLLBACK;");
    return -1;
  }
  return 0;
}

int GetTimeStr(const std::string& format, std::string& out) {
  time_t now = time(nullptr);
  struct tm local;
  char buffer[256];
  if (now == static_cast<time_t>(-1) || localtime_r(&now, &local) == nullptr) return -1;
  size_t n = strftime(buffer, sizeof(buffer), format.c_str(), &local);
  if (n == 0) return -1;
  out.assign(buffer, n);
  return 0;
}

int RemoveDBFiles(const std::string& path) {
  int result = 0;
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) {
    if (RemoveFile(path + suffix) != 0) result = -1;
  }
  return result;
}

int BackupDB(const std::string& live, const std::string& copy) {
  if (RemoveDBFiles(copy) != 0) return -1;
  UpdaterConnection source;
  if (source.Open(live) != 0) return -1;
  sqlite3* raw = nullptr;
  int rc = sqlite3_open_v2(copy.c_str(), &raw,
                           SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW, nullptr);
  std::unique_ptr<sqlite3, int (*)(sqlite3*)> target(raw, sqlite3_close_v2);
  if (rc == SQLITE_OK) {
    // Reads the live database as a reader does, "-wal" file included.
    sqlite3_backup* backup = sqlite3_backup_init(target.get(), "main", source.Handle(), "main");
    if (backup == nullptr) {
      rc = sqlite3_errcode(target.get());
    } else {
      sqlite3_backup_step(backup, -1);
      rc = sqlite3_backup_finish(backup);
    }
  }
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to copy db '%s' to '%s'. [%d] %s\n", live.c_str(), copy.c_str(), rc,
                  sqlite3_errmsg(target.get()));
    target.reset();
    RemoveDBFiles(copy);
    return -1;
  }
  return 0;
}

int ReplaceDB(const std::string& copy, const std::string& live, const std::string& keep) {
  // The copy must stand alone before it is the database: its whole content
  // in its main file, on disk, with the live file's owner and mode.
  struct stat liveStat;
  if (lstat(live.c_str(), &liveStat) != 0 || chown(copy.c_str(), liveStat.st_uid, liveStat.st_gid) != 0 ||
      chmod(copy.c_str(), liveStat.st_mode & 07777) != 0) {
    PLOVO_LIB_ERR("Failed to give '%s' the owner and mode of '%s': %s\n", copy.c_str(), live.c_str(),
                  Plovo::ErrorText(errno).c_str());
    return -1;
  }
  if (Checkpoint(copy) != 0 || RemoveFile(copy + "-wal") != 0 || RemoveFile(copy + "-shm") != 0 ||
      SyncPath(copy, 0) != 0) {
    return -1;
  }
  // The live "-wal" must be empty before it goes, so that nothing committed
  // is lost if the power fails before the rename; and it must go, or SQLite
  // would replay it into the new file.
  if (Checkpoint(live) != 0 || RemoveFile(live + "-wal") != 0 || RemoveFile(live + "-shm") != 0) {
    return -1;
  }
  if (!keep.empty() && (RemoveDBFiles(keep) != 0 || link(live.c_str(), keep.c_str()) != 0)) {
    PLOVO_LIB_ERR("Failed to keep '%s' as '%s': %s\n", live.c_str(), keep.c_str(), Plovo::ErrorText(errno).c_str());
    return -1;
  }
  if (FaultAt("rename") || FSRename(copy, live) != 0) {
    PLOVO_LIB_ERR("Failed to rename '%s' -> '%s'\n", copy.c_str(), live.c_str());
    if (!keep.empty()) RemoveFile(keep);
    return -1;
  }
  // The new database is in place: a folder that cannot be synced only means
  // that a power cut could still bring back the old one, which is whole too.
  SyncPath(FolderOf(live), O_DIRECTORY);
  return 0;
}

int RestoreDB(const std::string& keep, const std::string& live) {
  if (RemoveFile(live + "-wal") != 0 || RemoveFile(live + "-shm") != 0 || FSRename(keep, live) != 0) {
    PLOVO_LIB_ERR("Failed to put back '%s' -> '%s'\n", keep.c_str(), live.c_str());
    return -1;
  }
  return SyncPath(FolderOf(live), O_DIRECTORY);
}

void FailReplaceDBStepForTest(const std::string& step, int nth) {
  std::lock_guard<std::mutex> lock(gFaultMutex);
  gFaultStep = step;
  gFaultCountdown = nth;
}
