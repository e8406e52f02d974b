#include "daemon/engine/file-memory.h"

#include "common/log.h"
#include "db/sqlite-owner.h"

namespace plovod {

namespace {

const char kSchema[] =
    "PRAGMA journal_mode = WAL;"
    "CREATE TABLE IF NOT EXISTS file_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT,"
    " source_path TEXT NOT NULL, destination_path TEXT NOT NULL, size INTEGER NOT NULL,"
    " mtime INTEGER NOT NULL DEFAULT 0, copied_time INTEGER NOT NULL DEFAULT 0);"
    "CREATE INDEX IF NOT EXISTS file_info_src_path_idx on file_info_table(source_path);"
    "CREATE INDEX IF NOT EXISTS file_info_dst_path_idx on file_info_table(destination_path);";

}  // namespace

FileMemory::~FileMemory() {
  sqlite3_finalize(insert_);
  sqlite3_close(db_);
}

int FileMemory::Exec(const char* sql) {
  Plovo::SqliteText message;
  char* text = nullptr;
  const int rc = sqlite3_exec(db_, sql, nullptr, nullptr, &text);
  message.reset(text);
  if (rc == SQLITE_OK) return 0;
  PLOVO_LOG(LOG_ERR, "file memory: %s: [%d] %s", sql, rc, text ? text : "");
  return -1;
}

int FileMemory::Open(const std::string& path) {
  if (sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr) != SQLITE_OK) {
    PLOVO_LOG(LOG_ERR, "file memory: cannot open '%s': %s", path.c_str(), sqlite3_errmsg(db_));
    return -1;
  }
  sqlite3_busy_timeout(db_, 5000);
  if (Exec(kSchema) != 0) return -1;
  // A memory from before the times were kept: its rows match by size.
  sqlite3_stmt* probe = nullptr;
  const bool hasTime = sqlite3_prepare_v2(db_, "SELECT mtime, copied_time FROM file_info_table LIMIT 0", -1,
                                          &probe, nullptr) == SQLITE_OK;
  sqlite3_finalize(probe);
  if (!hasTime && Exec("ALTER TABLE file_info_table ADD COLUMN mtime INTEGER NOT NULL DEFAULT 0;"
                       "ALTER TABLE file_info_table ADD COLUMN copied_time INTEGER NOT NULL DEFAULT 0;") != 0) {
    return -1;
  }
  const char* insert =
      "INSERT INTO file_info_table (source_path, destination_path, size, mtime, copied_time) VALUES (?, ?, ?, ?, ?)";
  if (sqlite3_prepare_v2(db_, insert, -1, &insert_, nullptr) != SQLITE_OK) {
    PLOVO_LOG(LOG_ERR, "file memory: %s", sqlite3_errmsg(db_));
    return -1;
  }
  return 0;
}

int FileMemory::Load(std::unordered_map<std::string, Known>& known,
                     std::unordered_map<std::string, std::string>& copies) {
  sqlite3_stmt* raw = nullptr;
  // In row order, so that the last copy of a path is the one remembered.
  if (sqlite3_prepare_v2(db_, "SELECT source_path, size, mtime, destination_path FROM file_info_table ORDER BY id", -1,
                         &raw,
                         nullptr) != SQLITE_OK) {
    PLOVO_LOG(LOG_ERR, "file memory: %s", sqlite3_errmsg(db_));
    return -1;
  }
  Plovo::SqliteStatement statement(raw);
  int rc;
  while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
    const char* source = reinterpret_cast<const char*>(sqlite3_column_text(raw, 0));
    const char* destination = reinterpret_cast<const char*>(sqlite3_column_text(raw, 3));
    if (source == nullptr || destination == nullptr) continue;
    known[source] = {sqlite3_column_int64(raw, 1), sqlite3_column_int64(raw, 2)};
    copies[destination] = source;
  }
  if (rc == SQLITE_DONE) return 0;
  PLOVO_LOG(LOG_ERR, "file memory: %s", sqlite3_errmsg(db_));
  return -1;
}

int FileMemory::Begin() { return Exec("BEGIN IMMEDIATE;"); }

int FileMemory::End() { return Exec("COMMIT;"); }

int FileMemory::Remember(const std::string& source, const std::string& destination, int64_t size, int64_t mtime,
                         int64_t copied) {
  sqlite3_reset(insert_);
  sqlite3_bind_text(insert_, 1, source.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(insert_, 2, destination.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_int64(insert_, 3, size);
  sqlite3_bind_int64(insert_, 4, mtime);
  sqlite3_bind_int64(insert_, 5, copied);
  if (sqlite3_step(insert_) == SQLITE_DONE) return 0;
  PLOVO_LOG(LOG_ERR, "file memory: %s", sqlite3_errmsg(db_));
  return -1;
}

}  // namespace plovod
