// An incremental task's memory of what it copied: "file-db.sqlite" in the
// task's folder, one row per copied file in file_info_table with the
// source path (relative to the task's source folder, "/DCIM/a.jpg"), where
// it went (relative to the destination folder), its size and modification
// time, and when it was copied. A file the memory knows with the same size
// and time is not copied again, wherever its copy went since.
//
// Used by one run at a time (a task runs once at a time); not thread-safe.
#ifndef PLOVO_DAEMON_ENGINE_FILE_MEMORY_H
#define PLOVO_DAEMON_ENGINE_FILE_MEMORY_H

#include <sqlite3.h>

#include <cstdint>
#include <string>
#include <unordered_map>

namespace plovod {

class FileMemory {
 public:
  struct Known {
    int64_t size = 0;
    int64_t mtime = 0;  // 0 for rows of a database from before times were kept
  };

  FileMemory() = default;
  ~FileMemory();
  FileMemory(const FileMemory&) = delete;
  FileMemory& operator=(const FileMemory&) = delete;

  // Opens (creating when absent) the database and its table and indexes;
  // an older table without the time columns gets them. 0 or -1 (logged).
  int Open(const std::string& path);
  // Every remembered source path with the last size and time copied, and
  // every destination path with the source last copied there.
  int Load(std::unordered_map<std::string, Known>& known, std::unordered_map<std::string, std::string>& copies);
  // Remembers one copy. Rows are written in one transaction per batch:
  // Begin, Remember..., End. 0 or -1 (logged).
  int Begin();
  int Remember(const std::string& source, const std::string& destination, int64_t size, int64_t mtime,
               int64_t copied);
  int End();

 private:
  int Exec(const char* sql);

  sqlite3* db_ = nullptr;
  sqlite3_stmt* insert_ = nullptr;
};

// Whether the memory's row says the file (size, mtime) was copied as it is.
inline bool SameFile(const FileMemory::Known& known, int64_t size, int64_t mtime) {
  return known.size == size && (known.mtime == mtime || known.mtime == 0);
}

}  // namespace plovod

#endif
