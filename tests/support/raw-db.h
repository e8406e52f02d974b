// A SQLite connection of the test's own, to build or look at a database
// file without the library under test.
#ifndef PLOVO_TESTS_SUPPORT_RAW_DB_H
#define PLOVO_TESTS_SUPPORT_RAW_DB_H

#include <sqlite3.h>

#include <string>

namespace plovo_test {

struct RawDB {
  // keepWal: closing leaves the "-wal" file with its frames, as a crash of
  // the daemon would.
  explicit RawDB(const std::string& path, bool keepWal = false) {
    sqlite3_open(path.c_str(), &db);
    if (keepWal) sqlite3_db_config(db, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  }
  ~RawDB() { sqlite3_close_v2(db); }
  RawDB(const RawDB&) = delete;
  RawDB& operator=(const RawDB&) = delete;
  int Run(const std::string& sql) const { return sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr); }
  // Every row of the query, columns joined by ' ' ("NULL" for null), rows by '\n'.
  std::string Rows(const std::string& sql) const {
    std::string rows;
    sqlite3_exec(db, sql.c_str(), [](void* out, int n, char** values, char**) {
      std::string& text = *static_cast<std::string*>(out);
      for (int i = 0; i < n; ++i) {
        text += (i ? " " : text.empty() ? "" : "\n") + std::string(values[i] ? values[i] : "NULL");
      }
      return 0;
    }, &rows, nullptr);
    return rows;
  }
  sqlite3* db = nullptr;
};

}  // namespace plovo_test

#endif
