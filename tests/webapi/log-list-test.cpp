// "get_log_list" through Process: the page, the filter as the request
// gives it, and the errors with their data.
#include <json/reader.h>
#include <syslog.h>

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
  const Json::Value params = J(R"({"limit": 50, "offset": 0, "log_filter": {"log_desc_id_list": [1]}})");
  Json::Value tooMany = params;
  for (unsigned id = 0; id < 1100; ++id) tooMany["log_filter"]["log_desc_id_list"].append(id);
  WriteFile("/var/packages/Plovo/etc/setting.conf", "beep=\"yes\"\n");
  MakeDir("/volume2");
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
      // More conditions than SQLite nests.
      {"/volume1", tooMany, 412, R"("Failed to get log info list")", "Failed to get log info list"},
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
  // The database made on the way is whole and usable.
  EXPECT_TRUE(Call("get_log_list", params).IsSuccess());
}

}  // namespace
