// "get_global_setting" and "set_global_setting": what is answered and
// stored, when the daemon is told, and the checks before a repository move.
#include <json/reader.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include "common/utility.h"
#include "db/log-db.h"
#include "service/global-setting.h"
#include "test-daemon.h"
#include "webapi-test-util.h"

namespace {

Json::Value J(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

// Service running, repository on volume1 with its database folder, beep on.
class GlobalSettingTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
    MakeDir("/tmp");
    MakeDir("/volume1/@Plovo/db");
    Volumes(R"({"path": "volume1"})");
    WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume1") + "\"\nbeep=\"YES\"\n");
  }
  void Volumes(const std::string& list) const { WriteFile("/velt-dev/volumes.json", R"({"volumes": [)" + list + "]}"); }
  // A request that turns the beep off.
  Json::Value Params(const std::string& volume) const {
    return J(R"({"repo_volume_path": ")" + Path(volume) + R"(", "beep_on_task_start_end": false, "log_rotate_count": 500})");
  }
};

TEST_F(GlobalSettingTest, GetAnswersTheRepositoryOnlyWhenItIsUsable) {
  LogDB db;
  ASSERT_TRUE(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")) == 0 && db.UpdateRotationCount(77) == 0);
  auto get = [] { return Plovo::JsonToString(Call("get_global_setting").GetData()); };
  EXPECT_EQ(get(), Plovo::JsonToString(J(R"({"repo_volume_path": ")" + Path("/volume1") +
                                         R"(", "beep_on_task_start_end": true, "log_rotate_count": 77})")));
  Volumes(R"({"path": "volume1", "mounted": false})");
  EXPECT_EQ(get(), Plovo::JsonToString(J(R"({"beep_on_task_start_end": true, "repo_volume_path": ""})")));
  Volumes(R"({"path": "volume1"})");
  std::filesystem::remove_all(Path("/volume1/@Plovo"));
  EXPECT_EQ(Call("get_global_setting").GetErrorCode(), 412);
}

TEST_F(GlobalSettingTest, SetRefusesMissingOrMistypedParameters) {
  const struct { const char* key; const char* value; } cases[] = {  // value nullptr: key left out
      {"repo_volume_path", nullptr}, {"repo_volume_path", "5"}, {"repo_volume_path", "null"}, {"beep_on_task_start_end", nullptr},
      {"beep_on_task_start_end", R"("no")"}, {"beep_on_task_start_end", "0"}, {"log_rotate_count", nullptr},
      {"log_rotate_count", "-1"}, {"log_rotate_count", R"("500")"}, {"log_rotate_count", "1.5"}, {"log_rotate_count", "true"}};
  for (const auto& c : cases) {
    Json::Value params = Params("/volume1");
    if (c.value) params[c.key] = J(c.value); else params.removeMember(c.key);
    EXPECT_EQ(Call("set_global_setting", params).GetErrorCode(), 402) << c.key << " " << (c.value ? c.value : "-");
  }
}

// The same volume, named with a trailing '/' too: the running daemon hears of
// the beep, the count is stored, nothing moves; a refusal by the daemon is
// answered with its code. In state 1 the daemon is not asked, and a
// repository is made on the volume chosen when there was none.
TEST_F(GlobalSettingTest, SetStoresBeepAndCountAndTellsOnlyARunningDaemon) {
  plovo_test::TestDaemon daemon;
  plovo_test::LogCapture log;
  ASSERT_TRUE(Call("set_global_setting", Params("/volume1/")).IsSuccess()) << log.Dump();
  EXPECT_EQ(daemon.LastRequest().toString(), R"({"action": "set_global_setting", "beep_on_task_start_end": 0, "need_ack": 1})");
  EXPECT_FALSE(Plovo::GlobalSetting::GetBeep());
  LogDB db;
  unsigned long count = 0;
  EXPECT_TRUE(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")) == 0 && db.GetRotationCount(count) == 0 && count == 500);
  PObject refusal;
  refusal["error"] = "failed", refusal["error_code"] = 3;
  daemon.Answer(plovo_test::DaemonAnswer::Reply(refusal));
  EXPECT_EQ(Call("set_global_setting", Params("/volume1")).GetErrorCode(), 403);
  const int asked = daemon.Connections();
  WriteStatus(1, "");
  WriteFile("/var/packages/Plovo/etc/setting.conf", "");
  EXPECT_TRUE(Call("set_global_setting", Params("/volume1")).IsSuccess());
  EXPECT_EQ(daemon.Connections(), asked);
  EXPECT_FALSE(log.Contains("User move")) << log.Dump();
  EXPECT_TRUE(log.Contains("User create repo volume [" + Path("/volume1") + "]") && Exists("/volume1/@Plovo/task"));
}

// Targets that cannot hold the repository, and room for its tree on the
// target: a link to a file outside the repository counts nothing.
// The recorded volume is gone: the user begins again on another one.
TEST_F(GlobalSettingTest, SetLeavesAVolumeThatIsGone) {
  WriteStatus(1, "");
  WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume9") + "\"\n");
  MakeDir("/volume2");
  Volumes(R"({"path": "volume2"})");
  plovo_test::LogCapture log;
  EXPECT_TRUE(Call("set_global_setting", Params("/volume2")).IsSuccess()) << log.Dump();
  EXPECT_TRUE(Exists("/volume2/@Plovo/db"));
  EXPECT_EQ(Plovo::GlobalSetting::GetRepoVolumePath(), Path("/volume2"));
}

TEST_F(GlobalSettingTest, SetChecksTheTargetBeforeMoving) {
  WriteStatus(1, "");
  const std::string longName = "/v" + std::string(62 - Root().size(), 'x');  // 64 bytes in all
  MakeDir(longName), MakeDir("/volume2");
  WriteFile("/volume1/@Plovo/task/big", std::string(1 << 20, 'x'));
  WriteFile("/huge", std::string(1 << 20, 'x'));
  ASSERT_EQ(symlink(Path("/huge").c_str(), Path("/volume1/@Plovo/task/link").c_str()), 0);
  const struct { std::string target; unsigned long long free; int code; const char* logged; } cases[] = {
      {longName, 0, 408, "check_volume() failed"},
      {"/volume2", 1 << 20, 409, "Target vol space not enough"},
      {"/volume2", 2 << 20, 0, "User move repo volume"},  // last: it moves
  };
  for (const auto& c : cases) {
    Volumes(R"({"path": "volume1"}, {"path": ")" + longName.substr(1) + R"("}, {"path": "volume2", "free_bytes": )" +
            std::to_string(c.free) + "}");
    plovo_test::LogCapture log;
    EXPECT_EQ(Call("set_global_setting", Params(c.target)).GetErrorCode(), c.code) << c.target << " " << c.free;
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
  }
  // The old copy is removed in the background; the sandbox goes only after it.
  for (int i = 0; i < 200 && Exists("/volume1/@tmp/@Plovo"); ++i) usleep(10000);
}

}  // namespace
