// The web-API front end: the module's entry points and the per-request
// handler.
//
// The web server calls GetAPITable once and then Process once per request of
// the API "VELT.Plovo". Process builds a PlovoHandle on its stack around the
// server's request and response (owned by the server), lets it pass the
// readiness gate and dispatches the method name to one action. Every
// request ends in exactly one SetSuccess or SetError on the response. The
// module keeps no state between requests; Process may run on several server
// threads at once.
#ifndef PLOVO_WEBAPI_PLOVO_H
#define PLOVO_WEBAPI_PLOVO_H

#include <velt/webapi.h>

#include <json/value.h>

#include <cstdint>
#include <initializer_list>
#include <string>
#include <vector>

#include "common/export.h"
#include "common/registry.h"

class PObject;

namespace Plovo {
struct TaskSetting;
struct TriggerTimeSetting;
struct FilterSetting;
}  // namespace Plovo

// The method table: 15 rows of {"VELT.Plovo", 1, method, Process}, closed by
// a row whose api is null. Lives for the whole process.
PLOVO_EXPORT const VELT::APIDesc* GetAPITable(void);

// Answers one request. Never throws.
PLOVO_EXPORT void Process(VELT::APIRequest* request, VELT::APIResponse* response);

class PlovoHandle {
 public:
  PlovoHandle(VELT::APIRequest* request, VELT::APIResponse* response);
  ~PlovoHandle();
  PlovoHandle(const PlovoHandle&) = delete;
  PlovoHandle& operator=(const PlovoHandle&) = delete;

  // Gate, permission check, then the action.
  void Process();

  // True when the service state lets this method run. Otherwise the
  // response already holds the error: 404 (state 1 and not a global-setting
  // method), 405 (2), 406 (3), 407 (5), 415 (error "err_upgrade_failed"),
  // 401 (any other state, or the state cannot be read as root).
  bool IsPlovoReady();
  // Always true: the web server has checked the user before the module.
  bool IsPermissionAllow();
  // Runs the action named by the request's method (exact, case-sensitive
  // match), or answers 401 "Unknown request". A request whose parameters
  // hold a string with a zero byte answers 402 before the action looks at
  // any of them.
  void HandleAction();

  // The task enumerations as the web API carries them.
  static const std::string TYPE_IMPORT;              // "import_general"
  static const std::string TYPE_EXPORT;              // "export_general"
  static const std::string TYPE_IMPORT_PHOTO;        // "import_photo"
  static const std::string STRATEGY_VERSION;         // "versioning"
  static const std::string STRATEGY_MIRROR;          // "mirror"
  static const std::string STRATEGY_INCBKP;          // "incremental"
  static const std::string CONFLICT_RENAME;          // "rename"
  static const std::string CONFLICT_OVERWRITE;       // "overwrite"
  static const std::string ROTATION_OLDEST_VERSION;  // "oldest_version"
  static const std::string ROTATION_SMART_RECYCLE;   // "smart_recycle"

  // String to number and back, exact and case-sensitive: an unknown string
  // gives 0, an unknown number "".
  static Registry::TASK_TYPE convertToEnumTT(const std::string& value);
  static std::string convertToStringTT(Registry::TASK_TYPE value);
  static Registry::COPY_STRATEGY convertToEnumCS(const std::string& value);
  static std::string convertToStringCS(Registry::COPY_STRATEGY value);
  static Registry::CONFLICT_POLICY convertToEnumCP(const std::string& value);
  static std::string convertToStringCP(Registry::CONFLICT_POLICY value);
  static Registry::ROTATION_POLICY convertToEnumRP(const std::string& value);
  static std::string convertToStringRP(Registry::ROTATION_POLICY value);

  // A JSON array of the values read as strings, in order; [] when empty.
  static Json::Value convertToJsonArray(const std::vector<PObject>& values);

  // The web interface's record of the daemon's task map: enumerations as
  // strings, device paths shown as "/<share>..." or "[USB]...", and the
  // next run time of the task's schedule ("N/A" without one).
  void setJsonTask(const PObject& task, Json::Value& out);

  // Request JSON to settings records. setUCSetting answers false, after a
  // log line, for an unknown type or an empty path; for an existing task
  // (isCreate false) the device share and the copy strategy are not
  // stored, but the requested strategy still picks the keys read; keys it
  // does not read keep the record's defaults. A key that is read but
  // missing counts as JSON's default (false, 0, ""); one of the wrong type
  // (a string where a flag belongs) answers false.
  bool setUCSetting(const Json::Value& json, bool isCreate, Plovo::TaskSetting& out);
  bool setUCTriggerTime(const Json::Value& json, Plovo::TriggerTimeSetting& out);
  bool setUCFilter(const Json::Value& json, Plovo::FilterSetting& out);

 private:
  // The actions, one per method of the table.
  void List();
  void Create();
  void Get();
  void GetFilter();
  void SetSetting();
  void SetTriggerTime();
  void SetFilter();
  void Delete();
  void Run();
  void Cancel();
  void Enable();
  void Disable();
  void GetGlobalSetting();
  void SetGlobalSetting();
  void GetLogList();

  // Reads the request's task "id" (402 when it is missing or not an
  // unsigned integer), builds the command with build and forwards it (see
  // Forward). True when the reply is there to be read.
  bool ForwardTaskIdCmd(int (*build)(unsigned long, PObject&), PObject& reply, const char* what,
                        std::initializer_list<int32_t> okCodes = {}, const char* file = __builtin_FILE(),
                        int line = __builtin_LINE());
  // ForwardTaskIdCmd answered with null data on success. Delete, Run,
  // Enable, Disable and Cancel are this with their builder.
  void SendTaskIdCmd(int (*build)(unsigned long, PObject&), std::initializer_list<int32_t> okCodes = {},
                     const char* file = __builtin_FILE(), int line = __builtin_LINE());
  // Sends command and reads the reply. A failure whose "error_code" is in
  // okCodes counts as success. Otherwise logs "Failed to send <what>
  // command, res=[<reply>]" under the calling action's file and line, and
  // returns the web error code for the reply; 0 on success.
  static int SendToDaemon(const PObject& command, PObject& reply, const char* what,
                          std::initializer_list<int32_t> okCodes = {},
                          const char* file = __builtin_FILE(), int line = __builtin_LINE());
  // The common road of a forwarding action: built is the builder's result.
  // A failed build answers 401 ("Failed to get daemon command"), a failed
  // exchange the reply's code; both are logged under the caller's line.
  // True when the reply is there to be read.
  bool Forward(int built, const PObject& command, PObject& reply, const char* what,
               std::initializer_list<int32_t> okCodes = {}, const char* file = __builtin_FILE(),
               int line = __builtin_LINE());
  // The next trigger time of an enabled schedule; "N/A" for the id -1, an
  // entry that cannot be loaded, or a disabled one.
  static std::string GetNextRunTime(int64_t scheduleId);

  VELT::APIRequest* request;
  VELT::APIResponse* response;
};

// The web error code for a failed daemon command, from the daemon's reply:
// "error_code" 3 is 403, 9 is 410, 10 is 413; any other code, or none, 401.
int GetErrorCodeFromResponse(const PObject& reply);

// False when a component of path (between '/' characters) is ".", ".." or
// holds a ':'. Empty components, and so the empty path, are safe.
bool IsSafePath(const std::string& path);

// False for a share name that could name anything but one share: empty,
// "." or "..", or holding a '/' or a zero byte.
bool IsSafeShareName(const std::string& name);

// True when a string of params, a value or a member name at any depth,
// holds a zero byte. Such a string would be cut short wherever it travels
// as a C string (the daemon ends received strings at their first zero
// byte), so that what the checks saw is not what is used.
bool HasZeroByte(const Json::Value& params);

#endif
