// A second connection of the test's own on a database file, to look at what
// the library wrote without going through it.
#ifndef PLOVO_TESTS_DB_RAW_SQLITE_H
#define PLOVO_TESTS_DB_RAW_SQLITE_H

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <string>

namespace plovo_test {

class RawSqlite {
 public:
  explicit RawSqlite(const std::string& path) {
    sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  }
  ~RawSqlite() { sqlite3_close_v2(db_); }
  RawSqlite(const RawSqlite&) = delete;
  RawSqlite& operator=(const RawSqlite&) = delete;

  // Every row of the query, columns joined by ' ' ("NULL" for null), rows
  // by ','; the error text when the query fails.
  std::string Rows(const std::string& sql) const {
    std::string rows;
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &statement, nullptr) != SQLITE_OK) return sqlite3_errmsg(db_);
    for (int row = 0; sqlite3_step(statement) == SQLITE_ROW; ++row) {
      for (int i = 0; i < sqlite3_column_count(statement); ++i) {
        const unsigned char* text = sqlite3_column_text(statement, i);
        rows += (i ? " " : row ? "," : "") + std::string(text ? reinterpret_cast<const char*>(text) : "NULL");
      }
    }
    sqlite3_finalize(statement);
    return rows;
  }
  // The columns of a table as "name type notnull default pk", in order.
  std::string Columns(const std::string& table) const {
    return Rows("SELECT name, type, \"notnull\", dflt_value, pk FROM pragma_table_info('" + table + "')");
  }
  // SQLite's result code for the statements.
  int Run(const std::string& sql) const { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr); }
  void Exec(const std::string& sql) const { EXPECT_EQ(Run(sql), 0); }

 private:
  sqlite3* db_ = nullptr;
};

}  // namespace plovo_test

#endif
