// "create", "set_setting", "set_trigger_time", "set_filter" and
// "get_filter": the web interface's JSON to the settings records and back.
#include "common/log.h"
#include "common/run-as.h"
#include "ipc/plovo-command.h"
#include "webapi/plovo.h"

namespace {

// Typed reads of one member of a request object. A missing (or null)
// member gives the JSON default, as the web interface leaves out what it
// does not change; a member of another type is refused rather than
// guessed at.
bool ReadString(const Json::Value& object, const char* key, std::string& out) {
  const Json::Value& value = object[key];
  if (!value.isNull() && !value.isString()) {
    PLOVO_LOG(LOG_ERR, "'%s' must be a string", key);
    return false;
  }
  out = value.asString();
  return true;
}

bool ReadBool(const Json::Value& object, const char* key, bool& out) {
  const Json::Value& value = object[key];
  if (!value.isNull() && !value.isBool()) {
    PLOVO_LOG(LOG_ERR, "'%s' must be true or false", key);
    return false;
  }
  out = value.asBool();
  return true;
}

bool ReadUInt64(const Json::Value& object, const char* key, uint64_t& out) {
  const Json::Value& value = object[key];
  if (!value.isNull() && !value.isUInt64()) {
    PLOVO_LOG(LOG_ERR, "'%s' must be an unsigned integer", key);
    return false;
  }
  out = value.asUInt64();
  return true;
}

// Stores member key when it is a list; a missing one leaves the record's
// empty list.
bool ReadList(const Json::Value& object, const char* key, Json::Value& out) {
  const Json::Value& value = object[key];
  if (value.isNull()) return true;
  if (!value.isArray()) {
    PLOVO_LOG(LOG_ERR, "'%s' must be a list", key);
    return false;
  }
  out = value;
  return true;
}

bool IsObjectOrNull(const Json::Value& value) { return value.isNull() || value.isObject(); }

// "/share/folder/path" to the share name and the folder path within it;
// "/share" is the share's root "/". The first character is taken to be the
// leading '/' whatever it is; the path is never empty here.
void SplitSharePath(const std::string& path, std::string& share, std::string& folder) {
  const size_t slash = path.find('/', 1);
  if (slash == std::string::npos) {
    share = path.substr(1);
    folder = "/";
  } else {
    share = path.substr(1, slash - 1);
    folder = path.substr(slash);
  }
}

}  // namespace

bool PlovoHandle::setUCSetting(const Json::Value& json, bool isCreate, Plovo::TaskSetting& out) {
  if (!json.isObject()) return false;
  std::string name, type, source, destination, strategy;
  if (!ReadString(json, "name", name) || !ReadString(json, "type", type)) return false;
  const Registry::TASK_TYPE taskType = convertToEnumTT(type);
  if (taskType == Registry::TASK_TYPE_UNKNOWN) {
    PLOVO_LOG(LOG_ERR, "create fail: task[%s] has unknown task type[%s]", name.c_str(),
              type.c_str());
    return false;
  }
  if (!ReadString(json, "source_path", source)) return false;
  if (source.empty()) {
    PLOVO_LOG(LOG_ERR, "create fail: source_path can't be empty in task[%s]", name.c_str());
    return false;
  }
  if (!ReadString(json, "destination_path", destination)) return false;
  if (destination.empty()) {
    PLOVO_LOG(LOG_ERR, "create fail: destination_path can't be empty in task[%s]", name.c_str());
    return false;
  }
  out.task_type = taskType;
  out.task_name = name;

  const bool isExport = taskType == Registry::TASK_TYPE_EXPORT_GENERAL;
  std::string usbShare;
  SplitSharePath(isExport ? source : destination, out.nas_share_name, out.nas_folder_path);
  SplitSharePath(isExport ? destination : source, usbShare, out.usb_folder_path);
  // An existing task stays on its device.
  if (isCreate) out.usb_share_name = usbShare;

  if (!ReadString(json, "copy_strategy", strategy)) return false;
  const Registry::COPY_STRATEGY copyStrategy = convertToEnumCS(strategy);
  // The strategy is fixed at creation; on an edit the requested one only
  // says which of its own settings the request carries.
  if (isCreate) out.copy_strategy = copyStrategy;
  if (copyStrategy == Registry::COPY_STRATEGY_INCREMENTAL) {
    bool notKeep = false;
    std::string conflict;
    if (!ReadBool(json, "not_keep_dir_structure", notKeep) ||
        !ReadBool(json, "smart_create_date_dir", out.smart_create_date_dir) ||
        !ReadBool(json, "rename_photo_video", out.rename_photo_video) ||
        !ReadBool(json, "remove_src_file", out.remove_src_file) ||
        !ReadString(json, "conflict_policy", conflict)) {
      return false;
    }
    out.keep_dir_structure = !notKeep;
    out.conflict_policy = convertToEnumCP(conflict);
  } else if (copyStrategy == Registry::COPY_STRATEGY_VERSIONING) {
    std::string rotation;
    if (!ReadBool(json, "enable_rotation", out.enable_rotation) ||
        !ReadUInt64(json, "max_version_count", out.max_version_count) ||
        !ReadString(json, "rotation_policy", rotation)) {
      return false;
    }
    out.rotation_policy = convertToEnumRP(rotation);
  }
  return true;
}

bool PlovoHandle::setUCTriggerTime(const Json::Value& json, Plovo::TriggerTimeSetting& out) {
  if (!json.isObject()) return false;
  if (!ReadBool(json, "run_when_plug_in", out.run_when_plug_in) ||
      !ReadBool(json, "eject_when_task_done", out.eject_when_task_done) ||
      !ReadBool(json, "schedule_enabled", out.schedule_enabled)) {
    return false;
  }
  out.schedule = json["schedule_content"];
  return true;
}

bool PlovoHandle::setUCFilter(const Json::Value& json, Plovo::FilterSetting& out) {
  if (!IsObjectOrNull(json)) return false;
  const Json::Value& white = json["white_list"];
  const Json::Value& black = json["black_list"];
  const Json::Value& custom = json["customized_list"];
  if (!IsObjectOrNull(white) || !IsObjectOrNull(black) || !IsObjectOrNull(custom)) return false;
  return ReadList(white, "extensions", out.white_ext) && ReadList(white, "names", out.white_name) &&
         ReadList(black, "extensions", out.black_ext) && ReadList(black, "names", out.black_name) &&
         ReadList(custom, "extensions", out.custom_ext) &&
         ReadList(custom, "names", out.custom_name);
}

void PlovoHandle::Create() {
  const auto task = request->GetAndCheckObject("task", VELT::PARAM_REQUIRED, nullptr);
  if (task.IsInvalid()) {
    response->SetError(402);
    return;
  }
  Plovo::TaskSetting setting;
  if (!setUCSetting(task.Get(), true, setting)) {
    response->SetError(402);
    return;
  }
  if (!IsSafeShareName(setting.usb_share_name) || !IsSafeShareName(setting.nas_share_name) ||
      !IsSafePath(setting.usb_folder_path) || !IsSafePath(setting.nas_folder_path)) {
    response->SetError(414);
    return;
  }
  Plovo::TriggerTimeSetting trigger;
  Plovo::FilterSetting filter;
  if (!setUCTriggerTime(task.Get(), trigger) || !setUCFilter(task.Get()["filter"], filter)) {
    response->SetError(402);
    return;
  }

  PObject command, reply;
  int built;
  {
    // The device's configuration file may need a new identity written.
    PLOVO_RUN_AS_ROOT(runAs);
    if (!runAs.ok()) {
      // Left unanswered on purpose: the web server's own answer stands.
      PLOVO_LOG(LOG_ERR, "Failed to run as root");
      return;
    }
    built = Plovo::CreateTaskCmd(setting, trigger, filter, command);
  }
  if (built != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to get daemon command");
    response->SetError(411);
    return;
  }
  if (int code = SendToDaemon(command, reply, "Create")) {
    Json::Value data;
    // The web interface names the device whose task already exists.
    if (code == 403) data["usb_share_name"] = setting.usb_share_name;
    response->SetError(code, data);
    return;
  }
  Json::Value data(Json::objectValue);
  data["task_id"] = Json::UInt64(reply["task_id"].asUInt64());
  response->SetSuccess(data);
}

void PlovoHandle::SetSetting() {
  const auto json = request->GetAndCheckObject("task_setting", VELT::PARAM_REQUIRED, nullptr);
  const auto id = request->GetAndCheckIntegral<uint64_t>("id", VELT::PARAM_REQUIRED, nullptr);
  Plovo::TaskSetting setting;
  if (json.IsInvalid() || id.IsInvalid() || !setUCSetting(json.Get(), false, setting)) {
    response->SetError(402);
    return;
  }
  // The device's share is the existing task's own and is not read here.
  if (!IsSafeShareName(setting.nas_share_name) || !IsSafePath(setting.usb_folder_path) ||
      !IsSafePath(setting.nas_folder_path)) {
    response->SetError(414);
    return;
  }
  PObject command, reply;
  if (!Forward(Plovo::SetTaskSettingCmd(id.Get(), setting, command), command, reply,
               "SetSetting")) {
    return;
  }
  response->SetSuccess();
}

void PlovoHandle::SetTriggerTime() {
  const auto id = request->GetAndCheckIntegral<uint64_t>("id", VELT::PARAM_REQUIRED, nullptr);
  const auto json = request->GetAndCheckObject("trigger_time", VELT::PARAM_REQUIRED, nullptr);
  Plovo::TriggerTimeSetting trigger;
  if (id.IsInvalid() || json.IsInvalid() || !setUCTriggerTime(json.Get(), trigger)) {
    response->SetError(402);
    return;
  }
  PObject command, reply;
  // The same words as set_setting's failure: log readers search for them.
  if (!Forward(Plovo::SetTriggerTimeSettingCmd(id.Get(), trigger, command), command, reply,
               "SetSetting")) {
    return;
  }
  const int64_t scheduleId = reply["schedule_id"].asInt64();
  Json::Value data(Json::objectValue);
  data["schedule_id"] = Json::Int64(scheduleId);
  data["next_run_time"] = GetNextRunTime(scheduleId);
  response->SetSuccess(data);
}

void PlovoHandle::SetFilter() {
  const auto json = request->GetAndCheckObject("task_filter", VELT::PARAM_REQUIRED, nullptr);
  const auto id = request->GetAndCheckIntegral<uint64_t>("id", VELT::PARAM_REQUIRED, nullptr);
  Plovo::FilterSetting filter;
  if (json.IsInvalid() || id.IsInvalid() || !setUCFilter(json.Get(), filter)) {
    response->SetError(402);
    return;
  }
  PObject command, reply;
  if (!Forward(Plovo::SetFilterSettingCmd(id.Get(), filter, command), command, reply,
               "SetFilter")) {
    return;
  }
  response->SetSuccess();
}

void PlovoHandle::GetFilter() {
  PObject reply;
  if (!ForwardTaskIdCmd(Plovo::GetFilterSettingCmd, reply, "GetFilter")) return;
  Json::Value filter(Json::objectValue);
  filter["white_list"]["extensions"] = convertToJsonArray(reply["white_ext"].asArray());
  filter["white_list"]["names"] = convertToJsonArray(reply["white_name"].asArray());
  filter["black_list"]["extensions"] = convertToJsonArray(reply["black_ext"].asArray());
  filter["black_list"]["names"] = convertToJsonArray(reply["black_name"].asArray());
  filter["customized_list"]["extensions"] = convertToJsonArray(reply["custom_ext"].asArray());
  filter["customized_list"]["names"] = convertToJsonArray(reply["custom_name"].asArray());
  Json::Value data(Json::objectValue);
  data["task_filter"] = filter;
  response->SetSuccess(data);
}
