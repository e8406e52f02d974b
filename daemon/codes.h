// The "error_code" of a failed daemon command. The module turns 3, 9 and
// 10 into web-API errors of their own and takes 8 from "cancel_task" as a
// success; every other code reaches the user as a general failure.
#ifndef PLOVO_DAEMON_CODES_H
#define PLOVO_DAEMON_CODES_H

namespace plovod {

enum Code {
  kOk = 0,
  kUnknownAction = 1,
  kBadRequest = 2,    // a missing or malformed argument, an unsafe path, a refused timetable
  kConflict = 3,      // the task name is taken, or the task is running
  kNoSuchTask = 4,
  kFailed = 5,        // the task database, the task folder or the scheduler failed
  kNotRunning = 8,    // cancel of a task that is not running
  kDeviceAbsent = 9,  // the task's device is not plugged in
  kShareAbsent = 10,  // the task's NAS share is missing or not mounted
  kDisabled = 11,     // the task is disabled
};

}  // namespace plovod

#endif
