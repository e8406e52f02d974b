// Methods of the table whose actions are not built yet. Each answers 401 so
// that a client sees a clear failure rather than no answer; the actions
// move to their own sources as they are built.
#include "common/log.h"
#include "webapi/plovo.h"

void PlovoHandle::NotAvailableYet(const char* action) {
  PLOVO_LOG(LOG_ERR, "Action %s is not available yet", action);
  response->SetError(401);
}

void PlovoHandle::GetGlobalSetting() { NotAvailableYet(__func__); }
void PlovoHandle::SetGlobalSetting() { NotAvailableYet(__func__); }
