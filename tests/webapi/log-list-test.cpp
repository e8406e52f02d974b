// "get_log_list" through Process: the page, the filter as the request
// gives it, the errors with their data, and running as root.
#include <json/reader.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <sstream>

#include "common/utility.h"
#include "db/log-db.h"
#include "log-capture.h"
#include "webapi-test-util.h"

namespace {

using plovo_test::LogCapture;

Json::Value J(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

std::string Text(const Json::Value& value) { return Plovo::JsonToString(value); }

const char* const kParams = R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1]}})";

class LogListTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
    SetRepository("/volume1");
    MakeDir("/volume1/@Plovo/db");
  }
  // "" records no repository.
  void SetRepository(const std::string& volume) const {
    const std::string setting = volume.empty() ? "" : "repo_vol_path=\"" + Root() + volume + "\"\n";
    WriteFile("/var/packages/Plovo/etc/setting.conf", setting);
  }
  // Rows 1 to last as the daemon appends them: type 1, 2, 4 and
  // description id 1, 2, 3 in turn, parameter "file <n>".
  void AddRows(int last) {
    LogDB db;
    ASSERT_EQ(db.Initialize(Path("/volume1/@Plovo/db/log-db.sqlite")), 0);
    for (int n = 1; n <= last; ++n) {
      LogDB::LogInfo info;
      info.task_id = info.description_id = static_cast<unsigned>(n % 3 + 1);
      info.log_type = 1 << (n % 3);
      info.timestamp = 1790000000u + static_cast<unsigned>(n);
      info.description_param = "file " + std::to_string(n) + (n == 13 ? " O'Brien" : "");
      info.error = n % 5 == 0 ? -3 : 0;
      ASSERT_EQ(db.AddLogInfo(info), 0);
    }
  }
  // A failed request: its error code and data, the error line of this
  // action, and the database's own line when the database failed (412).
  void ExpectError(const Json::Value& params, const std::string& answer, const std::string& logged) {
    LogCapture log;
    const VELT::APIResponse r = Call("get_log_list", params);
    EXPECT_EQ(std::to_string(r.GetErrorCode()) + " " + Text(r.GetData()), answer) << Text(params);
    EXPECT_TRUE(log.Contains(LOG_ERR, "log-list.cpp:") && log.Contains(logged)) << log.Dump();
    EXPECT_EQ(log.Contains("[ERR] log-db("), answer.compare(0, 3, "412") == 0) << log.Dump();
  }
};

TEST_F(LogListTest, PagesAndTheFilterAsTheRequestGivesIt) {
  AddRows(25);
  const char* const cases[][2] = {
      // parameters; records listed, next offset, count
      {R"({"limit": 10, "offset": 20, "log_filter": {"log_desc_id_list": [1, 2, 3]}})", "5 25 25"},  // last page
      {R"({"limit": 50, "offset": 0, "log_filter": {"log_type": 3, "log_desc_id_list": [1, 2, 3]}})", "25 25 25"},
      {R"({"limit": 5, "offset": 0, "log_filter": {"log_type": 4, "log_desc_id_list": [1, 2, 3]}})", "5 5 8"},
      {R"({"limit": 50, "offset": 0, "log_filter": {"log_type": 2, "log_desc_id_list": [2, 3]}})", "9 9 9"},
      {R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1, 2, 3], "from_timestamp": 1790000003,
          "to_timestamp": 1790000006}})", "4 4 4"},
      {R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1, 2, 3], "key_word": "o'brien"}})", "1 1 1"},
      {R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": 1}})", "0 0 0"},  // a number: no id named
      {R"({"limit": 50, "offset": 0, "log_filter": {}})", "0 0 0"},
      {R"({"limit": 50, "offset": 0})", "0 0 0"},  // no filter, as no ids: nothing
  };
  for (const auto& c : cases) {
    const VELT::APIResponse r = Call("get_log_list", J(c[0]));
    ASSERT_TRUE(r.IsSuccess()) << c[0] << " " << Text(r.GetData());
    const Json::Value& data = r.GetData();
    EXPECT_EQ(std::to_string(data["log_list"].size()) + " " + Text(data["offset"]) + " " + Text(data["count"]), c[1])
        << c[0];
  }
  // Newest first, every field.
  const VELT::APIResponse r =
      Call("get_log_list", J(R"({"limit": 1, "offset": 20, "log_filter": {"log_desc_id_list": [1, 2, 3]}})"));
  EXPECT_EQ(Text(r.GetData()["log_list"]), Text(J(R"([{"task_id": 3, "log_type": 4, "timestamp": 1790000005,
      "description_id": 3, "description_parameter": "file 5", "error": -3}])")));
}

TEST_F(LogListTest, ErrorsAnswerWithTheirData) {
  for (const char* params : {R"({"offset": 0})", R"({"limit": -1, "offset": 0})", R"({"limit": 4294967296})"}) {
    ExpectError(J(params), R"(402 "failed to get limit")", "Failed to get limit");
  }
  ExpectError(J(R"({"limit": 10, "offset": "0"})"), R"(402 "failed to get offset")", "Failed to get offset");
  for (const char* filter : {"[1]", R"({"key_word": {}})", R"({"log_type": -1})", R"({"log_desc_id_list": ["2"]})"}) {
    ExpectError(J(R"({"limit": 10, "offset": 0, "log_filter": )" + std::string(filter) + "}"), "402 null",
                "Failed to get log filter");
  }
  EXPECT_FALSE(Exists("/volume1/@Plovo/db/log-db.sqlite")) << "nothing is opened for a bad request";
  SetRepository("");
  ExpectError(J(kParams), "401 null", "Failed to get repo vol path");
  MakeDir("/volume2");
  SetRepository("/volume2");  // the database folder is missing: it is not made here
  ExpectError(J(kParams), R"(412 "Failed to init log db")", "Failed to init log db");
  EXPECT_FALSE(Exists("/volume2/@Plovo"));
  // 999 description ids nest deeper than SQLite allows.
  SetRepository("/volume1");
  Json::Value tooMany = J(kParams);
  for (unsigned id = 2; id < 1000; ++id) tooMany["log_filter"]["log_desc_id_list"].append(id);
  ExpectError(tooMany, R"(412 "Failed to get log info list")", "Failed to get log info list");
  // The database made on the way is whole and usable.
  EXPECT_TRUE(Call("get_log_list", J(kParams)).IsSuccess());
}

// The action raises to root itself. Each case runs in a child process that
// gives up root its own way and exits with 0 when all went right. All ids
// nobody's: no raise is possible, 401 (the gate would refuse first, so the
// action is called past it). Effective ids nobody's, real and saved root's,
// as a server that dropped its privileges: the database is made as root,
// and the thread is nobody again after the request.
TEST_F(LogListTest, RunsAsRootAndDropsBack) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  ASSERT_EQ(chmod(Path("/volume1/@Plovo/db").c_str(), 0700), 0);
  for (const auto& [id, code] : {std::pair<uid_t, int>{65534, 401}, {0, 0}}) {
    const pid_t child = fork();
    if (child == 0) {
      if (setresgid(id, 65534, id) != 0 || setresuid(id, 65534, id) != 0) _exit(10);
      LogCapture log;
      VELT::APIRequest request("VELT.Plovo", 1, "get_log_list", J(kParams));
      VELT::APIResponse response;
      PlovoHandle(&request, &response).HandleAction();
      const bool refused = log.Contains(LOG_ERR, "Failed to run as root"), droppedBack = geteuid() == 65534;
      _exit(response.GetErrorCode() == code && refused == (code != 0) && droppedBack && getegid() == 65534 ? 0 : 11);
    }
    int status = -1;
    EXPECT_TRUE(waitpid(child, &status, 0) == child && WIFEXITED(status) && WEXITSTATUS(status) == 0) << code;
  }
  struct stat st {};
  ASSERT_EQ(stat(Path("/volume1/@Plovo/db/log-db.sqlite").c_str(), &st), 0);
  EXPECT_TRUE(st.st_uid == 0 && st.st_gid == 0) << st.st_uid << ":" << st.st_gid;
}

}  // namespace
