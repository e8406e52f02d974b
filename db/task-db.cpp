#include "db/task-db.h"

#include <sstream>

#include "common/log.h"
#include "db/sqlite-owner.h"
#include "db/task-db-schema.h"

using Plovo::ScopedDBLock;
using Plovo::SqliteStatement;
using Plovo::SqliteText;

namespace {

// The daemon holds the write lock while it appends; waiting for it is
// always better than failing a request.
constexpr int kBusyTimeoutMs = 300000;

// Schema version 2. Every statement is safe on an existing database of this
// version. With recursive triggers on, the two delete triggers reach each
// other: the device trigger then finds no task left and the task trigger a
// device that still has tasks, or none at all, so the cascade ends.
constexpr const char* kSchema =
    "PRAGMA journal_mode = WAL;"
    "PRAGMA synchronous = NORMAL;"
    "PRAGMA recursive_triggers = true;"
    "BEGIN IMMEDIATE;"
    "CREATE TABLE IF NOT EXISTS config_table ("
    " key TEXT PRIMARY KEY,"
    " value TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS usb_info_table ("
    " id INTEGER PRIMARY KEY AUTOINCREMENT,"
    " uuid TEXT UNIQUE NOT NULL,"
    " run_when_plug_in INTEGER NOT NULL,"
    " eject_when_task_done INTEGER NOT NULL,"
    " producer TEXT NOT NULL,"
    " product TEXT NOT NULL);"
    PLOVO_TASK_INFO_TABLE
    "CREATE INDEX IF NOT EXISTS usb_info_table_uuid_idx on usb_info_table(uuid);"
    PLOVO_TASK_INFO_INDEXES
    "INSERT or IGNORE into config_table VALUES ('version', 2);"
    PLOVO_USB_INFO_DELETE_TRIGGER
    PLOVO_TASK_INFO_DELETE_TRIGGER
    "COMMIT;";

constexpr const char* kUSBSelect =
    "SELECT id, uuid, run_when_plug_in, eject_when_task_done, producer, product FROM usb_info_table ";
constexpr const char* kTaskSelect =
    "SELECT id, usb_id, is_enable, task_name, task_type, usb_folder_path, nas_folder_path, "
    "nas_share_name, last_copied_time, copy_strategy, keep_dir_structure, smart_create_date_dir, "
    "rename_photo_video, remove_src_file, conflict_policy, enable_rotation, max_version_count, "
    "rotation_policy, schedule_id, error FROM task_info_table ";

}  // namespace

std::string sqlite3_column_string(sqlite3_stmt* statement, int column) {
  const unsigned char* text = sqlite3_column_text(statement, column);
  if (text == nullptr) return "";
  return std::string(reinterpret_cast<const char*>(text),
                     static_cast<size_t>(sqlite3_column_bytes(statement, column)));
}

bool sqlite3_column_bool(sqlite3_stmt* statement, int column) {
  return sqlite3_column_int(statement, column) != 0;
}

uint32_t sqlite3_column_uint32(sqlite3_stmt* statement, int column) {
  return static_cast<uint32_t>(sqlite3_column_int64(statement, column));
}

uint64_t sqlite3_column_uint64(sqlite3_stmt* statement, int column) {
  return static_cast<uint64_t>(sqlite3_column_int64(statement, column));
}

std::string GetEscapedString(const std::string& s) {
  SqliteText quoted(sqlite3_mprintf("%Q", s.c_str()));
  return quoted ? std::string(quoted.get()) : std::string();
}

std::string GetEscapedLIKEString(const std::string& s) {
  std::string out;
  out.reserve(s.size());
  for (char c : s) {
    if (c == '%' || c == '_') out += '\\';
    out += c;
  }
  return out;
}

std::string GetEscapedGLOBString(const std::string& s) {
  std::string out;
  out.reserve(s.size());
  for (char c : s) {
    if (c == '?' || c == '*' || c == '[') {
      out += '[';
      out += c;
      out += ']';
    } else {
      out += c;
    }
  }
  return out;
}

void TaskDB::USBInfo::Clear() {
  id = 0;
  uuid.clear();
  run_when_plug_in = false;
  eject_when_task_done = true;
  producer.clear();
  product.clear();
}

void TaskDB::TaskInfo::Clear() {
  id = 0;
  usb_id = 0;
  schedule_id = -1;
  is_enable = false;
  task_name.clear();
  task_type = 0;
  usb_folder_path.clear();
  nas_folder_path.clear();
  nas_share_name.clear();
  last_copied_time = 0;
  copy_strategy = 0;
  keep_dir_structure = true;
  smart_create_date_dir = false;
  rename_photo_video = false;
  remove_src_file = false;
  conflict_policy = 0;
  enable_rotation = false;
  max_version_count = 0;
  rotation_policy = 0;
  error = 0;
}

TaskDB& TaskDB::GetInstance() {
  static TaskDB instance;
  return instance;
}

TaskDB::TaskDB() {
  if (pthread_mutex_init(&mutex, nullptr) != 0) PLOVO_LIB_ERR("cannot init mutex\n");
}

TaskDB::~TaskDB() {
  Destroy();
  if (pthread_mutex_destroy(&mutex) != 0) PLOVO_LIB_ERR("cannot destroy mutex\n");
}

void TaskDB::Lock() {
  if (pthread_mutex_lock(&mutex) != 0) {
    PLOVO_LIB_ERR("cannot lock mutex <%p>\n", static_cast<void*>(&mutex));
  }
}

void TaskDB::Unlock() {
  if (pthread_mutex_unlock(&mutex) != 0) {
    PLOVO_LIB_ERR("cannot release mutex <%p>\n", static_cast<void*>(&mutex));
  }
}

int TaskDB::Initialize(const std::string& path) {
  if (handle != nullptr) {
    PLOVO_LIB_INFO("Task DB has been inited\n");
    return 0;
  }
  sqlite3* db = nullptr;
  // Opened as root: a symbolic link planted in the database's place must
  // not make root create or rewrite a file elsewhere.
  int rc = sqlite3_open_v2(path.c_str(), &db,
                           SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW, nullptr);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to create task db at '%s'. [%d] %s\n", path.c_str(), rc,
                  sqlite3_errmsg(db));
    sqlite3_close_v2(db);  // a handle is returned even when the open fails
    return -1;
  }
  sqlite3_busy_timeout(db, kBusyTimeoutMs);
  rc = sqlite3_exec(db, kSchema, nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Failed to create task db table at '%s'. [%d] %s\n", path.c_str(), rc,
                  sqlite3_errmsg(db));
    sqlite3_close_v2(db);
    return -1;
  }
  handle = db;
  PLOVO_LIB_DBG("Task db is initialized successfully at location '%s'\n", path.c_str());
  return 0;
}

void TaskDB::Destroy() {
  ScopedDBLock<TaskDB> lock(*this);
  const int rc = sqlite3_close_v2(handle);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("Task db cannot be closed. [%d] at <%p>\n", rc, static_cast<void*>(handle));
  }
  handle = nullptr;
}

bool TaskDB::Formatted(const SqliteText& sql, const char* format) {
  if (sql) return true;
  PLOVO_LIB_ERR("sqlite3_mprintf: return NULL\n%s\n", format);
  return false;
}

int TaskDB::Exec(const char* sql) {
  char* error = nullptr;
  const int rc = sqlite3_exec(handle, sql, nullptr, nullptr, &error);
  SqliteText errorText(error);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_exec: [%d] %s\n", rc, errorText ? errorText.get() : "");
    return -1;
  }
  return 0;
}

int TaskDB::Write(const SqliteText& sql, const char* format) {
  return Formatted(sql, format) ? Exec(sql.get()) : -1;
}

template <typename Record>
int TaskDB::GetOne(const SqliteText& sql, const char* format, Record& record,
                   void (*read)(sqlite3_stmt*, Record&)) {
  if (!Formatted(sql, format)) return -1;
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, sql.get(), -1, &raw, nullptr);
  SqliteStatement statement(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_prepare_v2: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  rc = sqlite3_step(statement.get());
  if (rc == SQLITE_ROW) {
    read(statement.get(), record);
    return 1;
  }
  if (rc == SQLITE_DONE) return 0;
  PLOVO_LIB_ERR("sqlite3_step: [%d] %s\n", rc, sqlite3_errmsg(handle));
  return -1;
}

template <typename Record>
int TaskDB::ListAll(const std::string& sql, std::list<Record>& list,
                    void (*read)(sqlite3_stmt*, Record&)) {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, sql.c_str(), -1, &raw, nullptr);
  SqliteStatement statement(raw);
  if (rc != SQLITE_OK) {
    PLOVO_LIB_ERR("sqlite3_prepare_v2: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  list.clear();
  while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
    list.emplace_back();
    read(statement.get(), list.back());
  }
  if (rc != SQLITE_DONE) {
    PLOVO_LIB_ERR("sqlite3_step: [%d] %s\n", rc, sqlite3_errmsg(handle));
    return -1;
  }
  return 0;
}

int TaskDB::AddUSBInfo(const USBInfo& info, unsigned long& newId) {
  static const char* const kFormat =
      " INSERT INTO usb_info_table ( uuid, run_when_plug_in, eject_when_task_done, producer, product ) "
      "VALUES  ( %Q, %d, %d, %Q, %Q );";
  ScopedDBLock<TaskDB> lock(*this);
  if (Write(SqliteText(sqlite3_mprintf(kFormat, info.uuid.c_str(), info.run_when_plug_in ? 1 : 0,
                           info.eject_when_task_done ? 1 : 0, info.producer.c_str(),
                           info.product.c_str())),
           kFormat) != 0) {
    return -1;
  }
  newId = static_cast<unsigned long>(sqlite3_last_insert_rowid(handle));
  return 0;
}

int TaskDB::UpdateUSBInfo(const USBInfo& info) {
  static const char* const kFormat =
      " UPDATE usb_info_table SET uuid = %Q, run_when_plug_in = %d, eject_when_task_done = %d, "
      "producer = %Q, product = %Q WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, info.uuid.c_str(), info.run_when_plug_in ? 1 : 0,
                              info.eject_when_task_done ? 1 : 0, info.producer.c_str(),
                              info.product.c_str(), info.id)),
              kFormat);
}

int TaskDB::GetUSBInfo(unsigned long id, USBInfo& info) {
  static const char* const kFormat =
      "SELECT id, uuid, run_when_plug_in, eject_when_task_done, producer, product FROM usb_info_table "
      "WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return GetOne(SqliteText(sqlite3_mprintf(kFormat, id)), kFormat, info, GetUSBInfoFromDBRecord);
}

int TaskDB::GetUSBInfoByUUID(const std::string& uuid, USBInfo& info) {
  static const char* const kFormat =
      "SELECT id, uuid, run_when_plug_in, eject_when_task_done, producer, product FROM "
      "usb_info_table WHERE uuid = %Q ;";
  ScopedDBLock<TaskDB> lock(*this);
  return GetOne(SqliteText(sqlite3_mprintf(kFormat, uuid.c_str())), kFormat, info, GetUSBInfoFromDBRecord);
}

int TaskDB::RemoveUSBInfo(unsigned long id) {
  static const char* const kFormat = " DELETE FROM usb_info_table WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, id)), kFormat);
}

int TaskDB::ListUSBInfo(std::list<USBInfo>& list) {
  ScopedDBLock<TaskDB> lock(*this);
  return ListAll(std::string(kUSBSelect) + "; ", list, GetUSBInfoFromDBRecord);
}

int TaskDB::AddTaskInfo(const TaskInfo& info, unsigned long& newId) {
  static const char* const kFormat =
      " INSERT INTO task_info_table ( usb_id, is_enable, task_name, task_type, usb_folder_path, "
      "nas_folder_path, nas_share_name, last_copied_time, copy_strategy, keep_dir_structure, "
      "smart_create_date_dir, rename_photo_video, remove_src_file, conflict_policy, enable_rotation, "
      "max_version_count, rotation_policy, schedule_id, error ) VALUES  ( %lu, %d, %Q, %d, %Q, %Q, "
      "%Q, %u, %d, %d, %d, %d, %d, %d, %d, %lu, %d, %ld, %d );";
  ScopedDBLock<TaskDB> lock(*this);
  if (Write(SqliteText(sqlite3_mprintf(kFormat, info.usb_id, info.is_enable ? 1 : 0, info.task_name.c_str(),
                           info.task_type, info.usb_folder_path.c_str(),
                           info.nas_folder_path.c_str(), info.nas_share_name.c_str(),
                           info.last_copied_time, info.copy_strategy,
                           info.keep_dir_structure ? 1 : 0, info.smart_create_date_dir ? 1 : 0,
                           info.rename_photo_video ? 1 : 0, info.remove_src_file ? 1 : 0,
                           info.conflict_policy, info.enable_rotation ? 1 : 0,
                           info.max_version_count, info.rotation_policy, info.schedule_id,
                           info.error)),
           kFormat) != 0) {
    return -1;
  }
  newId = static_cast<unsigned long>(sqlite3_last_insert_rowid(handle));
  return 0;
}

int TaskDB::UpdateTaskInfo(const TaskInfo& info) {
  static const char* const kFormat =
      " UPDATE task_info_table SET  usb_id = %lu,  is_enable = %d, task_name = %Q, task_type = %d,  "
      "usb_folder_path = %Q,  nas_folder_path = %Q,  nas_share_name = %Q,  last_copied_time = %u,  "
      "copy_strategy = %d,  keep_dir_structure = %d,  smart_create_date_dir = %d,  "
      "rename_photo_video = %d,  remove_src_file = %d,  conflict_policy = %d,  enable_rotation = %d,  "
      "max_version_count = %lu,  rotation_policy = %d,  schedule_id = %ld,  error = %d  WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, info.usb_id, info.is_enable ? 1 : 0, info.task_name.c_str(),
                              info.task_type, info.usb_folder_path.c_str(),
                              info.nas_folder_path.c_str(), info.nas_share_name.c_str(),
                              info.last_copied_time, info.copy_strategy,
                              info.keep_dir_structure ? 1 : 0, info.smart_create_date_dir ? 1 : 0,
                              info.rename_photo_video ? 1 : 0, info.remove_src_file ? 1 : 0,
                              info.conflict_policy, info.enable_rotation ? 1 : 0,
                              info.max_version_count, info.rotation_policy, info.schedule_id,
                              info.error, info.id)),
              kFormat);
}

int TaskDB::UpdateTaskInfo(unsigned long id, int error, unsigned int lastCopiedTime) {
  std::ostringstream sql;
  sql << " UPDATE task_info_table SET ";
  // 0 means "not copied this time": the stored time stays.
  if (lastCopiedTime != 0) sql << " last_copied_time = " << lastCopiedTime << ", ";
  sql << " error = " << error << " ";
  sql << " WHERE id = " << id << " ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Exec(sql.str().c_str());
}

int TaskDB::EnableTaskInfo(unsigned long id, bool enable) {
  static const char* const kFormat = " UPDATE task_info_table SET  is_enable = %d  WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, enable ? 1 : 0, id)), kFormat);
}

int TaskDB::UpdateNASShareName(const std::string& oldName, const std::string& newName) {
  static const char* const kFormat =
      " UPDATE task_info_table SET  nas_share_name = %Q  WHERE nas_share_name = %Q ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, newName.c_str(), oldName.c_str())), kFormat);
}

int TaskDB::GetTaskInfo(unsigned long id, TaskInfo& info) {
  static const std::string kFormat = std::string(kTaskSelect) + " WHERE id = %lu";
  ScopedDBLock<TaskDB> lock(*this);
  return GetOne(SqliteText(sqlite3_mprintf(kFormat.c_str(), id)), kFormat.c_str(), info,
                GetTaskInfoFromDBRecord);
}

int TaskDB::RemoveTaskInfo(unsigned long id) {
  static const char* const kFormat = " DELETE FROM task_info_table WHERE id = %lu ;";
  ScopedDBLock<TaskDB> lock(*this);
  return Write(SqliteText(sqlite3_mprintf(kFormat, id)), kFormat);
}

int TaskDB::ListTaskInfo(std::list<TaskInfo>& list) {
  std::ostringstream sql;
  sql << kTaskSelect << " ;";
  ScopedDBLock<TaskDB> lock(*this);
  return ListAll(sql.str(), list, GetTaskInfoFromDBRecord);
}

int TaskDB::ListTaskInfo(unsigned long usbId, std::list<TaskInfo>& list) {
  std::ostringstream sql;
  sql << kTaskSelect << " WHERE usb_id = " << usbId << " ;";
  ScopedDBLock<TaskDB> lock(*this);
  return ListAll(sql.str(), list, GetTaskInfoFromDBRecord);
}

int TaskDB::ListTaskInfo(const std::string& shareName, std::list<TaskInfo>& list) {
  std::ostringstream sql;
  sql << kTaskSelect << " WHERE nas_share_name = " << GetEscapedString(shareName) << " ;";
  ScopedDBLock<TaskDB> lock(*this);
  return ListAll(sql.str(), list, GetTaskInfoFromDBRecord);
}

void TaskDB::GetUSBInfoFromDBRecord(sqlite3_stmt* statement, USBInfo& info) {
  info.id = sqlite3_column_uint64(statement, 0);
  info.uuid = sqlite3_column_string(statement, 1);
  info.run_when_plug_in = sqlite3_column_bool(statement, 2);
  info.eject_when_task_done = sqlite3_column_bool(statement, 3);
  info.producer = sqlite3_column_string(statement, 4);
  info.product = sqlite3_column_string(statement, 5);
}

void TaskDB::GetTaskInfoFromDBRecord(sqlite3_stmt* statement, TaskInfo& info) {
  info.id = sqlite3_column_uint64(statement, 0);
  info.usb_id = sqlite3_column_uint64(statement, 1);
  info.is_enable = sqlite3_column_bool(statement, 2);
  info.task_name = sqlite3_column_string(statement, 3);
  info.task_type = sqlite3_column_int(statement, 4);
  info.usb_folder_path = sqlite3_column_string(statement, 5);
  info.nas_folder_path = sqlite3_column_string(statement, 6);
  info.nas_share_name = sqlite3_column_string(statement, 7);
  info.last_copied_time = sqlite3_column_uint32(statement, 8);
  info.copy_strategy = sqlite3_column_int(statement, 9);
  info.keep_dir_structure = sqlite3_column_bool(statement, 10);
  info.smart_create_date_dir = sqlite3_column_bool(statement, 11);
  info.rename_photo_video = sqlite3_column_bool(statement, 12);
  info.remove_src_file = sqlite3_column_bool(statement, 13);
  info.conflict_policy = sqlite3_column_int(statement, 14);
  info.enable_rotation = sqlite3_column_bool(statement, 15);
  info.max_version_count = sqlite3_column_uint64(statement, 16);
  info.rotation_policy = sqlite3_column_int(statement, 17);
  info.schedule_id = static_cast<long>(sqlite3_column_int64(statement, 18));
  info.error = sqlite3_column_int(statement, 19);
}
