#include "db/log-db.h"

#include <sstream>

#include "common/log.h"
#include "db/task-db.h"

using Plovo::ScopedDBLock;
using Plovo::SqliteStatement;
using Plovo::SqliteText;

namespace {

// The daemon holds the write lock while it appends; waiting for it is
// always better than failing a request.
constexpr int kBusyTimeoutMs = 300000;

// The full set of message numbers: a filter that names all of them needs
// no condition.
constexpr size_t kAllDescriptionIds = 12;

constexpr unsigned long kMinRotationCount = 5;
constexpr unsigned long kMaxRotationCount = 100000;

// Log schema version 1. Rotation lives in the database, so that the
// daemon's inserts obey it too: lowering the limit trims at once, and an
// insert past the limit removes the oldest rows (lowest ids).
constexpr const char* kSchema =
    "PRAGMA journal_mode = WAL;"
    "PRAGMA synchronous = NORMAL;"
    "PRAGMA recursive_triggers = true;"
    "BEGIN IMMEDIATE;"
    "CREATE TABLE IF NOT EXISTS config_table ("
    " key TEXT PRIMARY KEY,"
    " value TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS log_info_table ("
    " id INTEGER PRIMARY KEY AUTOINCREMENT,"
    " task_id INTEGER NOT NULL,"
    " log_type INTEGER NOT NULL,"
    " timestamp INTEGER NOT NULL,"
    " description_id INTEGER NOT NULL,"
    " description_param TEXT NOT NULL,"
    " error INTEGER NOT NULL);"
    "CREATE INDEX IF NOT EXISTS log_info_table_task_id_idx on log_info_table(task_id);"
    "CREATE INDEX IF NOT EXISTS log_info_table_log_type_idx on log_info_table(log_type);"
    "CREATE INDEX IF NOT EXISTS log_info_table_timestamp_idx on log_info_table(timestamp);"
    "CREATE INDEX IF NOT EXISTS log_info_table_description_id_idx on log_info_table(description_id);"
    "CREATE INDEX IF NOT EXISTS log_info_table_description_param_idx on log_info_table(description_param);"
    "INSERT or IGNORE into config_table VALUES ('version', 1);"
    "INSERT or IGNORE into config_table VALUES ('log_rotate_count', 100000);"
    "CREATE TRIGGER IF NOT EXISTS log_rotate_trigger"
    " AFTER UPDATE OF value ON config_table WHEN NEW.key = 'log_rotate_count' AND"
    " CAST (NEW.value as INTEGER) < CAST (OLD.value as INTEGER)"
    " BEGIN       DELETE FROM log_info_table WHERE id IN        (SELECT id FROM log_info_table"
    " ORDER BY id DESC LIMIT -1 OFFSET CAST(NEW.value as INTEGER)); END;"
    "CREATE TRIGGER IF NOT EXISTS add_log_info_rotate_trigger"
    " AFTER INSERT ON log_info_table WHEN CAST((SELECT COUNT(*) FROM log_info_table) as INTEGER) >"
    " CAST ((SELECT value FROM config_table WHERE key = 'log_rotate_count') as INTEGER)"
    " BEGIN       DELETE FROM log_info_table WHERE id IN        (SELECT id FROM log_info_table"
    " ORDER BY id DESC LIMIT -1 OFFSET CAST((SELECT value FROM config_table WHERE key ="
    " 'log_rotate_count') as INTEGER)); END;"
    "COMMIT;";

// The key word goes into a SQL string literal: its single quotes are
// doubled, after the LIKE escaping, so that no text of a request becomes
// SQL and a name such as O'Brien is found as it is written.
std::string QuotedInLiteral(const std::string& s) {
  std::string out;
  out.reserve(s.size());
  for (char c : s) {
    out += c;
    if (c == '\'') out += '\'';
  }
  return out;
}

}  // namespace

void LogDB::LogInfo::Clear() {
  task_id = 0;
  log_type = 0;
  timestamp = 0;
  description_id = 0;
  description_param.clear();
  error = 0;
}

void LogDB::LogInfoFilter::Clear() {
  task_id = 0;
  limit = 0;
  offset = 0;
  from_timestamp = 0;
  to_timestamp = 0;
  key_word.clear();
  log_type = 7;
  log_desc_id_list.clear();
}

std::string LogDB::LogInfoFilter::ToSQLQueryString() const {
  std::ostringstream sql;
  sql << " WHERE 1";
  if (task_id != 0) sql << " AND task_id = " << task_id;
  if (from_timestamp != 0) sql << " AND timestamp >= " << from_timestamp;
  if (to_timestamp != 0) sql << " AND timestamp <= " << to_timestamp;
  if (!key_word.empty()) {
    sql << " AND description_param LIKE '%" << QuotedInLiteral(GetEscapedLIKEString(key_word))
        << "%' ESCAPE '\\' ";
  }
  if (log_type == 1 || log_type == 2 || log_type == 4) sql << " AND log_type = " << log_type;
  if (log_desc_id_list.empty()) {
    sql << " AND 0 ";
  } else if (log_desc_id_list.size() != kAllDescriptionIds) {
    sql << " AND ( description_id = " << log_desc_id_list.front();
    for (size_t i = 1; i < log_desc_id_list.size(); ++i) {
      sql << " OR description_id = " << log_desc_id_list[i];
    }
    sql << " )";
  }
  sql << " ORDER BY id DESC";
  if (limit != 0) sql << " LIMIT " << limit;
  if (offset != 0) {
    // SQLite takes an OFFSET only after a LIMIT; -1 is its "no limit".
    if (limit == 0) sql << " LIMIT -1";
    sql << " OFFSET " << offset;
  }
  return sql.str();
}

LogDB& LogDB::GetInstance() {
  static LogDB instance;
  return instance;
}

LogDB::LogDB() {
  if (pthread_mutex_init(&mutex, nullptr) != 0) PLOVO_LIB_ERR("cannot init mutex\n");
}

LogDB::~LogDB() {
  Destroy();
  if (pthread_mutex_destroy(&mutex) != 0) PLOVO_LIB_ERR("cannot destroy mutex\n");
}

void LogDB::Lock() {
  if (pthread_mutex_lock(&mutex) != 0) {
    PLOVO_LIB_ERR("cannot lock mutex <%p>\n", static_cast<void*>(&mutex));
  }
}

void LogDB::Unlock() {
  if (pthread_mutex_unlock(&mutex) != 0) {
    PLOVO_LIB_ERR("cannot release mutex <%p>\n", static_cast<void*>(&mutex));
  }
}

int LogDB::Initialize(const std::string& path) {
  if (handle != nullptr) {
    // The task database's wording: log readers search for it.
    PLOVO_LIB_INFO("Task DB has been inited\n");
    return 0;
  }
  sqlite3* db = nullptr;
  // Opened as root: a symbolic link planted in the database's place must
  // not make root create or rewrite a file elsewhere.
  int rc = sqlite3_open_v2(path.c_str(), &db,
                           SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW, nullptr);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to create log db at '%s'. [%d] %s\n", path.c_str(), rc,
                  sqlite3_errmsg(db));
    sqlite3_close_v2(db);  // a handle is returned even when the open fails
    return -1;
  }
  sqlite3_busy_timeout(db, kBusyTimeoutMs);
  rc = sqlite3_exec(db, kSchema, nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to create log db table at '%s'. [%d] %s\n", path.c_str(), rc,
                  sqlite3_errmsg(db));
    sqlite3_close_v2(db);
    return -1;
  }
  handle = db;
  PLOVO_LIB_DBG("Log db is initialized successfully at location '%s'\n", path.c_str());
  return 0;
}

void LogDB::Destroy() {
  ScopedDBLock<LogDB> lock(*this);
  const int rc = sqlite3_close_v2(handle);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Log db cannot be closed. [%d] at <%p>\n", rc, static_cast<void*>(handle));
  }
  handle = nullptr;
}

int LogDB::Write(const SqliteText& sql, const char* format) {
  if (!sql) {
    PLOVO_LIB_ERR("sqlite3_mprintf: return NULL\n%s\n", format);
    return -1;
  }
  char* error = nullptr;
  const int rc = sqlite3_exec(handle, sql.get(), nullptr, nullptr, &error);
  SqliteText errorText(error);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_exec: [%d] %s\n", rc, errorText ? errorText.get() : "");
    return -1;
  }
  return 0;
}

int LogDB::AddLogInfo(const LogInfo& info) {
  static const char* const kFormat =
      " INSERT INTO log_info_table ( task_id, log_type, timestamp, description_id, "
      "description_param, error ) VALUES  ( %lu, %d, %u, %u, %Q,  %d  );";
  ScopedDBLock<LogDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, info.task_id, info.log_type, info.timestamp,
                                          info.description_id, info.description_param.c_str(),
                                          info.error)),
               kFormat);
}

int LogDB::GetCount(const std::string& sql, unsigned long& count) {
  PLOVO_LIB_DBG("sql = '%s\n'", sql.c_str());
  ScopedDBLock<LogDB> lock(*this);
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, sql.c_str(), -1, &raw, nullptr);
  SqliteStatement statement(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_prepare_v2: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  rc = sqlite3_step(statement.get());
  if (rc == SQLITE_ROW) {
    count = sqlite3_column_uint64(statement.get(), 0);
  } else if (rc == SQLITE_DONE) {
    count = 0;
  } else {
    // Deliberately not a failure: the screen shows what it has.
    PLOVO_LIB_ERR("sqlite3_step: [%d] %s\n", rc, sqlite3_errmsg(handle));
  }
  return 0;
}

int LogDB::GetLogListCount(const LogInfoFilter& filter, unsigned long& count) {
  return GetCount("SELECT COUNT(*) FROM log_info_table" + filter.ToSQLQueryString() + " ;", count);
}

int LogDB::GetRotationCount(unsigned long& count) {
  return GetCount("SELECT value FROM config_table WHERE key = 'log_rotate_count'; ", count);
}

int LogDB::ListLogInfo(const LogInfoFilter& filter, std::list<LogInfo>& list) {
  const std::string sql =
      "SELECT task_id, log_type, timestamp, description_id, description_param, error FROM "
      "log_info_table " +
      filter.ToSQLQueryString() + " ;";
  PLOVO_LIB_DBG("sql = '%s\n'", sql.c_str());
  ScopedDBLock<LogDB> lock(*this);
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, sql.c_str(), -1, &raw, nullptr);
  SqliteStatement statement(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_prepare_v2: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
    list.emplace_back();
    GetLogInfoFromDBRecord(statement.get(), list.back());
  }
  if (rc != SQLITE_DONE) {
    PLOVO_LIB_ERR("sqlite3_step: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  return 0;
}

int LogDB::UpdateRotationCount(unsigned long count) {
  static const char* const kFormat =
      " UPDATE config_table SET  value = %lu  WHERE key = 'log_rotate_count' ;";
  if (count < kMinRotationCount || count > kMaxRotationCount) {
    PLOVO_LIB_ERR("Invalid rotation count '%lu'\n", count);
    return -1;
  }
  ScopedDBLock<LogDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, count)), kFormat);
}

void LogDB::GetLogInfoFromDBRecord(sqlite3_stmt* statement, LogInfo& info) {
  info.task_id = sqlite3_column_uint64(statement, 0);
  info.log_type = sqlite3_column_int(statement, 1);
  info.timestamp = sqlite3_column_uint32(statement, 2);
  info.description_id = sqlite3_column_uint32(statement, 3);
  info.description_param = sqlite3_column_string(statement, 4);
  info.error = sqlite3_column_int(statement, 5);
}
