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

}  // namespace plovod
