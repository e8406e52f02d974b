// "get_log_list": one page of the copy log, read from the repository's log
// database directly rather than through the daemon.
#include <list>

#include "common/log.h"
#include "common/run-as.h"
#include "db/log-db.h"
#include "service/global-setting.h"
#include "webapi/plovo.h"

namespace {

// Fills filter from the request's "log_filter". Each key is applied only
// when present; a key of the wrong type makes the whole filter invalid
// (false), while a description-id list that is not an array is ignored.
bool ReadLogFilter(const Json::Value& json, LogDB::LogInfoFilter& filter) {
  if (json.isMember("key_word")) {
    if (!json["key_word"].isString()) return false;
    filter.key_word = json["key_word"].asString();
  }
  if (json.isMember("from_timestamp")) {
    if (!json["from_timestamp"].isUInt()) return false;
    filter.from_timestamp = json["from_timestamp"].asUInt();
  }
  if (json.isMember("to_timestamp")) {
    if (!json["to_timestamp"].isUInt()) return false;
    filter.to_timestamp = json["to_timestamp"].asUInt();
  }
  if (json.isMember("log_type")) {
    if (!json["log_type"].isUInt()) return false;
    const unsigned int type = json["log_type"].asUInt();
    // One type or all of them: the log screen has no other choice.
    filter.log_type = type == 1 || type == 2 || type == 4 ? type : 7;
  }
  const Json::Value& ids = json["log_desc_id_list"];
  if (ids.isArray()) {
    for (const Json::Value& id : ids) {
      if (!id.isUInt()) return false;
      filter.log_desc_id_list.push_back(id.asUInt());
    }
  }
  return true;
}

Json::Value LogRecord(const LogDB::LogInfo& info) {
  Json::Value record(Json::objectValue);
  record["task_id"] = Json::UInt64(info.task_id);
  record["log_type"] = info.log_type;
  record["timestamp"] = Json::UInt(info.timestamp);
  record["description_id"] = Json::UInt(info.description_id);
  record["description_parameter"] = info.description_param;
  record["error"] = info.error;
  return record;
}

}  // namespace

void PlovoHandle::GetLogList() {
  const auto json = request->GetAndCheckObject("log_filter", VELT::PARAM_OPTIONAL, nullptr);
  if (json.IsInvalid()) {
    PLOVO_LOG(LOG_ERR, "Failed to get log filter");
    response->SetError(402);
    return;
  }
  const auto limit = request->GetAndCheckIntegral<uint32_t>("limit", VELT::PARAM_REQUIRED, nullptr);
  if (limit.IsInvalid()) {
    PLOVO_LOG(LOG_ERR, "Failed to get limit");
    response->SetError(402, Json::Value("failed to get limit"));
    return;
  }
  const auto offset = request->GetAndCheckIntegral<uint32_t>("offset", VELT::PARAM_REQUIRED, nullptr);
  if (offset.IsInvalid()) {
    PLOVO_LOG(LOG_ERR, "Failed to get offset");
    response->SetError(402, Json::Value("failed to get offset"));
    return;
  }
  LogDB::LogInfoFilter filter;
  filter.limit = limit.Get();
  filter.offset = offset.Get();
  if (!ReadLogFilter(json.Get(), filter)) {
    PLOVO_LOG(LOG_ERR, "Failed to get log filter");
    response->SetError(402);
    return;
  }

  std::list<LogDB::LogInfo> logs;
  unsigned long count = 0;
  {
    PLOVO_RUN_AS_ROOT(runAs);
    if (!runAs.ok()) {
      PLOVO_LOG(LOG_ERR, "Failed to run as root");
      response->SetError(401);
      return;
    }
    const std::string repoVolume = Plovo::GlobalSetting::GetRepoVolumePath();
    if (repoVolume.empty()) {
      PLOVO_LOG(LOG_ERR, "Failed to get repo vol path");
      response->SetError(401);
      return;
    }
    // The folder belongs to the service start; without it the repository is
    // not there, and the database is not made in its place.
    LogDB db;
    if (db.Initialize(repoVolume + "/@Plovo/db" + "/" + "log-db.sqlite") != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to init log db");
      response->SetError(412, Json::Value("Failed to init log db"));
      return;
    }
    if (db.ListLogInfo(filter, logs) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to get log info list");
      response->SetError(412, Json::Value("Failed to get log info list"));
      return;
    }
    filter.limit = 0;
    filter.offset = 0;
    if (db.GetLogListCount(filter, count) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to get log list count");
      response->SetError(412, Json::Value("Failed to get log list count"));
      return;
    }
  }

  Json::Value data(Json::objectValue);
  Json::Value& list = data["log_list"] = Json::Value(Json::arrayValue);
  for (const LogDB::LogInfo& info : logs) list.append(LogRecord(info));
  data["offset"] = Json::UInt64(static_cast<uint64_t>(offset.Get()) + logs.size());
  data["count"] = Json::UInt64(count);
  response->SetSuccess(data);
}
