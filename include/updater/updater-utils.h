// SQL helpers of the installer and the migration, each on a database file
// by path: its own connection, opened without creating the file and without
// following a symbolic link, closed before the call returns.
//
// Failures are logged as "[ERR] updater-utils(<line>): ...".
#ifndef PLOVO_UPDATER_UPDATER_UTILS_H
#define PLOVO_UPDATER_UPDATER_UTILS_H

#include <sqlite3.h>

#include <list>
#include <string>

#include "db/sqlite-owner.h"

// An open connection to an existing database file, closed by its destructor
// (a close failure is logged). Connections to a live database leave its
// "-wal" file alone when they close, so that reading a database never
// rewrites it.
class UpdaterConnection {
 public:
  UpdaterConnection() = default;
  ~UpdaterConnection();
  UpdaterConnection(const UpdaterConnection&) = delete;
  UpdaterConnection& operator=(const UpdaterConnection&) = delete;
  // 0, or -1 after "Failed to open db at '<path>'. [<code>] <text>".
  int Open(const std::string& path);
  sqlite3* Handle() const { return handle_; }

 private:
  sqlite3* handle_ = nullptr;
};

// The schema version of the task database at path: 1 found (version set),
// 0 no version row, -1 failure.
int GetDBVersion(const std::string& path, unsigned int& version);

// Runs sql on the database at path in one transaction: all of it or, after a
// failure and a rollback, none. 0 or -1.
int UpdateDB(const std::string& path, const std::string& sql);

// Runs sql and hands the first row to reader: 1 found, 0 no row, -1 failure.
template <typename Record>
int GetDBRecord(const std::string& path, const std::string& sql,
                void (*reader)(sqlite3_stmt*, Record&), Record& record);

// Runs sql and appends every row to list through reader: 0 or -1 (rows read
// before a failure stay in the list).
template <typename Record>
int ListDBRecord(const std::string& path, const std::string& sql,
                 void (*reader)(sqlite3_stmt*, Record&), std::list<Record>& list);

// The local time now, formatted by strftime. 0, or -1 when the time cannot
// be read or formatted.
int GetTimeStr(const std::string& format, std::string& out);

// The working copy of a database: a complete copy of the live file made
// with SQLite's online backup, so that transactions still only in the live
// "-wal" file are in it. A stale copy (and its "-wal", "-shm" and
// "-journal") is removed first. 0 or -1; the live database is not changed.
int BackupDB(const std::string& live, const std::string& copy);

// Puts a finished working copy in the live database's place so that a power
// cut leaves either the old or the new database whole: the copy gets the
// live file's owner and mode and is checkpointed and synced, the live
// database is checkpointed and its "-wal" and "-shm" removed (SQLite would
// replay an old "-wal" into the new file), the copy renamed over it and the
// folder synced. When keep is given, the old file stays there (a hard link)
// for RestoreDB. 0 once the copy is renamed (a failing folder sync is only
// logged), else -1; until the rename the live database keeps its content. No other connection may have the live database open: its writes
// would go to the replaced file.
int ReplaceDB(const std::string& copy, const std::string& live, const std::string& keep = "");

// Puts the file kept by ReplaceDB back in the live database's place. 0 or -1.
int RestoreDB(const std::string& keep, const std::string& live);

// Removes a database file with its "-wal", "-shm" and "-journal" files. 0,
// or -1 when one of them exists and cannot be removed (a folder in the
// place of a working copy, say).
int RemoveDBFiles(const std::string& path);

// For tests: ReplaceDB fails, once, the nth time from now that it reaches
// the named step, as if the system call had failed. Each ReplaceDB passes
// "checkpoint" twice (the copy, then the live file), "sync" twice (the
// copy, then the folder after the rename, which does not fail the call)
// and "rename" once. "" clears it.
void FailReplaceDBStepForTest(const std::string& step, int nth = 1);

// ---- template definitions ----

int PrepareDBQuery(UpdaterConnection& db, const std::string& path, const std::string& sql,
                   Plovo::SqliteStatement& statement);
// The result of one sqlite3_step: 1 a row, 0 done, -1 failure (logged).
int StepDBQuery(UpdaterConnection& db, sqlite3_stmt* statement);

template <typename Record>
int GetDBRecord(const std::string& path, const std::string& sql,
                void (*reader)(sqlite3_stmt*, Record&), Record& record) {
  UpdaterConnection db;
  Plovo::SqliteStatement statement;
  if (PrepareDBQuery(db, path, sql, statement) != 0) return -1;
  int row = StepDBQuery(db, statement.get());
  if (row == 1) reader(statement.get(), record);
  return row;
}

template <typename Record>
int ListDBRecord(const std::string& path, const std::string& sql,
                 void (*reader)(sqlite3_stmt*, Record&), std::list<Record>& list) {
  UpdaterConnection db;
  Plovo::SqliteStatement statement;
  if (PrepareDBQuery(db, path, sql, statement) != 0) return -1;
  for (;;) {
    int row = StepDBQuery(db, statement.get());
    if (row != 1) return row;
    Record record;
    reader(statement.get(), record);
    list.push_back(record);
  }
}

#endif
