// Dispatch by method name, the daemon-error mapping and the path check.
#include <utility>

#include "ipc/pobject.h"
#include "log-capture.h"
#include "test-daemon.h"
#include "webapi-test-util.h"

namespace {

using plovo_test::LogCapture;

class DispatchTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
  }
};

TEST_F(DispatchTest, NamesThatDifferOnlyInCaseOrSpacingAreUnknown) {
  for (const char* name : {"List", "LIST", "list ", "", "get_log_list2", "VELT.Plovo"}) {
    VELT::APIResponse r = Call(name);
    ASSERT_EQ(r.AnswerCount(), 1) << name;
    EXPECT_FALSE(r.IsSuccess());
    EXPECT_EQ(r.GetErrorCode(), 401) << name;
    EXPECT_EQ(r.GetData(), Json::Value("Unknown request")) << name;
  }
}

// One set of parameters serves every method; each action shows itself by
// the command the daemon receives, or by its own log line.
TEST_F(DispatchTest, EachListedMethodReachesItsOwnAction) {
  MakeDir("/tmp");
  plovo_test::TestDaemon daemon;
  Json::Value params(Json::objectValue);
  params["id"] = 1;
  params["task"] = Json::Value(Json::objectValue);
  params["task"]["type"] = params["task_setting"]["type"] = "import_general";
  params["task"]["source_path"] = params["task_setting"]["source_path"] = "/usbshare1";
  params["task"]["destination_path"] = params["task_setting"]["destination_path"] = "/photo";
  params["trigger_time"] = params["task_filter"] = Json::Value(Json::objectValue);
  const std::pair<const char*, const char*> rows[] = {
      {"list", "list_task"},
      {"create", "Failed to open share 'usbshare1'"},
      {"get", "get_task_setting"},
      {"get_filter", "get_filter_setting"},
      {"set_setting", "set_task_setting"},
      {"set_trigger_time", "set_trigger_time_setting"},
      {"set_filter", "set_filter_setting"},
      {"delete", "remove_task"},
      {"run", "run_task"},
      {"cancel", "cancel_task"},
      {"enable", "enable_task"},
      {"disable", "disable_task"},
      {"get_global_setting", "No repo volume path"},
      {"set_global_setting", "Invalid parameter"},
      {"get_log_list", "Failed to get limit"}};
  for (const auto& [method, evidence] : rows) {
    LogCapture log;
    const int before = daemon.Connections();
    EXPECT_EQ(Call(method, params).AnswerCount(), 1);
    if (daemon.Connections() > before) {
      EXPECT_EQ(daemon.LastRequest()["action"].asString(), evidence) << method;
    } else {
      EXPECT_TRUE(log.Contains(evidence)) << method << "\n" << log.Dump();
    }
  }
}

TEST(DaemonErrorMappingTest, KnownCodesMapAndTheRestIsGeneral) {
  struct Case {
    int daemonCode;
    int webCode;
  } cases[] = {{3, 403}, {9, 410}, {10, 413}, {4, 401}, {0, 401}, {8, 401}, {-1, 401}};
  for (const Case& c : cases) {
    PObject reply;
    reply["error"] = "failed";
    reply["error_code"] = c.daemonCode;
    EXPECT_EQ(GetErrorCodeFromResponse(reply), c.webCode) << c.daemonCode;
  }
  // Only the low 32 bits count: 2^32 + 3 is 3.
  PObject wide;
  wide["error_code"] = static_cast<unsigned long>((1UL << 32) + 3);
  EXPECT_EQ(GetErrorCodeFromResponse(wide), 403);
  // An answer that is no map at all, as a broken daemon may give.
  EXPECT_EQ(GetErrorCodeFromResponse(PObject()), 401);
  EXPECT_EQ(GetErrorCodeFromResponse(PObject("error_code")), 401);
}

TEST(SafePathTest, DotComponentsAndColonsAreUnsafe) {
  for (const char* safe : {"", "/", "///", "a//b/", "/share/photos", "b..", "..b", ".hidden",
                           "a/.../b", "dir name/with spaces"}) {
    EXPECT_TRUE(IsSafePath(safe)) << safe;
  }
  for (const char* unsafe : {".", "..", "a/./b", "../x", "x/..", "/a/b/../c", "c:", "a/c:d/e",
                             ":", "//..//", "a/b/."}) {
    EXPECT_FALSE(IsSafePath(unsafe)) << unsafe;
  }
}

}  // namespace
