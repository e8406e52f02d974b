// The copy log as the daemon writes it: one row per event in the
// repository's log database ("<repo>/db/log-db.sqlite", through LogDB),
// which the web page pages through with "get_log_list".
//
// A row carries the task, a type (1 information, 2 warning, 4 error), the
// event's number (description_id, below), its parameters and an error
// code (0, or a code of ipc/error-code.h). The parameters are a JSON
// array of strings, in the order listed for each event, so that a page
// can put them into its own sentence; the key word search of the log
// finds any of them. docs/daemon.md lists the events for the page.
#ifndef PLOVO_DAEMON_ENGINE_COPY_LOG_H
#define PLOVO_DAEMON_ENGINE_COPY_LOG_H

#include <mutex>
#include <string>
#include <vector>

#include "db/log-db.h"

namespace plovod {

enum class Event : unsigned int {
  kRunStarted = 1,        // [task name]
  kRunFinished = 2,       // [task name, files copied, bytes copied, files removed]
  kRunCancelled = 3,      // [task name]
  kRunFailed = 4,         // [task name, reason]
  kDevicePlugged = 5,     // [share, producer, product]
  kDeviceEjected = 6,     // [share]
  kFileSkipped = 7,       // [path, reason]
  kDestinationFull = 8,   // [task name, destination folder]
  kSourceMissing = 9,     // [task name, source folder]
  kDevicePulled = 10,     // [task name, share]
  kFileTooLarge = 11,     // [path, size in bytes]: 4 GiB or more, for a FAT device
  kNameNotAllowed = 12,   // [path]: characters a FAT device cannot hold
};

// The type an event is logged with: 1, 2 or 4.
int EventType(Event event);

// Writes rows; safe from several threads.
class CopyLog {
 public:
  // The log database's path. It is opened (and created when absent) with
  // the first row, so that a daemon that logs nothing never touches it.
  explicit CopyLog(std::string path) : path_(std::move(path)) {}
  // Adds one row stamped now; a row that cannot be written is reported in
  // the daemon's own log and otherwise ignored: the copy goes on.
  void Add(unsigned long task, Event event, const std::vector<std::string>& params, int error = 0);
  void Close();

 private:
  std::mutex mutex_;  // guards opened_ and the opening
  bool opened_ = false;
  std::string path_;
  LogDB db_;
};

}  // namespace plovod

#endif
