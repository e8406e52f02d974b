// The method table, the one part of the module that only the web server
// reads: tests reach it by loading the built module.
#include "webapi/methods.h"
#include "webapi/plovo.h"

namespace {

constexpr const char* kApi = "VELT.Plovo";

#define PLOVO_TABLE_ROW(method, action) {kApi, 1, method, Process},
const VELT::APIDesc gTable[] = {
    PLOVO_METHODS(PLOVO_TABLE_ROW)
    {nullptr, 0, nullptr, nullptr},
};
#undef PLOVO_TABLE_ROW

}  // namespace

const VELT::APIDesc* GetAPITable(void) { return gTable; }
