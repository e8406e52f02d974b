// Dispatch by method name, the daemon-error mapping and the path check.
#include <syslog.h>

#include <utility>

#include "ipc/pobject.h"
#include "log-capture.h"
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
    LogCapture log;
    VELT::APIResponse r = Call(name);
    ASSERT_EQ(r.AnswerCount(), 1) << name;
    EXPECT_FALSE(r.IsSuccess());
    EXPECT_EQ(r.GetErrorCode(), 401) << name;
    EXPECT_EQ(r.GetData(), Json::Value("Unknown request")) << name;
    EXPECT_TRUE(log.Contains(LOG_ERR, std::string("Unknown action '") + name + "'"))
        << log.Dump();
  }
}

TEST_F(DispatchTest, EachListedMethodReachesItsOwnAction) {
  const std::pair<const char*, const char*> rows[] = {
      {"list", "List"},
      {"create", "Create"},
      {"get", "Get"},
      {"get_filter", "GetFilter"},
      {"set_setting", "SetSetting"},
      {"set_trigger_time", "SetTriggerTime"},
      {"set_filter", "SetFilter"},
      {"delete", "Delete"},
      {"run", "Run"},
      {"cancel", "Cancel"},
      {"enable", "Enable"},
      {"disable", "Disable"},
      {"get_global_setting", "GetGlobalSetting"},
      {"set_global_setting", "SetGlobalSetting"},
      {"get_log_list", "GetLogList"}};
  for (const auto& [method, action] : rows) {
    LogCapture log;
    EXPECT_EQ(Call(method).AnswerCount(), 1);
    EXPECT_TRUE(log.Contains(std::string("Action ") + action + " is not available yet"))
        << method << "\n" << log.Dump();
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
}

TEST(DaemonErrorMappingTest, ReplyWithoutCodeIsGeneralAndLogged) {
  LogCapture log;
  PObject reply;
  reply["error"] = "failed";
  EXPECT_EQ(GetErrorCodeFromResponse(reply), 401);
  EXPECT_TRUE(log.Contains(LOG_ERR, "no error_code!!!")) << log.Dump();
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
