// The task scheduler: one JSON file per entry in velt-dev/scheduler under the
// sandbox root, and the next run time of an entry's weekly timetable.
#include "velt/sched.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <json/writer.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <ctime>
#include <limits>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "dev-internal.h"

namespace {

constexpr int kMinutesPerDay = 24 * 60;

struct Timetable {
  unsigned days = 0;  // bit d set: weekday d (0 = Sunday) has runs
  int hour = 0;
  int min = 0;
  int repeat = 0;  // minutes between the runs of one day; 0: one run a day
};

}  // namespace

struct _tag_VELTSCHEDTASK {
  int64_t id = -1;
  std::string app;
  std::string appName;
  std::string name;
  std::string action;
  std::string command;
  bool enabled = true;
  bool canRunAppSameTime = false;
  bool canRunTaskSameTime = false;
  bool canRunFromUI = false;
  uid_t owner = 0;
  bool canEditName = false;
  bool canEditOwner = false;
  bool canDeleteFromUI = false;
  bool listable = true;
  bool hasSchedule = false;
  // Kept as given, keys the scheduler does not use included, so that a save
  // hands them back unchanged; timetable is its checked form.
  Json::Value schedule;
  Timetable timetable;
};

struct _tag_VELTSCHEDTASKLIST {
  std::vector<std::unique_ptr<VELTSCHEDTASK>> tasks;
  size_t next = 0;
};

namespace {

// Runs fn and turns an exception into a failure, so that none reaches the
// caller of a platform call.
template <typename R, typename Fn>
R Guarded(R failure, Fn&& fn) {
  try {
    return fn();
  } catch (const std::bad_alloc&) {
    VELT_FAIL(VLIBC_ERR_NO_MEMORY);
  } catch (...) {
    VELT_FAIL(VLIBC_ERR_IO);
  }
  return failure;
}

std::string SchedDir() { return velt_dev::StateDir() + "/scheduler"; }
std::string EntryPath(int64_t id) { return SchedDir() + "/" + std::to_string(id) + ".json"; }

bool IsDigit(char c) { return c >= '0' && c <= '9'; }

// Decimal digits only, at most `limit`; false when the text holds anything
// else or names a larger number.
bool ParseDecimal(const std::string& text, int64_t limit, int64_t* out) {
  if (text.empty()) return false;
  int64_t n = 0;
  for (char c : text) {
    if (!IsDigit(c)) return false;
    int digit = c - '0';
    // n * 10 + digit <= limit, without overflowing.
    if (digit > limit || n > (limit - digit) / 10) return false;
    n = n * 10 + digit;
  }
  *out = n;
  return true;
}

// The id of an entry file name, "<id>.json". Other files of the folder (the
// lock, next-id, temporary files, anything a person left there) are no
// entries, and neither is "007.json", which no save would have written.
bool EntryIdOfName(const std::string& name, int64_t* id) {
  const std::string suffix = ".json";
  if (name.size() <= suffix.size() ||
      name.compare(name.size() - suffix.size(), suffix.size(), suffix) != 0) {
    return false;
  }
  std::string digits = name.substr(0, name.size() - suffix.size());
  if (digits[0] == '0') return false;
  return ParseDecimal(digits, std::numeric_limits<int64_t>::max(), id);
}

// The ids of the entry files, ascending. A missing folder holds none.
bool EntryIds(std::vector<int64_t>* ids) {
  ids->clear();
  DIR* dir = opendir(SchedDir().c_str());
  if (!dir) return errno == ENOENT;
  while (struct dirent* ent = readdir(dir)) {
    int64_t id;
    if (EntryIdOfName(ent->d_name, &id)) ids->push_back(id);
  }
  closedir(dir);
  std::sort(ids->begin(), ids->end());
  return true;
}

bool MakeDir(const std::string& path) { return mkdir(path.c_str(), 0755) == 0 || errno == EEXIST; }

// An exclusive flock on the folder's ".lock", held while the object lives.
// It serialises the writers, so that two new entries never get one id and a
// save never brings back an entry removed under it. Readers take no lock:
// entries are replaced by rename. flock works between threads too because
// each holder opens its own descriptor.
class FolderLock {
 public:
  FolderLock() = default;
  FolderLock(const FolderLock&) = delete;
  FolderLock& operator=(const FolderLock&) = delete;
  ~FolderLock() {
    if (fd_ >= 0) close(fd_);
  }
  // 0, or the errno of the failing step.
  int Acquire() {
    fd_ = open((SchedDir() + "/.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (fd_ < 0) return errno;
    while (flock(fd_, LOCK_EX) != 0) {
      if (errno != EINTR) return errno;
    }
    return 0;
  }

 private:
  int fd_ = -1;
};

// Gives a new entry its id, under the folder lock: one more than the highest
// id ever given (next-id), or than the highest entry present when that is
// more, so that an entry written by hand is never overwritten. Sets the last
// error on failure.
bool AllocateId(int64_t* id) {
  int64_t next = 1;
  std::string text;
  int err = velt_dev::ReadWholeFile(SchedDir() + "/next-id", &text, nullptr);
  if (err == 0) {
    while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
    if (!ParseDecimal(text, std::numeric_limits<int64_t>::max(), &next)) {
      VELT_FAIL(VLIBC_ERR_IO);
      return false;
    }
  } else if (err != ENOENT) {
    VELT_FAIL(VLIBC_ERR_IO);
    return false;
  }
  std::vector<int64_t> ids;
  if (!EntryIds(&ids)) {
    VELT_FAIL(VLIBC_ERR_IO);
    return false;
  }
  if (!ids.empty()) next = std::max(next, ids.back() == INT64_MAX ? INT64_MAX : ids.back() + 1);
  next = std::max<int64_t>(next, 1);
  // next-id is written before the entry: if the entry then fails, its id is
  // skipped, which is harmless, and never given twice.
  if (next == INT64_MAX ||
      !velt_dev::ReplaceFile(SchedDir() + "/next-id", std::to_string(next + 1) + "\n", nullptr)) {
    VELT_FAIL(VLIBC_ERR_IO);
    return false;
  }
  *id = next;
  return true;
}

// Reads a timetable number: a JSON integer or a string of decimal digits,
// as web forms send either.
bool ReadNumber(const Json::Value& schedule, const char* key, int lo, int hi, int* out) {
  if (!schedule.isMember(key)) return false;
  const Json::Value& v = schedule[key];
  int64_t n;
  if (v.type() == Json::intValue || v.type() == Json::uintValue) {
    if (!v.isInt64()) return false;
    n = v.asInt64();
  } else if (v.isString()) {
    if (!ParseDecimal(v.asString(), hi, &n)) return false;
  } else {
    return false;
  }
  if (n < lo || n > hi) return false;
  *out = static_cast<int>(n);
  return true;
}

// "1,3,5": weekdays 0 (Sunday) to 6, with spaces around the numbers allowed.
// An empty (or blank) string chooses no day.
bool ReadWeekdays(const std::string& text, unsigned* days) {
  auto isSpace = [](char c) { return c == ' ' || c == '\t'; };
  *days = 0;
  if (std::all_of(text.begin(), text.end(), isSpace)) return true;
  size_t begin = 0;
  while (true) {
    size_t comma = text.find(',', begin);
    size_t end = comma == std::string::npos ? text.size() : comma;
    size_t first = begin, last = end;
    while (first < last && isSpace(text[first])) ++first;
    while (last > first && isSpace(text[last - 1])) --last;
    int64_t day;
    if (!ParseDecimal(text.substr(first, last - first), 6, &day)) return false;
    *days |= 1u << day;
    if (comma == std::string::npos) return true;
    begin = comma + 1;
  }
}

bool ParseTimetable(const Json::Value& schedule, Timetable* out) {
  if (!schedule.isObject() || !schedule.isMember("week_name") || !schedule["week_name"].isString()) {
    return false;
  }
  Timetable tt;
  if (!ReadWeekdays(schedule["week_name"].asString(), &tt.days) ||
      !ReadNumber(schedule, "hour", 0, 23, &tt.hour) ||
      !ReadNumber(schedule, "min", 0, 59, &tt.min) ||
      !ReadNumber(schedule, "repeat", 0, kMinutesPerDay - 1, &tt.repeat)) {
    return false;
  }
  *out = tt;
  return true;
}

Json::Value EntryToJson(const VELTSCHEDTASK& task, int64_t id) {
  Json::Value doc(Json::objectValue);
  doc["id"] = Json::Int64(id);
  doc["app"] = task.app;
  doc["app_name"] = task.appName;
  doc["name"] = task.name;
  doc["action"] = task.action;
  doc["command"] = task.command;
  doc["enabled"] = task.enabled;
  doc["can_run_app_same_time"] = task.canRunAppSameTime;
  doc["can_run_task_same_time"] = task.canRunTaskSameTime;
  doc["can_run_from_ui"] = task.canRunFromUI;
  doc["owner"] = Json::UInt(task.owner);
  doc["can_edit_name"] = task.canEditName;
  doc["can_edit_owner"] = task.canEditOwner;
  doc["can_delete_from_ui"] = task.canDeleteFromUI;
  doc["listable"] = task.listable;
  doc["schedule"] = task.hasSchedule ? task.schedule : Json::Value(Json::nullValue);
  return doc;
}

// Every key must be there with its type: a file that lacks one was not
// written by a save and is reported rather than guessed at.
bool EntryFromJson(const Json::Value& doc, int64_t id, VELTSCHEDTASK* task) {
  if (!doc.isObject()) return false;
  auto str = [&](const char* key, std::string* out) {
    if (!doc[key].isString()) return false;
    *out = doc[key].asString();
    return true;
  };
  auto flag = [&](const char* key, bool* out) {
    if (!doc[key].isBool()) return false;
    *out = doc[key].asBool();
    return true;
  };
  const Json::Value& idValue = doc["id"];
  const Json::Value& owner = doc["owner"];
  bool integral = idValue.type() == Json::intValue || idValue.type() == Json::uintValue;
  bool ownerIntegral = owner.type() == Json::intValue || owner.type() == Json::uintValue;
  if (!integral || !idValue.isInt64() || idValue.asInt64() != id || !ownerIntegral ||
      !owner.isUInt()) {
    return false;
  }
  task->id = id;
  task->owner = static_cast<uid_t>(owner.asUInt());
  if (!str("app", &task->app) || !str("app_name", &task->appName) || !str("name", &task->name) ||
      !str("action", &task->action) || !str("command", &task->command) ||
      !flag("enabled", &task->enabled) ||
      !flag("can_run_app_same_time", &task->canRunAppSameTime) ||
      !flag("can_run_task_same_time", &task->canRunTaskSameTime) ||
      !flag("can_run_from_ui", &task->canRunFromUI) ||
      !flag("can_edit_name", &task->canEditName) ||
      !flag("can_edit_owner", &task->canEditOwner) ||
      !flag("can_delete_from_ui", &task->canDeleteFromUI) || !flag("listable", &task->listable) ||
      !doc.isMember("schedule")) {
    return false;
  }
  const Json::Value& schedule = doc["schedule"];
  task->hasSchedule = !schedule.isNull();
  if (!task->hasSchedule) return true;
  if (!ParseTimetable(schedule, &task->timetable)) return false;
  task->schedule = schedule;
  return true;
}

// Reads entry id into *task. Returns 0, or the error code: NOT_FOUND for a
// missing entry, IO for one that cannot be read or is malformed.
int ReadEntry(int64_t id, VELTSCHEDTASK* task) {
  Json::Value doc;
  int read = velt_dev::ReadJsonState("scheduler/" + std::to_string(id) + ".json", &doc);
  if (read == 0) return VLIBC_ERR_NOT_FOUND;
  if (read < 0 || !EntryFromJson(doc, id, task)) return VLIBC_ERR_IO;
  return 0;
}

int SaveEntry(VELTSCHEDTASK* task) {
  if (!MakeDir(velt_dev::StateDir()) || !MakeDir(SchedDir())) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  FolderLock lock;
  if (lock.Acquire() != 0) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  int64_t id = task->id;
  if (id < 1) {
    if (!AllocateId(&id)) return -1;
  } else {
    struct stat st;
    if (stat(EntryPath(id).c_str(), &st) != 0) {
      VELT_FAIL(errno == ENOENT ? VLIBC_ERR_NOT_FOUND : VLIBC_ERR_IO);
      return -1;
    }
  }
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "  ";
  std::string text = Json::writeString(writer, EntryToJson(*task, id)) + "\n";
  if (!velt_dev::ReplaceFile(SchedDir() + "/" + std::to_string(id) + ".json", text, nullptr)) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  task->id = id;
  return 0;
}

// "YYYY/MM/DD HH:MM" or "YYYY/MM/DD HH:MM:SS", local time, trailing white
// space allowed.
bool ParseLocalTime(std::string text, time_t* out) {
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r' || text.back() == ' ')) {
    text.pop_back();
  }
  const std::string shape = "dddd/dd/dd dd:dd:dd";
  if (text.size() != 16 && text.size() != 19) return false;
  for (size_t i = 0; i < text.size(); ++i) {
    if (shape[i] == 'd' ? !IsDigit(text[i]) : text[i] != shape[i]) return false;
  }
  auto num = [&](size_t pos, size_t len) { return std::stoi(text.substr(pos, len)); };
  struct tm tm = {};
  int year = num(0, 4), mon = num(5, 2), mday = num(8, 2);
  tm.tm_hour = num(11, 2);
  tm.tm_min = num(14, 2);
  tm.tm_sec = text.size() == 19 ? num(17, 2) : 0;
  static const int kDays[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
  if (mon < 1 || mon > 12 || mday < 1 || mday > kDays[mon - 1] ||
      (mon == 2 && mday == 29 && !leap) || tm.tm_hour > 23 || tm.tm_min > 59 || tm.tm_sec > 59) {
    return false;
  }
  tm.tm_year = year - 1900;
  tm.tm_mon = mon - 1;
  tm.tm_mday = mday;
  tm.tm_isdst = -1;
  *out = mktime(&tm);
  return true;
}

// The time that stands for now: velt-dev/sched-now when it exists, so that
// tests and demos get fixed answers, else the clock. False when that file
// cannot be read or holds anything else: a wrong answer from the real clock
// would hide the mistake.
bool Now(time_t* now) {
  std::string text;
  int err = velt_dev::ReadWholeFile(velt_dev::StateDir() + "/sched-now", &text, nullptr);
  if (err == ENOENT) {
    *now = time(nullptr);
    return true;
  }
  return err == 0 && ParseLocalTime(text, now);
}

// The earliest run strictly after now, today or on one of the next 7 days
// (the 7th is today's weekday again). Each candidate is a wall-clock time
// resolved by mktime on its own, with tm_isdst = -1, so that a day after a
// DST change gets that day's offset and not today's.
bool NextRun(const Timetable& tt, time_t now, time_t* next) {
  struct tm today;
  if (!localtime_r(&now, &today)) return false;
  for (int d = 0; d <= 7; ++d) {
    struct tm day = {};
    day.tm_year = today.tm_year;
    day.tm_mon = today.tm_mon;
    day.tm_mday = today.tm_mday + d;  // mktime carries it into the next month and year
    day.tm_hour = 12;
    day.tm_isdst = -1;
    mktime(&day);
    if (!(tt.days & (1u << day.tm_wday))) continue;
    bool found = false;
    time_t best = 0;
    for (int m = tt.hour * 60 + tt.min; m < kMinutesPerDay; m += tt.repeat) {
      struct tm run = {};
      run.tm_year = day.tm_year;
      run.tm_mon = day.tm_mon;
      run.tm_mday = day.tm_mday;
      run.tm_hour = m / 60;
      run.tm_min = m % 60;
      run.tm_isdst = -1;
      time_t t = mktime(&run);
      // Around a DST change wall-clock order and time order may differ, so
      // the whole day is looked at rather than the first run after now.
      if (t > now && (!found || t < best)) {
        best = t;
        found = true;
      }
      if (tt.repeat == 0) break;
    }
    if (found) {
      *next = best;
      return true;
    }
  }
  return false;
}

int BadParameter() {
  VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
  return -1;
}

int SetString(PVELTSCHEDTASK task, const char* value, std::string VELTSCHEDTASK::*field) {
  if (!task || !value) return BadParameter();
  return Guarded(-1, [&] {
    task->*field = value;
    return 0;
  });
}

int SetFlag(PVELTSCHEDTASK task, int value, bool VELTSCHEDTASK::*field) {
  if (!task) return BadParameter();
  task->*field = value != 0;
  return 0;
}

}  // namespace

PVELTSCHEDTASK VELTSchedTaskAlloc(void) {
  if (VELT_FAULT_HIT()) return nullptr;
  auto* task = new (std::nothrow) VELTSCHEDTASK;
  if (!task) VELT_FAIL(VLIBC_ERR_NO_MEMORY);
  return task;
}

void VELTSchedTaskFree(PVELTSCHEDTASK task) { delete task; }

int VELTSchedTaskLoad(int64_t id, PVELTSCHEDTASK task) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task || id < 1) return BadParameter();
  return Guarded(-1, [&] {
    VELTSCHEDTASK loaded;
    int code = ReadEntry(id, &loaded);
    if (code != 0) {
      VELT_FAIL(code);
      return -1;
    }
    *task = std::move(loaded);
    return 0;
  });
}

int VELTSchedTaskSave(PVELTSCHEDTASK task) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task) return BadParameter();
  return Guarded(-1, [&] { return SaveEntry(task); });
}

int VELTSchedTaskRemove(int64_t id) {
  if (VELT_FAULT_HIT()) return -1;
  if (id < 1) return BadParameter();
  return Guarded(-1, [&] {
    FolderLock lock;
    int err = lock.Acquire();
    if (err == 0 && unlink(EntryPath(id).c_str()) != 0) err = errno;
    if (err != 0) {
      // ENOENT from the lock: no folder, so no entry either.
      VELT_FAIL(err == ENOENT ? VLIBC_ERR_NOT_FOUND : VLIBC_ERR_IO);
      return -1;
    }
    return 0;
  });
}

int VELTSchedTaskListGet(PVELTSCHEDTASKLIST* list, VELTSchedTaskFilter filter) {
  if (list) *list = nullptr;
  if (VELT_FAULT_HIT()) return -1;
  if (!list) return BadParameter();
  return Guarded(-1, [&] {
    std::vector<int64_t> ids;
    if (!EntryIds(&ids)) {
      VELT_FAIL(VLIBC_ERR_IO);
      return -1;
    }
    auto result = std::make_unique<VELTSCHEDTASKLIST>();
    for (int64_t id : ids) {
      auto task = std::make_unique<VELTSCHEDTASK>();
      int code = ReadEntry(id, task.get());
      if (code == VLIBC_ERR_NOT_FOUND) continue;  // removed since the folder was read
      // A damaged entry fails the whole list: skipping it would let the
      // caller believe the entry is gone and create a second one.
      if (code != 0) {
        VELT_FAIL(code);
        return -1;
      }
      if (!filter || filter(task.get())) result->tasks.push_back(std::move(task));
    }
    *list = result.release();
    return 0;
  });
}

PVELTSCHEDTASK VELTSchedTaskNext(PVELTSCHEDTASKLIST list) {
  if (VELT_FAULT_HIT()) return nullptr;
  if (!list) {
    BadParameter();
    return nullptr;
  }
  if (list->next >= list->tasks.size()) return nullptr;
  return list->tasks[list->next++].get();
}

void VELTSchedTaskListFree(PVELTSCHEDTASKLIST list) { delete list; }

bool VELTSchedTaskIsEnabled(const VELTSCHEDTASK* task) {
  if (VELT_FAULT_HIT()) return false;
  return task && task->enabled;
}

bool VELTSchedTaskIsListable(const VELTSCHEDTASK* task) {
  if (VELT_FAULT_HIT()) return false;
  return task && task->listable;
}

int VELTSchedTaskConvertFromJson_Schedule(const Json::Value& json, PVELTSCHEDTASK task) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task) return BadParameter();
  return Guarded(-1, [&] {
    Timetable tt;
    if (!json.isObject() || !json.isMember("schedule") || !ParseTimetable(json["schedule"], &tt)) {
      return BadParameter();
    }
    // Copied first: if the copy runs out of memory the object is untouched.
    Json::Value schedule = json["schedule"];
    task->schedule.swap(schedule);
    task->timetable = tt;
    task->hasSchedule = true;
    return 0;
  });
}

std::string VELTSchedTaskGetNextTriggerTime(const VELTSCHEDTASK* task) {
  if (VELT_FAULT_HIT()) return "";
  if (!task) {
    BadParameter();
    return "";
  }
  return Guarded(std::string(), [&]() -> std::string {
    if (!task->hasSchedule || task->timetable.days == 0) return "";
    // mktime reads TZ itself but localtime_r may not; both must agree.
    tzset();
    time_t now, next;
    if (!Now(&now)) {
      VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
      return "";
    }
    struct tm local;
    char text[32];
    if (!NextRun(task->timetable, now, &next) || !localtime_r(&next, &local) ||
        strftime(text, sizeof text, "%Y/%m/%d %H:%M", &local) == 0) {
      return "";
    }
    return text;
  });
}

int VELTSchedCTaskSetApp(PVELTSCHEDTASK task, const char* app) {
  if (VELT_FAULT_HIT()) return -1;
  return SetString(task, app, &VELTSCHEDTASK::app);
}

int VELTSchedCTaskSetAppName(PVELTSCHEDTASK task, const char* appName) {
  if (VELT_FAULT_HIT()) return -1;
  return SetString(task, appName, &VELTSCHEDTASK::appName);
}

int VELTSchedCTaskSetName(PVELTSCHEDTASK task, const char* name) {
  if (VELT_FAULT_HIT()) return -1;
  return SetString(task, name, &VELTSCHEDTASK::name);
}

int VELTSchedCTaskSetAction(PVELTSCHEDTASK task, const char* action) {
  if (VELT_FAULT_HIT()) return -1;
  return SetString(task, action, &VELTSCHEDTASK::action);
}

int VELTSchedCTaskSetCommand(PVELTSCHEDTASK task, const char* command) {
  if (VELT_FAULT_HIT()) return -1;
  return SetString(task, command, &VELTSCHEDTASK::command);
}

int VELTSchedCTaskSetState(PVELTSCHEDTASK task, int enabled) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, enabled, &VELTSCHEDTASK::enabled);
}

int VELTSchedCTaskSetCanRunAppSameTime(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canRunAppSameTime);
}

int VELTSchedCTaskSetCanRunTaskSameTime(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canRunTaskSameTime);
}

int VELTSchedCTaskSetCanRunFromUI(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canRunFromUI);
}

int VELTSchedCTaskSetOwner(PVELTSCHEDTASK task, uid_t owner) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task) return BadParameter();
  task->owner = owner;
  return 0;
}

int VELTSchedCTaskSetCanEditName(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canEditName);
}

int VELTSchedCTaskSetCanEditOwner(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canEditOwner);
}

int VELTSchedCTaskSetCanDeleteFromUI(PVELTSCHEDTASK task, int allowed) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, allowed, &VELTSCHEDTASK::canDeleteFromUI);
}

int VELTSchedCTaskSetListable(PVELTSCHEDTASK task, int listable) {
  if (VELT_FAULT_HIT()) return -1;
  return SetFlag(task, listable, &VELTSCHEDTASK::listable);
}

int VELTSchedCTaskGetApp(const VELTSCHEDTASK* task, std::string& app) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task) return BadParameter();
  if (task->app.empty()) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
    return -1;
  }
  return Guarded(-1, [&] {
    app = task->app;
    return 0;
  });
}

int VELTSchedCTaskGetID(const VELTSCHEDTASK* task, int64_t* id) {
  if (VELT_FAULT_HIT()) return -1;
  if (!task || !id) return BadParameter();
  if (task->id < 1) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
    return -1;
  }
  *id = task->id;
  return 0;
}
