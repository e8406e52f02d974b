#include "daemon/engine/run-control.h"

namespace plovod {

void RunControl::Cancel(int reason) {
  int none = 0;
  // The first reason stands: a device pulled out after a cancel is still
  // a cancel.
  reason_.compare_exchange_strong(none, reason);
}

void RunControl::SetCopying(const std::string& path) {
  std::lock_guard<std::mutex> lock(mutex_);
  copying_ = path;
}

std::string RunControl::Copying() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return copying_;
}

std::string NormalizedFolder(const std::string& folder) {
  std::string result;
  for (size_t begin = 0; begin < folder.size();) {
    size_t end = folder.find('/', begin);
    if (end == std::string::npos) end = folder.size();
    if (end > begin) result += "/" + folder.substr(begin, end - begin);
    begin = end + 1;
  }
  return result;
}

namespace {

std::string Shown(const std::string& share, const std::string& folder) { return "/" + share + NormalizedFolder(folder); }

}  // namespace

std::string SourceShown(const RunPlan& plan) {
  const TaskDB::TaskInfo& task = plan.task;
  return task.task_type == 2 ? Shown(task.nas_share_name, task.nas_folder_path)
                             : Shown(plan.device_share, task.usb_folder_path);
}

std::string DestinationShown(const RunPlan& plan) {
  const TaskDB::TaskInfo& task = plan.task;
  return task.task_type == 2 ? Shown(plan.device_share, task.usb_folder_path)
                             : Shown(task.nas_share_name, task.nas_folder_path);
}

}  // namespace plovod
