// "get_global_setting" and "set_global_setting": what is answered and
// stored, when the daemon is told, and the checks before a repository move.
#include <json/reader.h>
#include <signal.h>
#include <syslog.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <chrono>
#include <filesystem>
#include <sstream>

#include "common/paths.h"
#include "common/utility.h"
#include "db/log-db.h"
#include "service/global-setting.h"
#include "service/service-ctrl.h"
#include "test-daemon.h"
#include "webapi-test-util.h"

namespace {

using plovo_test::LogCapture;

Json::Value J(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

std::string Text(const Json::Value& value) { return Plovo::JsonToString(value); }

// Service running, repository on volume1 with its database folder, beep on.
class GlobalSettingTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
    MakeDir("/tmp");
    MakeDir("/volume1/@Plovo/db");
    Volumes(R"({"path": "volume1"})");
    Record("/volume1");
  }
  // A daemon that a test started is gone before its sandbox.
  void TearDown() override {
    const int pid = VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str());
    if (pid > 0 && StatusService() == 0) kill(pid, SIGKILL);
    WebApiTest::TearDown();
  }
  void Volumes(const std::string& list) const { WriteFile("/velt-dev/volumes.json", R"({"volumes": [)" + list + "]}"); }
  // "" records no repository.
  void Record(const std::string& volume) const {
    WriteFile("/var/packages/Plovo/etc/setting.conf",
              (volume.empty() ? "" : "repo_vol_path=\"" + Path(volume) + "\"\n") + "beep=\"YES\"\n");
  }
  unsigned long Count() const {
    LogDB db;
    unsigned long count = 0;
    EXPECT_TRUE(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")) == 0 && db.GetRotationCount(count) == 0);
    return count;
  }
  // A request that turns the beep off.
  Json::Value Params(const std::string& volume, unsigned count = 500) const {
    return J(R"({"repo_volume_path": ")" + Path(volume) + R"(", "beep_on_task_start_end": false, "log_rotate_count": )" +
             std::to_string(count) + "}");
  }
  // Past the gate, which turns states other than 1 and 4 away.
  static VELT::APIResponse Set(const Json::Value& params) {
    VELT::APIRequest request("VELT.Plovo", 1, "set_global_setting", params);
    VELT::APIResponse response;
    PlovoHandle(&request, &response).HandleAction();
    return response;
  }
};

TEST_F(GlobalSettingTest, GetAnswersTheRepositoryOnlyWhenItIsUsable) {
  LogDB db;
  ASSERT_TRUE(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")) == 0 && db.UpdateRotationCount(77) == 0);
  const std::string mounted = R"({"repo_volume_path": ")" + Path("/volume1") + R"(", "beep_on_task_start_end": true,
      "log_rotate_count": 77})", none = R"({"beep_on_task_start_end": true, "repo_volume_path": ""})";
  const struct { const char* volumes; const char* make; int code; std::string data; } cases[] = {
      {R"({"path": "volume1"})", "", 0, mounted},
      {R"({"path": "volume1", "mounted": false})", "", 0, none},
      {R"({"path": "volume2"})", "", 0, none},
      {R"({"path": "volume1"})", "/volume1", 412, R"("Failed to init log db")"},  // no db folder
      {R"({"path": "volume1"})", "/volume1/@Plovo/db/log-db.sqlite", 412, R"("Failed to init log db")"},
  };
  for (const auto& c : cases) {
    if (*c.make) {
      std::filesystem::remove_all(Path("/volume1"));
      MakeDir(c.make);
    }
    Volumes(c.volumes);
    LogCapture log;
    const VELT::APIResponse r = Call("get_global_setting");
    EXPECT_EQ(std::to_string(r.GetErrorCode()) + " " + Text(r.GetData()), std::to_string(c.code) + " " + Text(J(c.data)))
        << c.volumes << c.make;
    EXPECT_EQ(log.Contains(LOG_WARNING, "No repo volume path"), c.data == none) << log.Dump();
  }
}

TEST_F(GlobalSettingTest, SetRefusesMissingOrMistypedParameters) {
  const struct { const char* key; const char* value; } cases[] = {  // value nullptr: key left out
      {"repo_volume_path", nullptr}, {"repo_volume_path", "5"}, {"repo_volume_path", "null"}, {"beep_on_task_start_end", nullptr},
      {"beep_on_task_start_end", R"("no")"}, {"beep_on_task_start_end", "0"}, {"log_rotate_count", nullptr},
      {"log_rotate_count", "-1"}, {"log_rotate_count", R"("500")"}, {"log_rotate_count", "1.5"}, {"log_rotate_count", "true"}};
  plovo_test::TestDaemon daemon;
  for (const auto& c : cases) {
    Json::Value params = Params("/volume1");
    if (c.value) params[c.key] = J(c.value); else params.removeMember(c.key);
    LogCapture log;
    EXPECT_EQ(Set(params).GetErrorCode(), 402) << c.key << " " << (c.value ? c.value : "-");
    EXPECT_TRUE(log.Contains(LOG_ERR, "Invalid parameter")) << log.Dump();
  }
  EXPECT_TRUE(Plovo::GlobalSetting::GetBeep());
  EXPECT_EQ(daemon.Connections(), 0);
  EXPECT_EQ(Count(), 100000u);
}

// The same volume: the running daemon hears of the beep, the count is
// stored, nothing moves. A refusal by the daemon ends the request before
// the count; in other states the daemon is not asked.
TEST_F(GlobalSettingTest, SetOnTheSameVolumeStoresBeepAndCount) {
  plovo_test::TestDaemon daemon;
  LogCapture log;
  ASSERT_TRUE(Set(Params("/volume1", 500)).IsSuccess()) << log.Dump();
  EXPECT_EQ(daemon.LastRequest().toString(), R"({"action": "set_global_setting", "beep_on_task_start_end": 0, "need_ack": 1})");
  EXPECT_FALSE(Plovo::GlobalSetting::GetBeep());
  EXPECT_EQ(Count(), 500u);
  EXPECT_FALSE(log.Contains("User move") || Exists("/volume1/@tmp")) << log.Dump();

  PObject refusal;
  refusal["error"] = "failed";
  refusal["error_code"] = 3;
  daemon.Answer(plovo_test::DaemonAnswer::Reply(refusal));
  EXPECT_EQ(Set(Params("/volume1", 600)).GetErrorCode(), 403);
  EXPECT_EQ(Count(), 500u);

  const int asked = daemon.Connections();
  for (int state : {1, 6}) {
    WriteStatus(state, "");
    Record("/volume1");
    EXPECT_TRUE(Set(Params("/volume1", 700)).IsSuccess() && !Plovo::GlobalSetting::GetBeep()) << state;
  }
  EXPECT_EQ(daemon.Connections(), asked);
}

// Targets that cannot hold the repository, and room for its tree on the
// target. Sizes are apparent: a 1 MiB file without blocks counts 1 MiB, and
// a link to a 1 GiB file outside the repository counts nothing.
TEST_F(GlobalSettingTest, SetChecksTheTargetBeforeMoving) {
  WriteStatus(6, "");
  const std::string longName = "/v" + std::string(62 - Root().size(), 'x');  // 64 bytes in all
  for (const std::string& dir : {std::string("/usb"), std::string("/volume2"), longName}) MakeDir(dir);
  for (const auto& [file, size] : {std::pair<const char*, uintmax_t>{"/volume1/@Plovo/task/big", 1 << 20}, {"/huge", 1ull << 30}}) {
    WriteFile(file, "");
    std::filesystem::resize_file(Path(file), size);
  }
  ASSERT_EQ(symlink(Path("/huge").c_str(), Path("/volume1/@Plovo/task/link").c_str()), 0);
  const struct { std::string target; unsigned long long free; int code; const char* logged; } cases[] = {
      {"/usb", 0, 408, "check_volume() failed"},
      {"/volume9", 0, 408, "check_volume() failed"},  // not a volume
      {longName, 0, 408, "check_volume() failed"},
      {"/volume2", 1 << 20, 409, "Target vol space not enough"},
      {"/volume2", 2 << 20, 0, "User move repo volume"},  // last: it moves
  };
  for (const auto& c : cases) {
    Volumes(R"({"path": "volume1"}, {"path": "usb", "location": "external"}, {"path": ")" + longName.substr(1) +
            R"("}, {"path": "volume2", "free_bytes": )" + std::to_string(c.free) + "}");
    LogCapture log;
    EXPECT_EQ(Set(Params(c.target)).GetErrorCode(), c.code) << c.target << " " << c.free;
    EXPECT_TRUE(log.Contains(LOG_ERR, c.logged)) << log.Dump();
    EXPECT_EQ(log.Contains(Path("/volume2") + " has no enough space"), c.code == 409);
    EXPECT_EQ(Exists(c.target + "/@Plovo/task/big"), c.code == 0) << c.target;
  }
  // The old copy is removed in the background; the sandbox goes only after it.
  for (int i = 0; i < 200 && Exists("/volume1/@tmp/@Plovo"); ++i) usleep(10000);
  EXPECT_FALSE(Exists("/volume1/@tmp/@Plovo") || Exists("/volume1/@Plovo"));
}

TEST_F(GlobalSettingTest, SetInStateOneCreatesTheRepositoryAndStartsTheService) {
  WriteStatus(1, "");
  Record("");
  std::filesystem::remove_all(Path("/volume1/@Plovo"));
  for (const char* dir : {"/var/run", "/var/packages/Plovo/target/sbin"}) MakeDir(dir);
  for (const char* file : {"/var/packages/Plovo/enabled", "/etc.defaults/veltinfo.conf"}) WriteFile(file, "");
  ASSERT_EQ(symlink(PLOVOD_DEV_PATH, Path("/var/packages/Plovo/target/sbin/plovod").c_str()), 0);
  LogCapture log;
  EXPECT_TRUE(Set(Params("/volume1", 9)).IsSuccess()) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_ERR, "User create repo volume [" + Path("/volume1") + "].")) << log.Dump();
  EXPECT_TRUE(Exists("/volume1/@Plovo/db") && Exists("/volume1/@Plovo/task"));
  EXPECT_EQ(Plovo::GlobalSetting::GetRepoVolumePath(), Path("/volume1"));
  EXPECT_NE(ReadFile("/var/packages/Plovo/etc/status").find("state=\"4\""), std::string::npos);  // the daemon serves
  SetStopServiceWait(std::chrono::seconds(2));
  EXPECT_EQ(StopService(), 0);
  SetStopServiceWait(std::chrono::seconds(0));
}

}  // namespace
