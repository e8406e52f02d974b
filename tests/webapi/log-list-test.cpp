// "get_log_list" through Process: the page, the filter as the request
// gives it, the errors with their data, and running as root.
#include <json/reader.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <functional>
#include <sstream>

#include "common/utility.h"
#include "db/log-db.h"
#include "log-capture.h"
#include "webapi-test-util.h"

namespace {

using plovo_test::LogCapture;

Json::Value J(const std::string& text) {
  Json::Value value;
  std::istringstream in(text);
  in >> value;
  return value;
}

std::string Text(const Json::Value& value) { return Plovo::JsonToString(value); }

class LogListTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
    SetRepository("/volume1");
    MakeDir("/volume1/@Plovo/db");
  }
  void SetRepository(const std::string& volume) const {
    WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Root() + volume + "\"\n");
  }
  // Rows 1 to last as the daemon appends them: type 1, 2, 4 and
  // description id 1, 2, 3 in turn, parameter "file <n>".
  void AddRows(int last) {
    LogDB db;
    ASSERT_EQ(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")), 0);
    for (int n = 1; n <= last; ++n) {
      LogDB::LogInfo info;
      info.task_id = static_cast<unsigned long>(n % 3 + 1);
      info.log_type = 1 << (n % 3);
      info.timestamp = 1790000000u + static_cast<unsigned>(n);
      info.description_id = static_cast<unsigned>(n % 3 + 1);
      info.description_param = "file " + std::to_string(n) + (n == 13 ? " O'Brien" : "");
      info.error = n % 5 == 0 ? -3 : 0;
      ASSERT_EQ(db.AddLogInfo(info), 0);
    }
  }
};

TEST_F(LogListTest, PagesAndTheFilterAsTheRequestGivesIt) {
  AddRows(25);
  const struct {
    unsigned limit, offset;
    const char* filter;
    unsigned listed, nextOffset, count;
  } cases[] = {
      {10, 20, R"({"log_desc_id_list": [1, 2, 3]})", 5, 25, 25},  // the last page is short
      {50, 0, R"({"log_type": 3, "log_desc_id_list": [1, 2, 3]})", 25, 25, 25},  // not one type: all
      {50, 0, R"({"log_type": 0, "log_desc_id_list": [1, 2, 3]})", 25, 25, 25},
      {5, 0, R"({"log_type": 4, "log_desc_id_list": [1, 2, 3]})", 5, 5, 8},
      {50, 0, R"({"log_type": 2, "log_desc_id_list": [2, 3]})", 9, 9, 9},
      {50, 0, R"({"log_desc_id_list": [1, 2, 3], "from_timestamp": 1790000003, "to_timestamp": 1790000006})", 4, 4, 4},
      {50, 0, R"({"log_desc_id_list": [1, 2, 3], "key_word": "o'brien"})", 1, 1, 1},
      {50, 0, R"({"log_desc_id_list": 1})", 0, 0, 0},  // a number is no list: no id is named
      {50, 0, R"({})", 0, 0, 0},
  };
  for (const auto& c : cases) {
    Json::Value params(Json::objectValue);
    params["limit"] = c.limit;
    params["offset"] = c.offset;
    params["log_filter"] = J(c.filter);
    const VELT::APIResponse r = Call("get_log_list", params);
    ASSERT_TRUE(r.IsSuccess()) << c.filter << " " << Text(r.GetData());
    EXPECT_EQ(r.GetData()["log_list"].size(), c.listed) << c.filter;
    EXPECT_EQ(Text(r.GetData()["offset"]) + " " + Text(r.GetData()["count"]),
              std::to_string(c.nextOffset) + " " + std::to_string(c.count)) << c.filter;
  }
  // Newest first, every field; and without a filter, as without ids, nothing.
  const VELT::APIResponse r =
      Call("get_log_list", J(R"({"limit": 1, "offset": 20, "log_filter": {"log_desc_id_list": [1, 2, 3]}})"));
  EXPECT_EQ(Text(r.GetData()["log_list"]), Text(J(R"([{"task_id": 3, "log_type": 4, "timestamp": 1790000005,
      "description_id": 3, "description_parameter": "file 5", "error": -3}])")));
  EXPECT_EQ(Text(Call("get_log_list", J(R"({"limit": 50, "offset": 0})")).GetData()),
            R"({"count":0,"log_list":[],"offset":0})");
}

TEST_F(LogListTest, BadParametersAre402) {
  const char* const cases[][3] = {
      // parameters, answer data, log line
      {R"({"offset": 0})", R"("failed to get limit")", "Failed to get limit"},
      {R"({"limit": -1, "offset": 0})", R"("failed to get limit")", "Failed to get limit"},
      {R"({"limit": 4294967296, "offset": 0})", R"("failed to get limit")", "Failed to get limit"},
      {R"({"limit": 10, "offset": "0"})", R"("failed to get offset")", "Failed to get offset"},
      {R"({"limit": 10, "offset": 0, "log_filter": [1]})", "null", "Failed to get log filter"},
      {R"({"limit": 10, "offset": 0, "log_filter": {"key_word": {}}})", "null", "Failed to get log filter"},
      {R"({"limit": 10, "offset": 0, "log_filter": {"log_type": -1}})", "null", "Failed to get log filter"},
      {R"({"limit": 10, "offset": 0, "log_filter": {"log_desc_id_list": [1, "2"]}})", "null",
       "Failed to get log filter"},
  };
  for (const auto& c : cases) {
    LogCapture log;
    const VELT::APIResponse r = Call("get_log_list", J(c[0]));
    EXPECT_EQ(r.GetErrorCode(), 402) << c[0];
    EXPECT_EQ(Text(r.GetData()), c[1]) << c[0];
    EXPECT_TRUE(log.Contains(LOG_ERR, std::string("log-list.cpp:")) && log.Contains(c[2])) << log.Dump();
  }
  EXPECT_FALSE(Exists("/volume1/@Plovo/db/log-db.sqlite")) << "nothing is opened for a bad request";
}

TEST_F(LogListTest, RepositoryAndDatabaseFailures) {
  AddRows(3);  // a LIKE pattern is only refused when a row of id 1 is matched
  const Json::Value params = J(R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1]}})");
  Json::Value tooMany = params;
  for (unsigned id = 2; id < 1000; ++id) tooMany["log_filter"]["log_desc_id_list"].append(id);
  Json::Value longKeyWord = params;
  longKeyWord["log_filter"]["key_word"] = std::string(50000, 'k');
  WriteFile("/var/packages/Plovo/etc/setting.conf", "beep=\"yes\"\n");
  MakeDir("/volume2");
  // A link in the database's place, to a file outside the folder.
  MakeDir("/volume3/@Plovo/db");
  ASSERT_EQ(symlink(Path("/outside.sqlite").c_str(), Path("/volume3/@Plovo/db/log-db.sqlite").c_str()), 0);
  const struct {
    const char* volume;  // "" for none recorded
    const Json::Value& params;
    int code;
    const char* data;
    const char* logged;
  } cases[] = {
      {"", params, 401, "null", "Failed to get repo vol path"},
      // The database folder is missing: it is not made here.
      {"/volume2", params, 412, R"("Failed to init log db")", "Failed to init log db"},
      {"/volume3", params, 412, R"("Failed to init log db")", "Failed to init log db"},
      // 999 description ids nest deeper than SQLite allows; a LIKE pattern
      // longer than it takes.
      {"/volume1", tooMany, 412, R"("Failed to get log info list")", "Failed to get log info list"},
      {"/volume1", longKeyWord, 412, R"("Failed to get log info list")", "Failed to get log info list"},
  };
  for (const auto& c : cases) {
    if (*c.volume) SetRepository(c.volume);
    LogCapture log;
    const VELT::APIResponse r = Call("get_log_list", c.params);
    EXPECT_EQ(r.GetErrorCode(), c.code) << c.logged;
    EXPECT_EQ(Text(r.GetData()), c.data);
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
    // The database's own line names its part.
    EXPECT_EQ(log.Contains("[ERR] log-db("), c.code == 412) << log.Dump();
  }
  EXPECT_FALSE(Exists("/volume2/@Plovo"));
  EXPECT_FALSE(Exists("/outside.sqlite"));
  // The database made on the way is whole and usable.
  EXPECT_TRUE(Call("get_log_list", params).IsSuccess());
}

// The action raises to root itself. Each case runs in a child process
// that gives up root its own way; the child's exit status says what went
// wrong.
TEST_F(LogListTest, RunsAsRootAndDropsBack) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  ASSERT_EQ(chmod(Path("/volume1/@Plovo/db").c_str(), 0700), 0);
  const Json::Value params = J(R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1]}})");
  auto inChild = [](const std::function<int()>& body) {
    const pid_t child = fork();
    if (child == 0) _exit(body());
    int status = 0;
    return waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  };
  // Every id nobody's: no raise is possible. The gate would refuse first,
  // so the action is called past it.
  EXPECT_EQ(inChild([&] {
    if (setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0) return 10;
    LogCapture log;
    VELT::APIRequest request("VELT.Plovo", 1, "get_log_list", params);
    VELT::APIResponse response;
    PlovoHandle(&request, &response).HandleAction();
    if (response.GetErrorCode() != 401) return 11;
    for (const LogCapture::Line& line : log.Lines()) {
      if (line.text.find("log-list.cpp:") != std::string::npos &&
          line.text.find(" Failed to run as root") != std::string::npos) {
        return 0;
      }
    }
    return 12;
  }), 0);
  // Effective ids nobody's, real and saved root's, as a server that dropped
  // its privileges: the database is made as root, and the thread is
  // nobody again after the request.
  EXPECT_EQ(inChild([&] {
    if (setresgid(0, 65534, 0) != 0 || setresuid(0, 65534, 0) != 0) return 10;
    if (!Call("get_log_list", params).IsSuccess()) return 11;
    return geteuid() == 65534 && getegid() == 65534 ? 0 : 12;
  }), 0);
  struct stat st {};
  ASSERT_EQ(stat(Path("/volume1/@Plovo/db/log-db.sqlite").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_gid, 0u);
}

}  // namespace
