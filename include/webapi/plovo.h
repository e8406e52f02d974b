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

#include <string>

#include "common/export.h"

class PObject;

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
  // match), or answers 401 "Unknown request".
  void HandleAction();

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

  // Answer of a method whose action has not been built yet: 401, and a log
  // line naming the action.
  void NotAvailableYet(const char* action);

  VELT::APIRequest* request;
  VELT::APIResponse* response;
};

// The web error code for a failed daemon command, from the daemon's reply:
// "error_code" 3 is 403, 9 is 410, 10 is 413; any other code, or none, 401.
int GetErrorCodeFromResponse(const PObject& reply);

// False when a component of path (between '/' characters) is ".", ".." or
// holds a ':'. Empty components, and so the empty path, are safe.
bool IsSafePath(const std::string& path);

#endif
