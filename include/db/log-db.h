// The copy daemon's log database, "log-db.sqlite" in the repository's
// database folder: one row per logged event (log_info_table), the schema
// version and the rotation limit (config_table).
//
// The daemon appends rows; the module counts and lists them for the log
// screen and reads and changes the rotation limit, the largest number of
// rows kept (100000 by default). Rotation is done by triggers inside the
// database, so every writer obeys it.
//
// Like TaskDB: one connection and one mutex per instance, one statement per
// call, 0 or -1 results, every failure logged. A web request builds its own
// instance, uses it and lets it close.
#ifndef PLOVO_DB_LOG_DB_H
#define PLOVO_DB_LOG_DB_H

#include <pthread.h>
#include <sqlite3.h>

#include <cstdint>
#include <list>
#include <string>
#include <vector>

#include "db/sqlite-owner.h"

class LogDB {
 public:
  // One log row; the row id is not part of it.
  struct LogInfo {
    LogInfo() { Clear(); }
    void Clear();

    unsigned long task_id;
    int log_type;             // 1, 2 or 4
    unsigned int timestamp;   // seconds since the epoch
    unsigned int description_id;  // the number of the message shown
    std::string description_param;  // what is substituted into the message
    int error;                // the event's error code, 0 none
  };

  // Which rows to count or list, newest first.
  struct LogInfoFilter {
    LogInfoFilter() { Clear(); }
    void Clear();
    // The text that follows "FROM log_info_table" in both queries: the
    // conditions, the order and the page. Every text of the filter is
    // quoted, so nothing of it becomes SQL.
    std::string ToSQLQueryString() const;

    unsigned long task_id;        // 0: all tasks
    unsigned int limit;           // 0: no limit
    unsigned int offset;          // 0: from the newest row
    unsigned int from_timestamp;  // 0: no lower bound
    unsigned int to_timestamp;    // 0: no upper bound
    std::string key_word;         // searched in description_param; "" none
    unsigned int log_type;        // exactly 1, 2 or 4 selects one type; else all
    // The message numbers to show: none shows no row; all twelve need no
    // condition.
    std::vector<unsigned int> log_desc_id_list;
  };

  static LogDB& GetInstance();

  LogDB();
  ~LogDB();
  LogDB(const LogDB&) = delete;
  LogDB& operator=(const LogDB&) = delete;

  // Opens (creating when absent) the database at path and makes its schema.
  // The folder must exist. As TaskDB::Initialize otherwise. 0 or -1.
  int Initialize(const std::string& path);
  void Destroy();
  void Lock();
  void Unlock();

  // Appends a row; the oldest rows beyond the limit go at once.
  int AddLogInfo(const LogInfo& info);
  // The number of rows the filter selects (its limit and offset applied
  // too). A failure while reading the count is logged and still gives 0,
  // with count unchanged.
  int GetLogListCount(const LogInfoFilter& filter, unsigned long& count);
  // Appends the selected rows, newest first, to list (not emptied first).
  int ListLogInfo(const LogInfoFilter& filter, std::list<LogInfo>& list);
  // The rotation limit; 0 when the row is missing. A failure while reading
  // it is logged and still gives 0, with count unchanged.
  int GetRotationCount(unsigned long& count);
  // Sets the limit, 5 to 100000; lowering it removes the oldest rows beyond
  // it in the same statement. -1 outside the bounds, nothing changed.
  int UpdateRotationCount(unsigned long count);

  // Fills a record from a row of the list query's columns.
  static void GetLogInfoFromDBRecord(sqlite3_stmt* statement, LogInfo& info);

 private:
  // Reads one unsigned number from the first column of the query's row.
  int GetCount(const std::string& sql, unsigned long& count);
  int Write(const Plovo::SqliteText& sql, const char* format);

  pthread_mutex_t mutex;
  sqlite3* handle = nullptr;
};

#endif
