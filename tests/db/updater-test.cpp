// The installer and the version 1 migration: what a new install creates,
// what a version 1 database becomes, and that a migration failing at any
// step leaves every live database as it was.
#include <json/json.h>
#include <sqlite3.h>
#include <syslog.h>
#include <velt/dev.h>

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <sstream>
#include <tuple>

#include "filter/file-filter.h"
#include "log-capture.h"
#include "sandbox.h"
#include "updater/updater-core.h"
#include "updater/updater-utils.h"
#include "updater/updater-v1.h"

namespace {

namespace fs = std::filesystem;
using plovo_test::LogCapture;

const std::string kRepo = "/repo";
const std::string kTaskDB = kRepo + "/db/task-db.sqlite";
std::string FileDB(int id) { return kRepo + "/task/" + std::to_string(id) + "/file-db.sqlite"; }

// A connection of the test's own. keepWal: closing leaves the "-wal" file
// with its frames, as a crash of the daemon would.
struct Raw {
  explicit Raw(const std::string& path, bool keepWal = false) {
    sqlite3_open(path.c_str(), &db);
    if (keepWal) sqlite3_db_config(db, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  }
  ~Raw() { sqlite3_close_v2(db); }
  int Run(const std::string& sql) const { return sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr); }
  // Every row, columns joined by ' ' ("NULL" for null), rows by '\n'.
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

// Every table (its columns), index (its columns) and trigger (its table).
const char* const kObjects =
    "SELECT name || ' ON ' || tbl_name || ifnull(' (' || (SELECT group_concat(name || ' ' || type || "
    "iif(\"notnull\", ' nn', '') || ifnull(' =' || dflt_value, '') || iif(pk, ' pk', ''), ', ') "
    "FROM pragma_table_info(m.name)) || ')', '') || ifnull(' [' || (SELECT group_concat(name) "
    "FROM pragma_index_info(m.name)) || ']', '') FROM sqlite_master m ORDER BY name";
const char* const kDefaultTasks =
    "SELECT u.uuid, u.run_when_plug_in, u.eject_when_task_done, u.producer, u.product, t.task_name, t.is_enable, "
    "t.task_type, t.usb_folder_path, t.nas_folder_path, t.nas_share_name, t.last_copied_time, t.copy_strategy, "
    "t.keep_dir_structure, t.smart_create_date_dir, t.rename_photo_video, t.remove_src_file, t.conflict_policy, "
    "t.enable_rotation, t.max_version_count, t.rotation_policy, t.schedule_id, t.error "
    "FROM task_info_table t JOIN usb_info_table u ON u.id = t.usb_id ORDER BY t.id";

std::string DefaultTask(const std::string& uuid, const std::string& name, const std::string& share = "") {
  return uuid + " 0 1 PLOVO_DEFAULT_PRODUCER PLOVO_DEFAULT_PRODUCT " + name +
         (share.empty() ? " 0 1 /  " : " 1 1 / / ") + share + " 0 1 1 0 0 0 1 0 256 1 -1 0";
}

// Version 1: the task table has rename_photo_file and lacks the five later
// columns. Two default devices and an ordinary one; tasks 1 and 7 are
// incremental. Every column's values differ from its neighbours' somewhere.
const char* const kV1 =
    "PRAGMA journal_mode = WAL; CREATE TABLE config_table (key TEXT PRIMARY KEY, value TEXT NOT NULL);"
    "CREATE TABLE usb_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, uuid TEXT UNIQUE NOT NULL, run_when_plug_in"
    " INTEGER NOT NULL, eject_when_task_done INTEGER NOT NULL, producer TEXT NOT NULL, product TEXT NOT NULL);"
    "CREATE TABLE task_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, usb_id INTEGER NOT NULL, is_enable INTEGER"
    " NOT NULL, task_name TEXT NOT NULL, task_type INTEGER NOT NULL, usb_folder_path TEXT NOT NULL, nas_folder_path"
    " TEXT NOT NULL, nas_share_name TEXT NOT NULL, last_copied_time INTEGER NOT NULL, copy_strategy INTEGER NOT NULL,"
    " keep_dir_structure INTEGER NOT NULL, smart_create_date_dir INTEGER NOT NULL, rename_photo_file INTEGER NOT NULL,"
    " conflict_policy INTEGER NOT NULL, error INTEGER NOT NULL);"
    "CREATE INDEX usb_info_table_uuid_idx on usb_info_table(uuid);"
    "CREATE INDEX task_info_table_usb_id_idx on task_info_table(usb_id);"
    "CREATE INDEX task_info_table_nas_share_name_idx on task_info_table(nas_share_name);"
    "CREATE TRIGGER usb_info_delete_trigger AFTER DELETE ON usb_info_table"
    " BEGIN DELETE FROM task_info_table WHERE usb_id = OLD.id; END;"
    "CREATE TRIGGER task_info_delete_trigger AFTER DELETE ON task_info_table BEGIN DELETE FROM usb_info_table"
    " WHERE id = OLD.usb_id AND (0 = (SELECT COUNT(*) FROM task_info_table WHERE usb_id = OLD.usb_id)); END;"
    "INSERT INTO config_table VALUES ('version', 1); INSERT INTO usb_info_table VALUES (1, 'PLOVO_DEFAULT_USB_UUID',"
    " 0, 1, 'P', 'Q'), (2, 'PLOVO_DEFAULT_SD_UUID', 0, 1, 'P', 'Q'), (5, 'cam-1234', 1, 0, 'Acme', 'Cam');"
    "INSERT INTO task_info_table VALUES (1, 1, 1, 'Default Plovo', 1, '/', '/', 'photo', 1700000001, 3, 1, 0, 1, 2, 0),"
    " (2, 2, 0, 'Default Tarnel', 1, '/', '', '', 0, 1, 1, 0, 0, 1, 0),"
    " (7, 5, 1, 'Cam ''daily''', 3, '/DCIM', '/in', 'media', 1700000002, 3, 0, 1, 0, 2, 4),"
    " (9, 5, 0, 'Export', 2, '/out', '/docs', 'home', 1700000003, 2, 1, 1, 0, 1, 0);";
const char* const kFileDB =
    "PRAGMA journal_mode = WAL; CREATE TABLE config_table (key TEXT PRIMARY KEY, value TEXT NOT NULL);"
    "INSERT INTO config_table VALUES ('version', 1); CREATE TABLE file_info_table (id INTEGER PRIMARY KEY"
    " AUTOINCREMENT, source_path TEXT NOT NULL, destination_path TEXT NOT NULL, size INTEGER NOT NULL);"
    "CREATE INDEX file_info_table_src_path_idx on file_info_table(source_path);"
    "CREATE INDEX file_info_table_dst_path_idx on file_info_table(destination_path);"
    "INSERT INTO file_info_table VALUES (NULL, '/DCIM/a.jpg', '/in/a.jpg', 10), (NULL, '/b', '/in/b', 20);";

// The version 1 columns, the photo renaming one named as given.
std::string V1Select(const std::string& rename) {
  return "SELECT id, usb_id, is_enable, task_name, task_type, usb_folder_path, nas_folder_path, nas_share_name, "
         "last_copied_time, copy_strategy, keep_dir_structure, smart_create_date_dir, " + rename +
         ", conflict_policy, error FROM task_info_table ORDER BY id";
}

class UpdaterTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    // The service makes the repository's folders before it calls Update.
    MakeDir(kRepo + "/db");
    MakeDir(kRepo + "/task");
    WriteFile("/etc/veltinfo.conf", "a=\"1\"\n");
    Support(true, true);
  }
  void TearDown() override {
    FailReplaceDBStepForTest("");
    SandboxTest::TearDown();
  }
  void Support(bool plovo, bool tarnel) const {
    WriteFile("/etc.defaults/veltinfo.conf", std::string("plovo=\"") + (plovo ? "yes" : "no") + "\"\ntarnel=\"" +
                                                 (tarnel ? "yes" : "no") + "\"\n");
  }
  int Update() const { return UpdaterCore().Update(Path(kRepo)); }
  std::string Rows(const std::string& db, const std::string& sql) const { return Raw(Path(db)).Rows(sql); }
  // The three files of every task, byte for byte.
  void ExpectTaskFiles() const {
    ASSERT_EQ(WriteBlackList(Path("/black"), {".VeltraPlovo.config"}, {}), 0);
    ASSERT_EQ(WriteWhiteList(Path("/white"), {"*"}, {"*"}), 0);
    std::istringstream ids(Rows(kTaskDB, "SELECT id FROM task_info_table"));
    for (std::string id; std::getline(ids, id);) {
      std::string dir = kRepo + "/task/" + id + "/";
      EXPECT_EQ(ReadFile(dir + "user.config"), "{\"user_defined_extensions\":[],\"user_defined_names\":[]}\n");
      EXPECT_EQ(ReadFile(dir + "blacklist.filter"), ReadFile("/black")) << id;
      EXPECT_EQ(ReadFile(dir + "whitelist.filter"), ReadFile("/white")) << id;
    }
  }
  void BuildV1() const {
    ASSERT_EQ(Raw(Path(kTaskDB)).Run(kV1), SQLITE_OK);
    for (int id : {1, 7}) {
      MakeDir(kRepo + "/task/" + std::to_string(id));
      ASSERT_EQ(Raw(Path(FileDB(id))).Run(kFileDB), SQLITE_OK);
    }
  }
  // The main files of the task database and both file databases.
  std::map<std::string, std::string> Snapshot() const {
    return {{kTaskDB, ReadFile(kTaskDB)}, {FileDB(1), ReadFile(FileDB(1))}, {FileDB(7), ReadFile(FileDB(7))}};
  }
  // No working copy; after a replacement no "-wal" or "-shm" either.
  void ExpectNoLeftovers(bool replaced) const {
    for (const auto& db : {kTaskDB, FileDB(1), FileDB(7)}) {
      EXPECT_FALSE(fs::is_regular_file(Path(db + ".bkp_v1"))) << db;
      for (const char* suffix : {".bkp_v1-wal", ".bkp_v1-shm", ".bkp_v1-journal", ".old_v1"}) {
        EXPECT_FALSE(Exists(db + suffix)) << db << suffix;
      }
      EXPECT_FALSE(replaced && (Exists(db + "-wal") || Exists(db + "-shm"))) << db;
    }
  }
  Json::Value Entry(const std::string& id) const {
    std::string text = ReadFile("/velt-dev/scheduler/" + id + ".json");
    Json::Value value;
    std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
    EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) << id;
    return value;
  }
  size_t EntryCount() const {
    size_t n = 0;
    if (!Exists("/velt-dev/scheduler")) return n;
    for (const auto& e : fs::directory_iterator(Path("/velt-dev/scheduler"))) n += e.path().extension() == ".json";
    return n;
  }
};

// The support keys "plovo" and "tarnel".
class NewInstallTest : public UpdaterTest, public ::testing::WithParamInterface<std::tuple<bool, bool>> {};

TEST_P(NewInstallTest, CreatesTheDefaultTaskOfEachSupportedDevice) {
  const auto [plovo, tarnel] = GetParam();
  Support(plovo, tarnel);
  // A model without either device may have no defaults file at all.
  if (!plovo && !tarnel) fs::remove(Path("/etc.defaults/veltinfo.conf"));
  LogCapture log;
  ASSERT_EQ(Update(), 0) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_WARNING, "UpdaterCore: new install"));
  std::string usb = DefaultTask("PLOVO_DEFAULT_USB_UUID", "Default Plovo");
  std::string sd = DefaultTask("PLOVO_DEFAULT_SD_UUID", "Default Tarnel");
  if (!plovo && !tarnel) {
    EXPECT_FALSE(Exists(kTaskDB));
    return;
  }
  EXPECT_EQ(Rows(kTaskDB, kDefaultTasks), !tarnel ? usb : !plovo ? sd : usb + "\n" + sd);
  EXPECT_EQ(Rows(kTaskDB, "SELECT count(*) FROM usb_info_table"), plovo && tarnel ? "2" : "1");
  ExpectTaskFiles();
}
INSTANTIATE_TEST_SUITE_P(Models, NewInstallTest, ::testing::Combine(::testing::Bool(), ::testing::Bool()));

TEST_F(UpdaterTest, OldCopyFoldersBecomeTheSharesAndTheirKeysGo) {
  WriteFile("/etc/veltinfo.conf", "a=\"1\"\nplovofolder=\"photo\"\ntarnelfolder=\"\"\nz=\"2\"\n");
  std::string defaults = ReadFile("/etc.defaults/veltinfo.conf");
  ASSERT_EQ(Update(), 0);
  EXPECT_EQ(Rows(kTaskDB, kDefaultTasks), DefaultTask("PLOVO_DEFAULT_USB_UUID", "Default Plovo", "photo") + "\n" +
                                              DefaultTask("PLOVO_DEFAULT_SD_UUID", "Default Tarnel"));
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), "a=\"1\"\nz=\"2\"\n");
  EXPECT_EQ(ReadFile("/etc.defaults/veltinfo.conf"), defaults);
  ExpectTaskFiles();
}

TEST_F(UpdaterTest, AnExistingDatabaseIsOnlyReadForItsVersion) {
  ASSERT_EQ(Update(), 0);
  std::string bytes = ReadFile(kTaskDB), rows = Rows(kTaskDB, kDefaultTasks);
  // A folder key that turns up later is not read: the tasks exist.
  WriteFile("/etc/veltinfo.conf", "plovofolder=\"late\"\n");
  LogCapture log;
  EXPECT_EQ(Update(), 0) << log.Dump();
  EXPECT_FALSE(log.Contains("new install"));
  EXPECT_EQ(ReadFile(kTaskDB), bytes);
  EXPECT_EQ(UpdaterV1(Path(kRepo)).Run(), 0);
  EXPECT_TRUE(log.Contains(LOG_INFO, "[INFO] updater-v1(")) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_INFO, "UpdaterV1: task_db_version (2) "));
  EXPECT_EQ(ReadFile(kTaskDB), bytes);
  EXPECT_EQ(UpdaterCore().PrepareDefaultTasks(Path(kRepo)), 0);
  EXPECT_TRUE(log.Contains(LOG_DEBUG, "default task 'PLOVO_DEFAULT_USB_UUID' already exist"));
  EXPECT_TRUE(log.Contains(LOG_DEBUG, "default task 'PLOVO_DEFAULT_SD_UUID' already exist"));
  EXPECT_EQ(Rows(kTaskDB, kDefaultTasks), rows);
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), "plovofolder=\"late\"\n");
  ASSERT_EQ(Raw(Path(kTaskDB)).Run("DELETE FROM config_table"), SQLITE_OK);
  EXPECT_EQ(Update(), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "UpdaterCore: Failed to get task db version '" + Path(kTaskDB) + "'"));
}

TEST_F(UpdaterTest, AFailedUSBTaskStopsBeforeTheSDOne) {
  WriteFile("/etc/veltinfo.conf", "plovofolder=\"photo\"\n");
  VeltDevFailCall("VLIBCFileGetKeyValue", 1, 1, VLIBC_ERR_IO);
  LogCapture log;
  EXPECT_EQ(Update(), -1);
  for (const std::string& line : {std::string("[ERR] updater-core("),
                                  std::string("Failed to get old copy folder for key 'plovofolder'"),
                                  std::string("Failed to prepare Plovo default task"),
                                  "Failed to prepare default task at '" + Path(kRepo) + "'"}) {
    EXPECT_TRUE(log.Contains(LOG_ERR, line)) << line << "\n" << log.Dump();
  }
  // Nothing made: the next start is a new install again.
  EXPECT_FALSE(Exists(kTaskDB));
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), "plovofolder=\"photo\"\n");
}

// The daemon stopped with rows only in the task database's "-wal" file.
TEST_F(UpdaterTest, MigratesAVersion1RepositoryWithRowsInTheWal) {
  BuildV1();
  std::string before, files = Rows(FileDB(7), "SELECT * FROM file_info_table");
  {
    Raw db(Path(kTaskDB), true);
    ASSERT_EQ(db.Run("INSERT INTO task_info_table VALUES (11, 5, 1, 'Late', 1, '/', '/', 'l', 0, 1, 1, 0, 0, 1, 0);"
                     "UPDATE task_info_table SET task_name = 'Export 2' WHERE id = 9;"), SQLITE_OK);
    before = db.Rows(V1Select("rename_photo_file"));
  }
  ASSERT_GT(fs::file_size(Path(kTaskDB + "-wal")), 0u);
  LogCapture log;
  ASSERT_EQ(Update(), 0) << log.Dump();
  ExpectNoLeftovers(true);
  TaskDB v2;
  ASSERT_EQ(v2.Initialize(Path("/v2.sqlite")), 0);
  v2.Destroy();
  EXPECT_EQ(Rows(kTaskDB, kObjects), Rows("/v2.sqlite", kObjects));
  EXPECT_EQ(Rows(kTaskDB, "SELECT value FROM config_table WHERE key = 'version'"), "2");
  EXPECT_EQ(Rows(kTaskDB, V1Select("rename_photo_video")), before);
  EXPECT_EQ(Rows(kTaskDB, "SELECT DISTINCT remove_src_file, enable_rotation, max_version_count, rotation_policy "
                          "FROM task_info_table"), "0 0 256 1");
  // Only the ordinary device's tasks have a (disabled) scheduler entry.
  EXPECT_EQ(Rows(kTaskDB, "SELECT schedule_id FROM task_info_table WHERE id < 7"), "-1\n-1");
  EXPECT_EQ(EntryCount(), 3u);
  for (std::string id : {"7", "9", "11"}) {
    Json::Value entry = Entry(Rows(kTaskDB, "SELECT schedule_id FROM task_info_table WHERE id = " + id));
    EXPECT_EQ(entry["name"].asString(), Rows(kTaskDB, "SELECT task_name FROM task_info_table WHERE id = " + id));
    EXPECT_FALSE(entry["enabled"].asBool());
    std::string command = entry["command"].asString(), tail = " --execute-task " + id;
    EXPECT_TRUE(command.size() > tail.size() && command.substr(command.size() - tail.size()) == tail) << command;
    const Json::Value& when = entry["schedule"];
    EXPECT_EQ(when["week_name"].asString() + "\n" + when["hour"].toStyledString() + when["min"].toStyledString() +
                  when["repeat"].toStyledString(), "0,1,2,3,4,5,6\n0\n0\n0\n") << entry.toStyledString();
  }
  for (int id : {1, 7}) {
    EXPECT_EQ(Rows(FileDB(id), "SELECT group_concat(name) FROM (SELECT name FROM sqlite_master WHERE type = 'index' "
                               "AND sql IS NOT NULL ORDER BY name)"), "file_info_dst_path_idx,file_info_src_path_idx");
  }
  EXPECT_EQ(Rows(FileDB(7), "SELECT * FROM file_info_table"), files);
  // The delete triggers still reach across the two tables.
  Raw db(Path(kTaskDB));
  EXPECT_EQ(db.Run("PRAGMA recursive_triggers = true; DELETE FROM usb_info_table WHERE id = 5;"
                   "DELETE FROM task_info_table WHERE id = 2;"), SQLITE_OK) << sqlite3_errmsg(db.db);
  EXPECT_EQ(db.Rows("SELECT group_concat(id) FROM task_info_table UNION ALL "
                    "SELECT group_concat(id) FROM usb_info_table"), "1\n1");
}

TEST_F(UpdaterTest, AFailedMigrationLeavesEveryDatabaseAsItWas) {
  const std::string task = Path(kTaskDB), file = Path(FileDB(1)) + ".bkp_v1' -> '" + Path(FileDB(1));
  // The fault and the line that shows the migration stopped where meant.
  // File databases 1 and 7 are replaced before the task database.
  const std::vector<std::tuple<std::string, std::function<void()>, std::string>> faults = {
      {"missing file db", [&] { fs::remove(Path(FileDB(7))); }, "file db '" + Path(FileDB(7)) + "' does not exist"},
      {"file db copy", [&] { MakeDir(FileDB(7) + ".bkp_v1/x"); }, "Failed to backup file db '" + Path(FileDB(7))},
      {"task db copy", [&] { MakeDir(kTaskDB + ".bkp_v1/x"); }, "Failed to backup task db '" + task},
      {"script", [&] { Raw(Path(kTaskDB)).Run("CREATE TABLE task_info_table_old (x);"); },
       "Failed to update task db '" + task + ".bkp_v1'"},
      {"schedule", [] { VeltDevFailCall("VELTSchedTaskSave", 2, 1, VLIBC_ERR_IO); },
       "Failed to CreateSchedule for task '9', 'Export'"},
      {"checkpoint", [] { FailReplaceDBStepForTest("checkpoint"); }, "Failed to move DB back '" + file},
      {"sync", [] { FailReplaceDBStepForTest("sync"); }, "Failed to move DB back '" + file},
      {"rename", [] { FailReplaceDBStepForTest("rename"); }, "Failed to move DB back '" + file},
      // Both file databases are in place by then and go back.
      {"task db rename", [] { FailReplaceDBStepForTest("rename", 3); },
       "Failed to move DB back '" + task + ".bkp_v1' -> '" + task},
  };
  for (const auto& [name, fault, logged] : faults) {
    SCOPED_TRACE(name);
    fs::remove_all(Path(kRepo));
    fs::remove_all(Path("/velt-dev/scheduler"));
    MakeDir(kRepo + "/db");
    BuildV1();
    fault();
    auto before = Snapshot();
    LogCapture log;
    EXPECT_EQ(Update(), -1);
    EXPECT_TRUE(log.Contains(LOG_ERR, "UpdaterV1: " + logged)) << log.Dump();
    EXPECT_TRUE(log.Contains(LOG_ERR, "UpdaterCore: Failed to run updater v1"));
    EXPECT_TRUE(Snapshot() == before);
    EXPECT_EQ(EntryCount(), 0u);  // an attempt takes back its entries
    ExpectNoLeftovers(false);
    FailReplaceDBStepForTest("");
    VeltDevClearFaults();
  }
}

// A damaged or planted repository fails the update and writes nothing
// outside it.
TEST_F(UpdaterTest, HostileRepositoryIsRefused) {
  const std::vector<std::tuple<std::string, std::function<void()>, std::string>> cases = {
      {"linked user.config", [&] {
         MakeDir(kRepo + "/task/1");
         fs::create_symlink(Path("/outside"), Path(kRepo + "/task/1/user.config"));
       }, "Failed to write '"},
      {"linked task folder", [&] {
         fs::remove(Path(kRepo + "/task"));
         MakeDir("/outside");
         fs::create_symlink(Path("/outside"), Path(kRepo + "/task"));
       }, "Failed to create task folder '"},
      {"version with a blank", [&] { BuildV1(); Raw(Path(kTaskDB)).Run("UPDATE config_table SET value = ' 1';"); },
       "Invalid db version ' 1'"},
      {"task id below 1", [&] { BuildV1(); Raw(Path(kTaskDB)).Run("UPDATE task_info_table SET id = -5 WHERE id = 9;"); },
       "UpdaterV1: Invalid task id -5"},
  };
  for (const auto& [name, plant, logged] : cases) {
    SCOPED_TRACE(name);
    fs::remove_all(Path(kRepo));
    fs::remove_all(Path("/outside"));
    MakeDir(kRepo + "/db");
    MakeDir(kRepo + "/task");
    plant();
    LogCapture log;
    EXPECT_EQ(Update(), -1);
    EXPECT_TRUE(log.Contains(LOG_ERR, logged)) << log.Dump();
    EXPECT_FALSE(fs::exists(Path("/outside")) && !fs::is_empty(Path("/outside")));
    EXPECT_EQ(EntryCount(), 0u);
  }
}

TEST_F(UpdaterTest, UpdateDBRunsAllOrNothing) {
  ASSERT_EQ(Raw(Path("/u.sqlite")).Run("CREATE TABLE t (x);"), SQLITE_OK);
  LogCapture log;
  EXPECT_EQ(UpdateDB(Path("/u.sqlite"), "INSERT INTO t VALUES (1); INSERT INTO missing VALUES (2);"), -1);
  EXPECT_EQ(Rows("/u.sqlite", "SELECT count(*) FROM t"), "0");
  EXPECT_EQ(UpdateDB(Path("/u.sqlite"), "INSERT INTO t VALUES (1); INSERT INTO t VALUES (2);"), 0);
  EXPECT_EQ(Rows("/u.sqlite", "SELECT group_concat(x) FROM t"), "1,2");
  EXPECT_FALSE(log.Contains("Invalid Parameter"));
  EXPECT_EQ(UpdateDB("", "INSERT INTO t VALUES (3);"), -1);
  EXPECT_EQ(UpdateDB(Path("/u.sqlite"), ""), -1);
  EXPECT_EQ(UpdateDB(Path("/none.sqlite"), "CREATE TABLE t (x);"), -1);
  EXPECT_FALSE(Exists("/none.sqlite"));
  std::vector<std::string> invalid;
  for (const auto& line : log.Lines()) {
    if (line.text.find("): Invalid Parameter") != std::string::npos) invalid.push_back(line.text.substr(0, 20));
  }
  EXPECT_EQ(invalid, std::vector<std::string>(2, "[ERR] updater-utils(")) << log.Dump();
}

}  // namespace
