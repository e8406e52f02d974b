#include "daemon/daemon.h"

#include <limits.h>
#include <stdlib.h>

#include <algorithm>
#include <ctime>
#include <set>

#include "common/log.h"
#include "ipc/error-code.h"
#include "daemon/devices.h"
#include "velt/hw.h"
#include "velt/share.h"

namespace plovod {

namespace {

// Reads a request's arguments by kind, remembering the first one that is
// missing or of another kind: a hostile or broken sender gets
// kBadRequest naming it, never a default value taken for its word.
class Args {
 public:
  static constexpr size_t kMaxName = 255;
  static constexpr size_t kMaxPath = 4095;
  static constexpr int kMaxVersions = 100000;
  static constexpr size_t kMaxListMembers = 1000;

  explicit Args(const PObject& request) : request_(request) {}

  std::string Text(const char* key) {
    const PObject& value = request_[key];
    if (!value.isString()) return Bad(key), "";
    return value.asStringRef();
  }
  uint64_t Number(const char* key) {
    const PObject& value = request_[key];
    if (!value.isInteger()) return Bad(key), 0;
    return value.asUInt64();
  }
  // An integer within [low, high].
  int Choice(const char* key, int low, int high) {
    const uint64_t value = Number(key);
    if (value < static_cast<uint64_t>(low) || value > static_cast<uint64_t>(high)) return Bad(key), low;
    return static_cast<int>(value);
  }
  bool Flag(const char* key) { return Choice(key, 0, 1) == 1; }
  // A policy: 1 or 2, and 0 (the sender's word for one it did not know)
  // for the default, 1.
  int Policy(const char* key) { return std::max(Choice(key, 0, 2), 1); }
  unsigned long TaskId() {
    const uint64_t id = Number("task_id");
    if (id == 0) Bad("task_id");
    return id;
  }
  // A folder of a share: "/" or "/a/b", without "." or ".." components.
  std::string Folder(const char* key) {
    const std::string path = Text(key);
    if (path.empty() || path[0] != '/' || path.size() > kMaxPath) return Bad(key), "";
    for (size_t begin = 1; begin <= path.size();) {
      size_t end = path.find('/', begin);
      if (end == std::string::npos) end = path.size();
      const std::string part = path.substr(begin, end - begin);
      if (part == "." || part == "..") return Bad(key), "";
      begin = end + 1;
    }
    return path;
  }
  std::string ShareName(const char* key) {
    const std::string name = Text(key);
    if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos || name.size() > kMaxName) {
      return Bad(key), "";
    }
    return name;
  }
  // A task name: what a list on a page and a scheduler entry can show.
  std::string TaskName(const char* key) {
    const std::string name = Text(key);
    if (name.empty() || name.size() > kMaxName) return Bad(key), "";
    return name;
  }
  // A filter list: names or extensions, each one that a file could have.
  std::vector<std::string> List(const char* key) {
    std::vector<std::string> items;
    const PObject& value = request_[key];
    if (!value.isArray() || value.asArray().size() > kMaxListMembers) return Bad(key), items;
    for (const PObject& item : value.asArray()) {
      if (!item.isString() || item.asStringRef().empty() || item.asStringRef().size() > kMaxName) {
        return Bad(key), items;
      }
      items.push_back(item.asStringRef());
    }
    return items;
  }
  Filters Lists() {
    Filters f;
    f.white_name = List("white_name");
    f.white_ext = List("white_ext");
    f.black_name = List("black_name");
    f.black_ext = List("black_ext");
    f.custom_name = List("custom_name");
    f.custom_ext = List("custom_ext");
    return f;
  }
  Trigger Triggers() {
    Trigger t;
    t.run_when_plug_in = Flag("run_when_plug_in");
    t.eject_when_task_done = Flag("eject_when_task_done");
    t.schedule_enabled = Flag("schedule_enabled");
    t.schedule_json = Text("schedule_json_str");
    return t;
  }

  bool Ok() const { return bad_.empty(); }
  const std::string& BadKey() const { return bad_; }

 private:
  void Bad(const char* key) {
    if (bad_.empty()) bad_ = key;
  }

  const PObject& request_;
  std::string bad_;
};

PObject Ok() {
  PObject answer;
  answer["ack"] = "ok";
  return answer;
}

const char* CodeText(Code code) {
  switch (code) {
    case kOk: return "ok";
    case kUnknownAction: return "unknown action";
    case kBadRequest: return "invalid request";
    case kConflict: return "conflict";
    case kNoSuchTask: return "no such task";
    case kFailed: return "the task store failed";
    case kNotRunning: return "the task is not running";
    case kDeviceAbsent: return "the device is not plugged in";
    case kShareAbsent: return "the NAS share is not available";
    case kDisabled: return "the task is disabled";
  }
  return "error";
}

PObject Error(Code code, const std::string& detail = "") {
  PObject answer;
  answer["error"] = detail.empty() ? std::string(CodeText(code)) : std::string(CodeText(code)) + ": " + detail;
  answer["error_code"] = static_cast<int>(code);
  return answer;
}

PObject BadRequest(const Args& args) { return Error(kBadRequest, "invalid " + args.BadKey()); }

PObject Strings(const std::vector<std::string>& items) {
  PObject list;
  list.asArray();
  for (const std::string& item : items) list.asArray().push_back(PObject(item));
  return list;
}

// A share's root with a folder below it; "/" is the root itself.
std::string Under(const std::string& root, const std::string& folder) {
  return folder == "/" || folder.empty() ? root : root + folder;
}

// The NAS side as the module shows it: "/share/folder", "/share" for the
// share's root.
std::string NasPath(const TaskDB::TaskInfo& info) {
  return Under("/" + info.nas_share_name, info.nas_folder_path);
}

bool IsExport(const TaskDB::TaskInfo& info) { return info.task_type == 2; }

// The side a task copies from: its direction and folder.
std::string SourceOf(const TaskDB::TaskInfo& info) {
  return IsExport(info) ? "nas:" + info.nas_share_name + NormalizedFolder(info.nas_folder_path)
                        : "usb:" + NormalizedFolder(info.usb_folder_path);
}

// Where a share really is; "" when it is not there.
std::string RealPath(const std::string& path) {
  if (path.empty()) return "";
  char resolved[PATH_MAX];
  return realpath(path.c_str(), resolved) ? resolved : "";
}

// Whether the folder inner is outer or lies below it.
bool Inside(const std::string& inner, const std::string& outer) {
  return inner.compare(0, outer.size(), outer) == 0 && (inner.size() == outer.size() || inner[outer.size()] == '/');
}

// Why a run failed, for its row.
std::string FailureText(int error) {
  switch (error) {
    case P_ERR_DEST_ROOT_MISSING: return "the destination folder cannot be made";
    case P_ERR_FILE_OPERATION: return "a file operation failed";
    default: return "an internal error (" + std::to_string(error) + ")";
  }
}

// PObject integers are unsigned on the wire; a negative number travels as
// its 64-bit two's complement and the module reads it back as signed.
PObject Signed(long value) { return PObject(static_cast<uint64_t>(value)); }

}  // namespace

Daemon::Daemon(const std::string& repo, bool beep, std::function<void()> stop, Job job,
               std::function<time_t()> clock)
    : store_(repo),
      log_(repo + "/db/log-db.sqlite"),
      clock_(std::move(clock)),
      beep_(beep),
      stop_(std::move(stop)),
      runner_(std::move(job),
              [this](const RunPlan& plan, const RunStats& stats, int error) { RunFinished(plan, stats, error); }) {}


const std::map<std::string, Daemon::Handler>& Daemon::Table() {
  static const std::map<std::string, Handler> table = {
      {"list_task", &Daemon::ListTask},
      {"get_task_setting", &Daemon::GetTaskSetting},
      {"get_filter_setting", &Daemon::GetFilterSetting},
      {"add_task", &Daemon::AddTask},
      {"set_task_setting", &Daemon::SetTaskSetting},
      {"set_trigger_time_setting", &Daemon::SetTriggerTimeSetting},
      {"set_filter_setting", &Daemon::SetFilterSetting},
      {"enable_task", &Daemon::EnableTask},
      {"disable_task", &Daemon::DisableTask},
      {"run_task", &Daemon::RunTask},
      {"cancel_task", &Daemon::CancelTask},
      {"remove_task", &Daemon::RemoveTask},
      {"set_global_setting", &Daemon::SetGlobalSetting},
      {"list_entry", &Daemon::ListEntry},
      {"device_added", &Daemon::DeviceAdded},
      {"device_removed", &Daemon::DeviceRemoved},
      {"stop", &Daemon::Stop},
  };
  return table;
}

std::vector<CommandServer::Command> Daemon::Commands() {
  std::vector<CommandServer::Command> commands;
  for (const auto& entry : Table()) {
    commands.push_back({entry.first, [this](const PObject& request) { return Handle(request); }});
  }
  return commands;
}

PObject Daemon::Unknown(const PObject&) { return Error(kUnknownAction); }

PObject Daemon::Handle(const PObject& request) {
  const std::string& action = request["action"].asStringRef();
  auto found = Table().find(action);
  std::lock_guard<std::mutex> lock(mutex_);
  const PObject answer = found == Table().end() ? Unknown(request) : (this->*found->second)(request);
  std::string line = action.empty() ? "(no action)" : action;
  if (request["task_id"].isInteger()) line += " " + std::to_string(request["task_id"].asUInt64());
  if (answer.hasMember("error")) {
    PLOVO_LOG(LOG_WARNING, "%s -> error %d (%s)", line.c_str(), static_cast<int>(answer["error_code"].asInt32()),
              answer["error"].asStringRef().c_str());
  } else {
    PLOVO_LOG(LOG_INFO, "%s -> ok", line.c_str());
  }
  return answer;
}

void Daemon::Shutdown() {
  if (shutDown_) return;
  shutDown_ = true;
  runner_.StopAll();
  store_.Close();
  log_.Close();
}

PObject Daemon::Describe(const StoredTask& task, const std::vector<PluggedDevice>& plugged, bool running) {
  const TaskDB::TaskInfo& info = task.info;
  PluggedDevice device;
  for (const PluggedDevice& candidate : plugged) {
    if (!candidate.uuid.empty() && candidate.uuid == task.device.uuid) device = candidate;
  }
  const bool usbMounted = !device.share_name.empty();
  const bool nasMounted = !MountedSharePath(info.nas_share_name).empty();

  PObject t;
  t["id"] = info.id;
  t["is_default_task"] = task.device.uuid == "PLOVO_DEFAULT_USB_UUID" || task.device.uuid == "PLOVO_DEFAULT_SD_UUID";
  t["uuid"] = task.device.uuid;
  t["type"] = info.task_type;
  t["task_name"] = info.task_name;
  t["task_status"] = running ? "running" : "idle";
  t["copy_file_path"] = runner_.Copying(info.id);
  t["is_usb_mounted"] = usbMounted;
  t["is_nas_mounted"] = nasMounted;
  t["is_task_runnable"] = info.is_enable && usbMounted && nasMounted && !running;
  t["is_enable"] = info.is_enable;
  t["latest_finish_time"] = info.last_copied_time;
  t["error_code"] = Signed(info.error);
  t["source_path"] = IsExport(info) ? NasPath(info) : info.usb_folder_path;
  t["destination_path"] = IsExport(info) ? info.usb_folder_path : NasPath(info);
  t["usb_share_name"] = usbMounted ? device.share_name : "";
  t["run_when_plug_in"] = task.device.run_when_plug_in;
  t["eject_when_task_done"] = task.device.eject_when_task_done;
  t["copy_strategy"] = info.copy_strategy;
  t["keep_dir_structure"] = info.keep_dir_structure;
  t["smart_create_date_dir"] = info.smart_create_date_dir;
  t["rename_photo_video"] = info.rename_photo_video;
  t["remove_src_file"] = info.remove_src_file;
  t["conflict_policy"] = info.conflict_policy;
  t["enable_rotation"] = info.enable_rotation;
  t["max_version_count"] = info.max_version_count;
  t["rotation_policy"] = info.rotation_policy;
  t["schedule_id"] = Signed(info.schedule_id);
  return t;
}

PObject Daemon::ListTask(const PObject&) {
  // Which tasks run is read before their rows: a run records its outcome
  // before it counts as ended, so an idle task's row is never the one from
  // before its last run.
  const std::set<unsigned long> running = runner_.Running();
  std::vector<StoredTask> tasks;
  if (Code failed = store_.List(tasks)) return Error(failed);
  PObject answer = Ok();
  PObject::array_type& list = answer["task_list"].asArray();
  const std::vector<PluggedDevice> plugged = ListPluggedDevices();
  for (const StoredTask& task : tasks) list.push_back(Describe(task, plugged, running.count(task.info.id) != 0));
  return answer;
}

PObject Daemon::GetTaskSetting(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  const bool running = runner_.IsRunning(id);  // before the row, as in ListTask
  StoredTask task;
  if (Code failed = store_.Get(id, task)) return Error(failed);
  PObject answer = Ok();
  const PObject described = Describe(task, ListPluggedDevices(), running);
  for (const auto& [key, value] : described.asMap()) answer[key] = value;
  return answer;
}

PObject Daemon::GetFilterSetting(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  Filters filters;
  if (Code failed = store_.GetFilters(id, filters)) return Error(failed);
  PObject answer = Ok();
  answer["white_name"] = Strings(filters.white_name);
  answer["white_ext"] = Strings(filters.white_ext);
  answer["black_name"] = Strings(filters.black_name);
  answer["black_ext"] = Strings(filters.black_ext);
  answer["custom_name"] = Strings(filters.custom_name);
  answer["custom_ext"] = Strings(filters.custom_ext);
  return answer;
}

PObject Daemon::AddTask(const PObject& request) {
  Args args(request);
  TaskDB::USBInfo device;
  device.uuid = args.Text("uuid");
  device.producer = args.Text("producer");
  device.product = args.Text("product");
  TaskDB::TaskInfo info;
  info.is_enable = true;
  info.task_name = args.TaskName("task_name");
  info.task_type = args.Choice("task_type", 1, 3);
  info.nas_share_name = args.ShareName("nas_share_name");
  info.usb_folder_path = args.Folder("usb_folder_path");
  info.nas_folder_path = args.Folder("nas_folder_path");
  info.copy_strategy = args.Choice("copy_strategy", 1, 3);
  info.keep_dir_structure = args.Flag("keep_dir_structure");
  info.smart_create_date_dir = args.Flag("smart_create_date_dir");
  info.rename_photo_video = args.Flag("rename_photo_video");
  info.remove_src_file = args.Flag("remove_src_file");
  info.conflict_policy = args.Policy("conflict_policy");
  info.enable_rotation = args.Flag("enable_rotation");
  info.max_version_count = args.Choice("max_version_count", 1, Args::kMaxVersions);
  info.rotation_policy = args.Policy("rotation_policy");
  const Trigger trigger = args.Triggers();
  const Filters filters = args.Lists();
  if (!args.Ok()) return BadRequest(args);
  if (device.uuid.empty()) return Error(kBadRequest, "invalid uuid");
  if (Code failed = store_.Add(device, info, trigger, filters)) {
    return Error(failed, failed == kConflict ? "the task name is taken" : "");
  }
  PObject answer = Ok();
  answer["task_id"] = info.id;
  return answer;
}

PObject Daemon::SetTaskSetting(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  StoredTask task;
  if (Code failed = store_.Get(id, task)) return Error(failed);
  TaskDB::TaskInfo& info = task.info;
  const std::string source = SourceOf(info);
  info.task_type = args.Choice("task_type", 1, 3);
  info.task_name = args.TaskName("task_name");
  info.usb_folder_path = args.Folder("usb_folder_path");
  info.nas_folder_path = args.Folder("nas_folder_path");
  info.nas_share_name = args.ShareName("nas_share_name");
  // The sender fills every key, also those of the other strategies (with
  // their defaults): only the task's own strategy's options are taken.
  const bool keep = args.Flag("keep_dir_structure"), dated = args.Flag("smart_create_date_dir"),
             renamed = args.Flag("rename_photo_video"), remove = args.Flag("remove_src_file"),
             rotate = args.Flag("enable_rotation");
  const int conflict = args.Policy("conflict_policy"), rotation = args.Policy("rotation_policy");
  const uint64_t versions = args.Choice("max_version_count", 1, Args::kMaxVersions);
  if (!args.Ok()) return BadRequest(args);
  if (info.copy_strategy == 3) {
    info.keep_dir_structure = keep;
    info.smart_create_date_dir = dated;
    info.rename_photo_video = renamed;
    info.remove_src_file = remove;
    info.conflict_policy = conflict;
  } else if (info.copy_strategy == 1) {
    info.enable_rotation = rotate;
    info.max_version_count = versions;
    info.rotation_policy = rotation;
  }
  if (Code failed = store_.Update(info)) {
    return Error(failed, failed == kConflict ? "the task name is taken" : "");
  }
  // What an incremental task remembers is relative to its source: another
  // source's files are not the ones it copied.
  if (SourceOf(info) != source) store_.ForgetCopies(id);
  return Ok();
}

PObject Daemon::SetTriggerTimeSetting(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  const Trigger trigger = args.Triggers();
  if (!args.Ok()) return BadRequest(args);
  long scheduleId = -1;
  if (Code failed = store_.SetTrigger(id, trigger, scheduleId)) {
    return Error(failed, failed == kBadRequest ? "the timetable was refused" : "");
  }
  PObject answer = Ok();
  answer["schedule_id"] = Signed(scheduleId);
  return answer;
}

PObject Daemon::SetFilterSetting(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  const Filters filters = args.Lists();
  if (!args.Ok()) return BadRequest(args);
  if (Code failed = store_.SetFilters(id, filters)) return Error(failed);
  return Ok();
}

PObject Daemon::SetEnabled(const PObject& request, bool enable) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  if (Code failed = store_.Enable(id, enable)) return Error(failed);
  return Ok();
}

PObject Daemon::EnableTask(const PObject& request) { return SetEnabled(request, true); }

PObject Daemon::DisableTask(const PObject& request) { return SetEnabled(request, false); }

Code Daemon::StartRun(const StoredTask& task, std::string& why) {
  const TaskDB::TaskInfo& info = task.info;
  if (!info.is_enable) return kDisabled;
  if (runner_.IsRunning(info.id)) {
    why = "the task is running";
    return kConflict;
  }
  PluggedDevice device;
  if (!FindPluggedDevice(task.device.uuid, device)) return kDeviceAbsent;
  const std::string share = RealPath(MountedSharePath(info.nas_share_name));
  if (share.empty()) return kShareAbsent;
  const std::string card = RealPath(device.share_path);
  if (card.empty()) return kDeviceAbsent;
  const std::string usb = Under(card, NormalizedFolder(info.usb_folder_path));
  const std::string nas = Under(share, NormalizedFolder(info.nas_folder_path));
  // A copy into its own source would copy its copies, without end.
  if (Inside(usb, nas) || Inside(nas, usb)) {
    why = "the source and the destination overlap";
    return kBadRequest;
  }
  RunPlan plan;
  plan.id = info.id;
  plan.source_root = IsExport(info) ? share : card;
  plan.source = IsExport(info) ? nas : usb;
  plan.destination_root = IsExport(info) ? card : share;
  plan.destination = IsExport(info) ? usb : nas;
  plan.device_share = device.share_name;
  plan.eject = task.device.eject_when_task_done;
  plan.task = info;
  plan.task_folder = store_.TaskDir(info.id);
  plan.started = clock_();
  plan.destination_fat = IsExport(info) && device.fat;
  plan.log = &log_;
  // Logged before the run can end, so that its rows come in order.
  log_.Add(info.id, Event::kRunStarted, {info.task_name});
  if (!runner_.Start(plan)) {
    why = "the task is running";
    return kConflict;
  }
  if (beep_) VELTBuzzerBeep(VELT_BEEP_SHORT);
  return kOk;
}

PObject Daemon::RunTask(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  StoredTask task;
  if (Code failed = store_.Get(id, task)) return Error(failed);
  std::string why;
  if (Code refused = StartRun(task, why)) return Error(refused, why);
  return Ok();
}

void Daemon::RunFinished(const RunPlan& plan, const RunStats& stats, int error) {
  // A device pulled out before the hot-plug hook said so fails the run
  // with whatever the disk said; its share being gone says why.
  if (error != 0 && error != P_ERR_STOPPED && MountedSharePath(plan.device_share).empty()) {
    error = P_ERR_SHARE_NOT_MOUNTED;
  }
  store_.RecordRun(plan.id, error, static_cast<unsigned int>(std::time(nullptr)));
  const std::string& name = plan.task.task_name;
  switch (error) {
    case P_SUCCESS:
      log_.Add(plan.id, Event::kRunFinished,
               {name, std::to_string(stats.copied), std::to_string(stats.bytes), std::to_string(stats.removed)});
      break;
    case P_ERR_STOPPED: log_.Add(plan.id, Event::kRunCancelled, {name}, error); break;
    case P_ERR_SHARE_NOT_MOUNTED: log_.Add(plan.id, Event::kDevicePulled, {name, plan.device_share}, error); break;
    case P_ERR_DEST_QUOTA_FULL: log_.Add(plan.id, Event::kDestinationFull, {name, DestinationShown(plan)}, error); break;
    case P_ERR_SOURCE_ROOT_MISSING: log_.Add(plan.id, Event::kSourceMissing, {name, SourceShown(plan)}, error); break;
    default: log_.Add(plan.id, Event::kRunFailed, {name, FailureText(error)}, error); break;
  }
  PLOVO_LOG(error == 0 ? LOG_INFO : LOG_WARNING, "run of task %lu ended: %d (%lu copied, %lu linked, %lu removed, %lu skipped)",
            plan.id, error, stats.copied, stats.linked, stats.removed, stats.skipped);
  if (beep_) VELTBuzzerBeep(VELT_BEEP_LONG);
  // Only once nothing else copies from or to the device.
  if (error != 0 || !plan.eject || runner_.BusyOnShare(plan.device_share, plan.id)) return;
  if (VELTShareEject(plan.device_share.c_str()) != 0) {
    PLOVO_LOG(LOG_WARNING, "cannot eject the device of share %s", plan.device_share.c_str());
  } else {
    log_.Add(plan.id, Event::kDeviceEjected, {plan.device_share});
  }
}

PObject Daemon::CancelTask(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  StoredTask task;
  if (Code failed = store_.Get(id, task)) return Error(failed);
  if (!runner_.Cancel(id)) return Error(kNotRunning);
  return Ok();
}

PObject Daemon::RemoveTask(const PObject& request) {
  Args args(request);
  const unsigned long id = args.TaskId();
  if (!args.Ok()) return BadRequest(args);
  if (runner_.IsRunning(id)) return Error(kConflict, "the task is running");
  if (Code failed = store_.Remove(id)) return Error(failed);
  return Ok();
}

PObject Daemon::SetGlobalSetting(const PObject& request) {
  Args args(request);
  const bool beep = args.Flag("beep_on_task_start_end");
  if (!args.Ok()) return BadRequest(args);
  beep_ = beep;
  return Ok();
}

PObject Daemon::ListEntry(const PObject&) {
  PObject answer = Ok();
  PObject::array_type& list = answer["entry_list"].asArray();
  for (const PluggedDevice& device : ListPluggedDevices()) {
    PObject entry;
    entry["share_name"] = device.share_name;
    entry["uuid"] = device.uuid;
    entry["producer"] = device.producer;
    entry["product"] = device.product;
    list.push_back(entry);
  }
  return answer;
}

PObject Daemon::DeviceAdded(const PObject& request) {
  Args args(request);
  const std::string share = args.ShareName("share_name");
  if (!args.Ok()) return BadRequest(args);
  PluggedDevice device;
  for (const PluggedDevice& plugged : ListPluggedDevices()) {
    if (plugged.share_name == share) device = plugged;
  }
  if (device.share_name.empty()) return Error(kDeviceAbsent);
  log_.Add(0, Event::kDevicePlugged, {device.share_name, device.producer, device.product});
  std::vector<StoredTask> tasks;
  if (Code failed = store_.List(tasks)) return Error(failed);
  for (const StoredTask& task : tasks) {
    if (task.device.uuid != device.uuid || device.uuid.empty() || !task.device.run_when_plug_in) continue;
    std::string why;
    if (Code refused = StartRun(task, why)) {
      PLOVO_LOG(LOG_WARNING, "task %lu does not run on plug-in: %s", task.info.id, CodeText(refused));
    }
  }
  return Ok();
}

PObject Daemon::DeviceRemoved(const PObject& request) {
  Args args(request);
  const std::string share = args.ShareName("share_name");
  if (!args.Ok()) return BadRequest(args);
  runner_.CancelOnShare(share);
  return Ok();
}

PObject Daemon::Stop(const PObject&) {
  stop_();
  return PObject();  // the sender does not wait for an answer
}

}  // namespace plovod
