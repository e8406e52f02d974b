// The built module as the web server loads it, and plovo-api on top of it.
#include <dlfcn.h>
#include <velt/webapi.h>

#include <sys/wait.h>

#include <array>
#include <cstdio>
#include <string>

#include "emulation.h"
#include "sandbox.h"

namespace {

struct CommandResult {
  int status = -1;
  std::string out;
};

CommandResult RunCommand(const std::string& command) {
  CommandResult result;
  FILE* pipe = popen(command.c_str(), "r");
  if (pipe == nullptr) return result;
  std::array<char, 4096> buffer;
  size_t n;
  while ((n = fread(buffer.data(), 1, buffer.size(), pipe)) > 0) result.out.append(buffer.data(), n);
  int status = pclose(pipe);
  result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return result;
}

class ModuleTest : public plovo_test::SandboxTest {};

// A library loaded earlier with global symbols also defines Process; the
// module's table and gate must still reach the module's own code.
TEST_F(ModuleTest, TableListsFifteenMethodsServedByItsOwnProcess) {
  void* other = dlopen(ECHO_MODULE_PATH, RTLD_NOW | RTLD_GLOBAL);
  ASSERT_NE(other, nullptr) << dlerror();
  void* module = dlopen(PLOVO_MODULE_PATH, RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(module, nullptr) << dlerror();
  auto getTable = reinterpret_cast<const VELT::APIDesc* (*)()>(dlsym(module, "GetAPITable"));
  auto process = reinterpret_cast<VELT::APIHandler>(dlsym(module, "Process"));
  ASSERT_TRUE(getTable != nullptr && process != nullptr);

  const char* expected[] = {"list", "create", "get", "get_filter", "set_setting",
                            "set_trigger_time", "set_filter", "delete", "run", "cancel",
                            "enable", "disable", "get_global_setting", "set_global_setting",
                            "get_log_list"};
  const VELT::APIDesc* row = getTable();
  for (const char* method : expected) {
    ASSERT_NE(row->api, nullptr) << "table ends before " << method;
    EXPECT_STREQ(row->api, "VELT.Plovo");
    EXPECT_EQ(row->version, 1);
    EXPECT_STREQ(row->method, method);
    EXPECT_EQ(row->handler, process);
    ++row;
  }
  EXPECT_EQ(row->api, nullptr);

  WriteStatus(2, "");
  VELT::APIRequest request("VELT.Plovo", 1, "list", Json::Value(Json::objectValue));
  VELT::APIResponse response;
  getTable()[0].handler(&request, &response);
  EXPECT_EQ(response.AnswerCount(), 1);
  EXPECT_EQ(response.GetErrorCode(), 405);
  dlclose(module);
  dlclose(other);
}

TEST(ModuleExportsTest, OnlyTheEntryPointsAreExported) {
  CommandResult nm = RunCommand(std::string("nm -D --defined-only -j ") + PLOVO_MODULE_PATH);
  ASSERT_EQ(nm.status, 0) << nm.out;
  EXPECT_EQ(nm.out,
            "ChangeRepoVolume\nCollectUageStatistics\nGetAPITable\nGetServiceStatus\nProcess\n"
            "SetServiceStatus\nStartService\nStopService\n");
}

class PlovoApiTest : public plovo_test::SandboxTest {
 protected:
  // The answer line alone by default; the module's log lines go to stderr.
  CommandResult Api(const std::string& args, const char* stderrTo = "/dev/null") {
    return RunCommand("PLOVO_ROOT=" + Root() + " " + PLOVO_API_PATH + " " + args + " 2>" + stderrTo);
  }
};

TEST_F(PlovoApiTest, PrintsOneLineAndExitsByOutcome) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  WriteStatus(2, "");
  CommandResult r = Api("list");
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "{\"success\":false,\"error\":{\"code\":405,\"data\":null}}\n");

  // Success, and requests as another module leaves them.
  const std::string echo = std::string("--module ") + ECHO_MODULE_PATH + " ";
  r = Api(echo + "echo '{\"task\": {\"id\": 7, \"name\": \"a b\"}}'");
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "{\"success\":true,\"data\":{\"task\":{\"id\":7,\"name\":\"a b\"}}}\n");

  r = Api(echo + "fail");
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "{\"success\":false,\"error\":{\"code\":499,\"data\":\"no\"}}\n");

  // Not in the table, still handed to the module's Process, which stays silent.
  r = Api(echo + "silent");
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "{\"success\":false,\"error\":{\"code\":100,\"data\":null}}\n");
}

TEST_F(PlovoApiTest, UsageAndLoadingErrorsExitWithTwo) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  EXPECT_EQ(Api("").status, 2);
  EXPECT_EQ(Api("list '{}' extra").status, 2);
  EXPECT_EQ(Api("--module").status, 2);
  CommandResult r = Api("--module " + Root() + "/missing.so list", "&1");
  EXPECT_EQ(r.status, 2);
  EXPECT_NE(r.out.find("cannot load module"), std::string::npos) << r.out;
}

}  // namespace
