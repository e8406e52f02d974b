// The module's methods, in table order, as one list of (method, action):
// the exported method table and the dispatch table of PlovoHandle are both
// made from it, so that the two cannot drift apart.
//
//   #define ROW(method, action) ...
//   PLOVO_METHODS(ROW)
#ifndef PLOVO_WEBAPI_METHODS_H
#define PLOVO_WEBAPI_METHODS_H

#define PLOVO_METHODS(ROW)                       \
  ROW("list", List)                              \
  ROW("create", Create)                          \
  ROW("get", Get)                                \
  ROW("get_filter", GetFilter)                   \
  ROW("set_setting", SetSetting)                 \
  ROW("set_trigger_time", SetTriggerTime)        \
  ROW("set_filter", SetFilter)                   \
  ROW("delete", Delete)                          \
  ROW("run", Run)                                \
  ROW("cancel", Cancel)                          \
  ROW("enable", Enable)                          \
  ROW("disable", Disable)                        \
  ROW("get_global_setting", GetGlobalSetting)    \
  ROW("set_global_setting", SetGlobalSetting)    \
  ROW("get_log_list", GetLogList)

#endif
