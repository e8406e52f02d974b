#include "daemon/engine/copy-log.h"

#include <json/json.h>

#include <ctime>

#include "common/log.h"

namespace plovod {

int EventType(Event event) {
  switch (event) {
    case Event::kRunStarted:
    case Event::kRunFinished:
    case Event::kDevicePlugged:
    case Event::kDeviceEjected:
      return 1;
    case Event::kRunCancelled:
    case Event::kFileSkipped:
    case Event::kFileTooLarge:
    case Event::kNameNotAllowed:
      return 2;
    case Event::kRunFailed:
    case Event::kDestinationFull:
    case Event::kSourceMissing:
    case Event::kDevicePulled:
      return 4;
  }
  return 4;
}

void CopyLog::Add(unsigned long task, Event event, const std::vector<std::string>& params, int error) {
  Json::Value list(Json::arrayValue);
  for (const std::string& param : params) list.append(param);
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  writer["emitUTF8"] = true;
  LogDB::LogInfo row;
  row.task_id = task;
  row.log_type = EventType(event);
  row.timestamp = static_cast<unsigned int>(std::time(nullptr));
  row.description_id = static_cast<unsigned int>(event);
  row.description_param = Json::writeString(writer, list);
  row.error = error;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!opened_) opened_ = db_.Initialize(path_) == 0;
  }
  if (!opened_ || db_.AddLogInfo(row) != 0) {
    PLOVO_LOG(LOG_WARNING, "copy log: row %u of task %lu not written", row.description_id, task);
  }
}

void CopyLog::Close() {
  std::lock_guard<std::mutex> lock(mutex_);
  db_.Destroy();
  opened_ = false;
}

}  // namespace plovod
