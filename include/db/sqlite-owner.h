// Owners of the things SQLite hands out, so that each is released exactly
// once on every path: a statement is finalised, a text from sqlite3_mprintf
// or an error text from sqlite3_exec is freed. Shared by the task and log
// databases.
#ifndef PLOVO_DB_SQLITE_OWNER_H
#define PLOVO_DB_SQLITE_OWNER_H

#include <sqlite3.h>

#include <memory>

namespace Plovo {

struct SqliteTextFree {
  void operator()(char* text) const { sqlite3_free(text); }
};
// A text from sqlite3_mprintf or the error text of sqlite3_exec.
using SqliteText = std::unique_ptr<char, SqliteTextFree>;

struct SqliteStatementFinalize {
  void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
};
using SqliteStatement = std::unique_ptr<sqlite3_stmt, SqliteStatementFinalize>;

// Holds an object's Lock() for the length of a scope.
template <typename DB>
class ScopedDBLock {
 public:
  explicit ScopedDBLock(DB& db) : db_(db) { db_.Lock(); }
  ~ScopedDBLock() { db_.Unlock(); }
  ScopedDBLock(const ScopedDBLock&) = delete;
  ScopedDBLock& operator=(const ScopedDBLock&) = delete;

 private:
  DB& db_;
};

}  // namespace Plovo

#endif
