// Methods of the table whose actions are not built yet. Each answers 401 so
// that a client sees a clear failure rather than no answer; the actions
// move to their own sources as they are built.
#include "common/log.h"
#include "webapi/plovo.h"

void PlovoHandle::NotAvailableYet() {
  PLOVO_LOG(LOG_ERR, "Method '%s' is not available yet", request->GetAPIMethod().c_str());
  response->SetError(401);
}

void PlovoHandle::List() { NotAvailableYet(); }
void PlovoHandle::Create() { NotAvailableYet(); }
void PlovoHandle::Get() { NotAvailableYet(); }
void PlovoHandle::GetFilter() { NotAvailableYet(); }
void PlovoHandle::SetSetting() { NotAvailableYet(); }
void PlovoHandle::SetTriggerTime() { NotAvailableYet(); }
void PlovoHandle::SetFilter() { NotAvailableYet(); }
void PlovoHandle::Delete() { NotAvailableYet(); }
void PlovoHandle::Run() { NotAvailableYet(); }
void PlovoHandle::Cancel() { NotAvailableYet(); }
void PlovoHandle::Enable() { NotAvailableYet(); }
void PlovoHandle::Disable() { NotAvailableYet(); }
void PlovoHandle::GetGlobalSetting() { NotAvailableYet(); }
void PlovoHandle::SetGlobalSetting() { NotAvailableYet(); }
void PlovoHandle::GetLogList() { NotAvailableYet(); }
