#include "webapi/plovo.h"

#include <algorithm>
#include <vector>

#include "common/log.h"
#include "common/no-throw.h"
#include "common/run-as.h"
#include "ipc/pobject.h"
#include "service/service-ctrl.h"
#include "webapi/methods.h"

void Process(VELT::APIRequest* request, VELT::APIResponse* response) {
  const bool done = Plovo::NoThrow(
      [&] {
        PlovoHandle handle(request, response);
        handle.Process();
        return true;
      },
      false);
  if (!done) response->SetError(401);
}

PlovoHandle::PlovoHandle(VELT::APIRequest* request, VELT::APIResponse* response)
    : request(request), response(response) {}

PlovoHandle::~PlovoHandle() = default;

void PlovoHandle::Process() {
  if (!IsPlovoReady()) return;
  if (!IsPermissionAllow()) return;
  HandleAction();
}

bool PlovoHandle::IsPermissionAllow() { return true; }

bool PlovoHandle::IsPlovoReady() {
  ServiceStatus status;
  {
    PLOVO_RUN_AS_ROOT(runAs);
    if (!runAs.ok()) {
      PLOVO_LOG(LOG_ERR, "Failed to run as root");
      response->SetError(401);
      return false;
    }
    if (GetServiceStatus(status) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to get service status");
      response->SetError(401);
      return false;
    }
  }

  switch (status.state) {
    case PLOVO_SERVICE_STATUS_RUNNING:
      return true;
    case PLOVO_SERVICE_STATUS_NO_REPO: {
      // Without a repository the user can still choose its volume.
      const std::string method = request->GetAPIMethod();
      if (method == "get_global_setting" || method == "set_global_setting") return true;
      response->SetError(404);
      return false;
    }
    case PLOVO_SERVICE_STATUS_INIT:
      response->SetError(405);
      return false;
    case PLOVO_SERVICE_STATUS_UPGRADING:
      response->SetError(406);
      return false;
    case PLOVO_SERVICE_STATUS_MOVING_REPO:
      response->SetError(407);
      return false;
    default:
      if (!status.error.empty()) {
        PLOVO_LOG(LOG_ERR, "Plovo service errors '%s'", status.error.c_str());
      }
      response->SetError(status.error == "err_upgrade_failed" ? 415 : 401);
      return false;
  }
}

void PlovoHandle::HandleAction() {
  struct ActionRow {
    const char* method;
    void (PlovoHandle::*action)();
  };
#define PLOVO_ACTION_ROW(method, action) {method, &PlovoHandle::action},
  static const ActionRow kActions[] = {
      PLOVO_METHODS(PLOVO_ACTION_ROW)
      {nullptr, nullptr},
  };
#undef PLOVO_ACTION_ROW

  const std::string method = request->GetAPIMethod();
  for (const ActionRow* row = kActions; row->action != nullptr; ++row) {
    if (method == row->method) {
      if (HasZeroByte(request->GetParams())) {
        PLOVO_LOG(LOG_ERR, "A parameter of '%s' holds a zero byte", method.c_str());
        response->SetError(402);
        return;
      }
      (this->*(row->action))();
      return;
    }
  }
  PLOVO_LOG(LOG_ERR, "Unknown action '%s'", method.c_str());
  response->SetError(401, Json::Value("Unknown request"));
}

int GetErrorCodeFromResponse(const PObject& reply) {
  if (!reply.hasMember("error_code")) {
    PLOVO_LOG(LOG_ERR, "no error_code!!!");
    return 401;
  }
  switch (reply["error_code"].asInt32()) {
    case 3:
      return 403;
    case 9:
      return 410;
    case 10:
      return 413;
    default:
      return 401;
  }
}

namespace {

// Finds the path component that starts at the first character at or after
// pos that is not '/'. Returns the position just past it (a '/' or the
// end); the component is empty when only slashes remain.
size_t NextPathComponent(const std::string& path, size_t pos, std::string& component) {
  const size_t begin = path.find_first_not_of('/', pos);
  if (begin == std::string::npos) {
    component.clear();
    return path.size();
  }
  size_t end = path.find('/', begin);
  if (end == std::string::npos) end = path.size();
  component.assign(path, begin, end - begin);
  return end;
}

}  // namespace

bool IsSafePath(const std::string& path) {
  std::string component;
  size_t pos = 0;
  while (pos < path.size()) {
    pos = NextPathComponent(path, pos, component);
    if (component.empty()) break;
    if (component == "." || component == ".." ||
        component.find_first_of(":/") != std::string::npos) {
      return false;
    }
  }
  return true;
}

bool IsSafeShareName(const std::string& name) {
  return !name.empty() && name != "." && name != ".." && name.find_first_of(std::string("/\0", 2)) == std::string::npos;
}

bool HasZeroByte(const Json::Value& params) {
  // A loop over an explicit list rather than recursion: the depth of the
  // parameters is the client's choice.
  std::vector<const Json::Value*> pending{&params};
  while (!pending.empty()) {
    const Json::Value& value = *pending.back();
    pending.pop_back();
    if (value.isString()) {
      const char* begin = nullptr;
      const char* end = nullptr;
      if (value.getString(&begin, &end) && std::find(begin, end, '\0') != end) return true;
    } else if (value.isObject()) {
      for (auto it = value.begin(); it != value.end(); ++it) {
        if (it.name().find('\0') != std::string::npos) return true;
        pending.push_back(&*it);
      }
    } else if (value.isArray()) {
      for (const Json::Value& element : value) pending.push_back(&element);
    }
  }
  return false;
}
