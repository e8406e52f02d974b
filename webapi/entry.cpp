// The method table, the one part of the module that only the web server
// reads: tests reach it by loading the built module.
#include "webapi/plovo.h"

namespace {

constexpr const char* kApi = "VELT.Plovo";

const VELT::APIDesc gTable[] = {
    {kApi, 1, "list", Process},
    {kApi, 1, "create", Process},
    {kApi, 1, "get", Process},
    {kApi, 1, "get_filter", Process},
    {kApi, 1, "set_setting", Process},
    {kApi, 1, "set_trigger_time", Process},
    {kApi, 1, "set_filter", Process},
    {kApi, 1, "delete", Process},
    {kApi, 1, "run", Process},
    {kApi, 1, "cancel", Process},
    {kApi, 1, "enable", Process},
    {kApi, 1, "disable", Process},
    {kApi, 1, "get_global_setting", Process},
    {kApi, 1, "set_global_setting", Process},
    {kApi, 1, "get_log_list", Process},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

const VELT::APIDesc* GetAPITable(void) { return gTable; }
