// The installer and the version 1 migration: what a new install creates, what
// a version 1 database becomes, and that a failed migration changes nothing.
#include <json/json.h>
#include <sqlite3.h>
#include <syslog.h>
#include <velt/dev.h>

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <tuple>

#include "filter/file-filter.h"
#include "log-capture.h"
#include "raw-db.h"
#include "sandbox.h"
#include "updater/updater-core.h"
#include "updater/updater-utils.h"

namespace {

namespace fs = std::filesystem;
using plovo_test::LogCapture;

const std::string kRepo = "/repo";
const std::string kTaskDB = kRepo + "/db/task-db.sqlite";
std::string FileDB(int id) { return kRepo + "/task/" + std::to_string(id) + "/file-db.sqlite"; }

using Raw = plovo_test::RawDB;

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

#define V1_CONFIG                                                                                \
  "PRAGMA journal_mode = WAL; CREATE TABLE config_table (key TEXT PRIMARY KEY, value TEXT NOT NULL);" \
  "INSERT INTO config_table VALUES ('version', 1);"
// Version 1: rename_photo_file, not the five later columns. Two default devices and an ordinary
// one; tasks 1 and 7 are incremental; every column's values differ from its neighbours' somewhere.
const char* const kV1 = V1_CONFIG
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
    "INSERT INTO usb_info_table VALUES (1, 'PLOVO_DEFAULT_USB_UUID', 0, 1, 'P', 'Q'),"
    " (2, 'PLOVO_DEFAULT_SD_UUID', 0, 1, 'P', 'Q'), (5, 'cam-1234', 1, 0, 'Acme', 'Cam');"
    "INSERT INTO task_info_table VALUES (1, 1, 1, 'Default Plovo', 1, '/', '/', 'photo', 1700000001, 3, 1, 0, 1, 2, 0),"
    " (2, 2, 0, 'Default Tarnel', 1, '/', '', '', 0, 1, 1, 0, 0, 1, 0),"
    " (7, 5, 1, 'Cam ''daily''', 3, '/DCIM', '/in', 'media', 1700000002, 3, 0, 1, 0, 2, 4),"
    " (9, 5, 0, 'Export', 2, '/out', '/docs', 'home', 1700000003, 2, 1, 1, 0, 1, 0);";
const char* const kFileDB = V1_CONFIG
    "CREATE TABLE file_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, source_path TEXT NOT NULL,"
    " destination_path TEXT NOT NULL, size INTEGER NOT NULL);"
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
    Reset();  // the service makes the repository's folders before it calls Update
    WriteFile("/etc/veltinfo.conf", "a=\"1\"\n");
    Support(true, true);
  }
  void TearDown() override {
    Reset();
    SandboxTest::TearDown();
  }
  // An empty repository, no scheduler entries, no "/outside" folder, no faults.
  void Reset() const {
    FailReplaceDBStepForTest("");
    VeltDevClearFaults();
    for (const char* dir : {"/repo", "/velt-dev/scheduler", "/outside"}) fs::remove_all(Path(dir));
    MakeDir(kRepo + "/db");
    MakeDir(kRepo + "/task");
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
  // No working copy or kept old file; after a replacement no "-wal" or "-shm".
  void ExpectNoLeftovers(bool replaced) const {
    for (const auto& db : {kTaskDB, FileDB(1), FileDB(7)}) {
      EXPECT_FALSE(fs::is_regular_file(Path(db + ".bkp_v1"))) << db;
      for (const char* suffix : {".bkp_v1-wal", ".bkp_v1-shm", ".bkp_v1-journal", ".old_v1"}) {
        EXPECT_FALSE(Exists(db + suffix)) << db << suffix;
      }
      EXPECT_FALSE(replaced && (Exists(db + "-wal") || Exists(db + "-shm"))) << db;
    }
  }
  // Every scheduler entry as "name on|off".
  std::multiset<std::string> Entries() const {
    std::multiset<std::string> entries;
    if (!Exists("/velt-dev/scheduler")) return entries;
    for (const auto& file : fs::directory_iterator(Path("/velt-dev/scheduler"))) {
      if (file.path().extension() != ".json") continue;
      std::string text = ReadFile("/velt-dev/scheduler/" + file.path().filename().string());
      Json::Value entry;
      std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
      EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &entry, nullptr)) << text;
      entries.insert(entry["name"].asString() + (entry["enabled"].asBool() ? " on" : " off"));
    }
    return entries;
  }
};

// The support keys "plovo" and "tarnel".
class NewInstallTest : public UpdaterTest, public ::testing::WithParamInterface<std::tuple<bool, bool>> {};

TEST_P(NewInstallTest, CreatesTheDefaultTaskOfEachSupportedDevice) {
  const auto [plovo, tarnel] = GetParam();
  Support(plovo, tarnel);
  // A model without either device may have no defaults file at all.
  if (!plovo && !tarnel) fs::remove(Path("/etc.defaults/veltinfo.conf"));
  // Nor a settings file: then there is no old copy folder to carry.
  if (plovo != tarnel) fs::remove(Path("/etc/veltinfo.conf"));
  ASSERT_EQ(Update(), 0);
  EXPECT_EQ(Exists(kTaskDB), plovo || tarnel);
  if (!plovo && !tarnel) return;
  std::string usb = DefaultTask("PLOVO_DEFAULT_USB_UUID", "Default Plovo");
  std::string sd = DefaultTask("PLOVO_DEFAULT_SD_UUID", "Default Tarnel");
  EXPECT_EQ(Rows(kTaskDB, kDefaultTasks), !tarnel ? usb : !plovo ? sd : usb + "\n" + sd);
  ExpectTaskFiles();
}
INSTANTIATE_TEST_SUITE_P(Models, NewInstallTest, ::testing::Combine(::testing::Bool(), ::testing::Bool()));

TEST_F(UpdaterTest, OldCopyFoldersBecomeTheSharesOnceAndTheirKeysGo) {
  const std::string info = "a=\"1\"\nplovofolder=\"photo\"\ntarnelfolder=\"\"\nz=\"2\"\n";
  WriteFile("/etc/veltinfo.conf", info);
  std::string defaults = ReadFile("/etc.defaults/veltinfo.conf");
  // A key that cannot be read stops before the SD task and leaves no
  // database, so that the next start is a new install again.
  VeltDevFailCall("VLIBCFileGetKeyValue", 1, 1, VLIBC_ERR_IO);
  LogCapture log;
  EXPECT_EQ(Update(), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get old copy folder for key 'plovofolder'")) << log.Dump();
  EXPECT_FALSE(Exists(kTaskDB));
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), info);
  ASSERT_EQ(Update(), 0);
  EXPECT_EQ(Rows(kTaskDB, kDefaultTasks), DefaultTask("PLOVO_DEFAULT_USB_UUID", "Default Plovo", "photo") + "\n" +
                                              DefaultTask("PLOVO_DEFAULT_SD_UUID", "Default Tarnel"));
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), "a=\"1\"\nz=\"2\"\n");
  EXPECT_EQ(ReadFile("/etc.defaults/veltinfo.conf"), defaults);
  ExpectTaskFiles();
  // The next start only reads the version; a folder key that turns up now is not read.
  std::string bytes = ReadFile(kTaskDB);
  WriteFile("/etc/veltinfo.conf", "plovofolder=\"late\"\n");
  LogCapture again;
  EXPECT_EQ(Update(), 0) << again.Dump();
  EXPECT_FALSE(again.Contains("new install"));
  EXPECT_EQ(ReadFile(kTaskDB), bytes);
  EXPECT_EQ(ReadFile("/etc/veltinfo.conf"), "plovofolder=\"late\"\n");
}

// The daemon stopped with rows only in the task database's "-wal" file.
TEST_F(UpdaterTest, MigratesAVersion1RepositoryWithRowsInTheWal) {
  BuildV1();
  std::string before, files = Rows(FileDB(7), "SELECT * FROM file_info_table");
  {
    Raw db(Path(kTaskDB), true);
    // Task 20, the last one made, was deleted.
    ASSERT_EQ(db.Run("INSERT INTO task_info_table VALUES (11, 5, 1, 'Late', 1, '/', '/', 'l', 0, 1, 1, 0, 0, 1, 0);"
                     "UPDATE task_info_table SET task_name = 'Export 2' WHERE id = 9;"
                     "UPDATE sqlite_sequence SET seq = 20 WHERE name = 'task_info_table';"), SQLITE_OK);
    before = db.Rows(V1Select("rename_photo_file"));
  }
  ASSERT_GT(fs::file_size(Path(kTaskDB + "-wal")), 0u);
  LogCapture log;
  ASSERT_EQ(Update(), 0) << log.Dump();
  ExpectNoLeftovers(true);
  EXPECT_EQ(Rows(kTaskDB, "SELECT value FROM config_table WHERE key = 'version'"), "2");
  EXPECT_EQ(Rows(kTaskDB, V1Select("rename_photo_video")), before);
  EXPECT_EQ(Rows(kTaskDB, "SELECT DISTINCT remove_src_file, enable_rotation, max_version_count, rotation_policy, "
                          "iif(usb_id = 5, 0, schedule_id) FROM task_info_table ORDER BY 5"),
            "0 0 256 1 -1\n0 0 256 1 0");
  // Only the ordinary device's tasks get an entry, and it does not run.
  EXPECT_EQ(Entries(), (std::multiset<std::string>{"Cam 'daily' off", "Export 2 off", "Late off"}));
  // Each of them names its entry, which runs it every day at 00:00.
  std::istringstream rows(Rows(kTaskDB, "SELECT id, schedule_id FROM task_info_table WHERE usb_id = 5"));
  for (std::string id, entry; rows >> id >> entry;) {
    std::string text = ReadFile("/velt-dev/scheduler/" + entry + ".json");
    Json::Value e;
    ASSERT_TRUE(Json::Reader().parse(text, e)) << text;
    EXPECT_EQ(e["command"].asString().substr(e["command"].asString().rfind(' ') + 1), id);
    const Json::Value& when = e["schedule"];
    EXPECT_EQ(when["week_name"].asString(), "0,1,2,3,4,5,6");
    EXPECT_EQ(when["hour"].asInt() | when["min"].asInt() | when["repeat"].asInt(), 0) << text;
  }
  for (int id : {1, 7}) {
    EXPECT_EQ(Rows(FileDB(id), "SELECT name FROM sqlite_master WHERE type = 'index' AND sql NOT NULL ORDER BY 1"),
              "file_info_dst_path_idx\nfile_info_src_path_idx");
  }
  EXPECT_EQ(Rows(FileDB(7), "SELECT * FROM file_info_table"), files);
  // A new task gets an id never given before; the delete triggers reach across the tables.
  Raw db(Path(kTaskDB));
  EXPECT_EQ(db.Run("CREATE TEMP TABLE t AS SELECT * FROM task_info_table WHERE id = 1; UPDATE t SET id = NULL;"
                   "INSERT INTO task_info_table SELECT * FROM t; PRAGMA recursive_triggers = true;"
                   "DELETE FROM usb_info_table WHERE id = 5; DELETE FROM task_info_table WHERE id = 2;"), SQLITE_OK)
      << sqlite3_errmsg(db.db);
  EXPECT_EQ(db.Rows("SELECT group_concat(id) FROM task_info_table UNION ALL "
                    "SELECT group_concat(id) FROM usb_info_table"), "1,21\n1");
}

// A fault at any step, or a damaged database, leaves every database as it was.
TEST_F(UpdaterTest, AFailedMigrationLeavesEveryDatabaseAsItWas) {
  const std::string task = Path(kTaskDB), file = Path(FileDB(1)) + ".bkp_v1' -> '" + Path(FileDB(1));
  // The fault, the line showing the migration stopped where meant, and the
  // scheduler entries made by then. File databases go first.
  const std::vector<std::tuple<std::string, std::function<void()>, std::string, size_t>> faults = {
      {"version with a blank", [&] { Raw(Path(kTaskDB)).Run("UPDATE config_table SET value = ' 1';"); },
       "Invalid db version ' 1'", 0},
      {"task id below 1", [&] { Raw(Path(kTaskDB)).Run("UPDATE task_info_table SET id = -5 WHERE id = 9;"); },
       "UpdaterV1: Invalid task id -5", 0},
      {"missing file db", [&] { fs::remove(Path(FileDB(7))); }, "file db '" + Path(FileDB(7)) + "' does not exist", 0},
      {"file db copy", [&] { MakeDir(FileDB(7) + ".bkp_v1/x"); }, "Failed to backup file db '" + Path(FileDB(7)), 0},
      {"task db copy", [&] { MakeDir(kTaskDB + ".bkp_v1/x"); }, "Failed to backup task db '" + task, 0},
      {"script", [&] { Raw(Path(kTaskDB)).Run("CREATE TABLE task_info_table_old (x);"); },
       "Failed to update task db '" + task + ".bkp_v1'", 0},
      {"schedule", [] { VeltDevFailCall("VELTSchedTaskSave", 2, 1, VLIBC_ERR_IO); },
       "Failed to CreateSchedule for task '9', 'Export'", 1},
      {"checkpoint", [] { FailReplaceDBStepForTest("checkpoint"); }, "Failed to move DB back '" + file, 2},
      {"sync", [] { FailReplaceDBStepForTest("sync"); }, "Failed to move DB back '" + file, 2},
      {"rename", [] { FailReplaceDBStepForTest("rename"); }, "Failed to move DB back '" + file, 2},
      // Both file databases are in place by then and go back.
      {"task db rename", [] { FailReplaceDBStepForTest("rename", 3); },
       "Failed to move DB back '" + task + ".bkp_v1' -> '" + task, 2},
  };
  for (const auto& [name, fault, logged, entries] : faults) {
    SCOPED_TRACE(name);
    Reset();
    BuildV1();
    fault();
    auto before = Snapshot();
    LogCapture log;
    EXPECT_EQ(Update(), -1);
    EXPECT_TRUE(log.Contains(LOG_ERR, logged)) << log.Dump();
    EXPECT_TRUE(Snapshot() == before);
    EXPECT_EQ(Entries().size(), entries);
    ExpectNoLeftovers(false);
    // Once the fault is gone, the next start migrates with one entry per
    // ordinary task: those of the failed attempt are not left as twins.
    if (entries > 0) {
      VeltDevClearFaults();
      EXPECT_EQ(Update(), 0);
      EXPECT_EQ(Entries(), (std::multiset<std::string>{"Cam 'daily' off", "Export off"}));
    }
  }
}

// A link planted in the repository is refused, not followed out of it.
TEST_F(UpdaterTest, LinksPlantedInTheRepositoryAreNotFollowed) {
  MakeDir(kRepo + "/task/1");
  fs::create_symlink(Path("/outside"), Path(kRepo + "/task/1/user.config"));
  EXPECT_EQ(Update(), -1);
  EXPECT_FALSE(Exists("/outside"));
  Reset();
  MakeDir("/outside");
  fs::remove(Path(kRepo + "/task"));
  fs::create_symlink(Path("/outside"), Path(kRepo + "/task"));
  EXPECT_EQ(Update(), -1);
  EXPECT_TRUE(fs::is_empty(Path("/outside")));
}

TEST_F(UpdaterTest, UpdateDBRunsAllOrNothingOnAnExistingDatabase) {
  ASSERT_EQ(Raw(Path("/u.sqlite")).Run("CREATE TABLE t (x);"), SQLITE_OK);
  EXPECT_EQ(UpdateDB(Path("/u.sqlite"), "INSERT INTO t VALUES (1); INSERT INTO missing VALUES (2);"), -1);
  EXPECT_EQ(Rows("/u.sqlite", "SELECT count(*) FROM t"), "0");
  EXPECT_EQ(UpdateDB(Path("/u.sqlite"), "INSERT INTO t VALUES (1); INSERT INTO t VALUES (2);"), 0);
  EXPECT_EQ(Rows("/u.sqlite", "SELECT group_concat(x) FROM t"), "1,2");
  EXPECT_EQ(UpdateDB(Path("/none.sqlite"), "CREATE TABLE t (x);"), -1);
  EXPECT_FALSE(Exists("/none.sqlite"));
}

}  // namespace
