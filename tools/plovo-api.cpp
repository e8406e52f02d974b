// plovo-api: the command-line host of the web-API module.
//
//   plovo-api [--debug] [--module PATH] METHOD [PARAMS_JSON]
//
// Loads the module the way the web server does (dlopen, GetAPITable, then
// Process for one request) and prints the answer as one line of JSON:
//   {"success":true,"data":...}
//   {"success":false,"error":{"code":N,"data":...}}
// A request the module leaves unanswered prints error code 100. Exit status:
// 0 success, 1 an error answer, 2 a usage or loading error. The module's
// log lines go to syslog and, for whoever runs this by hand, to stderr; as
// on a server, debug lines are left out unless --debug is given.
#include <dlfcn.h>
#include <json/json.h>
#include <syslog.h>
#include <unistd.h>
#include <velt/webapi.h>

#include <cstring>
#include <exception>
#include <iostream>
#include <memory>
#include <sstream>
#include <string>

#include "module-path.h"

namespace {

constexpr const char* kApiName = "VELT.Plovo";
constexpr int kUnanswered = 100;
// The parser recurses once per level; past this depth it refuses the text
// instead of running deep into the stack. Well above the request's own
// bound (VELT::kMaxParamDepth), so that the module's answer to parameters
// nested too deeply can be seen from here.
constexpr int kParamsStackLimit = 256;

int Usage(const std::string& why) {
  std::cerr << "plovo-api: " << why << "\n"
            << "usage: plovo-api [--debug] [--module PATH] METHOD [PARAMS_JSON]\n";
  return 2;
}

// Parses the PARAMS_JSON argument; false, with the reason in *why, when it
// is not a JSON object the reader accepts.
bool ParseParams(const char* text, Json::Value* params, std::string* why) {
  Json::CharReaderBuilder reader;
  Json::CharReaderBuilder::strictMode(&reader.settings_);
  reader["stackLimit"] = kParamsStackLimit;
  std::istringstream in(text);
  try {
    if (!Json::parseFromStream(reader, in, params, why)) return false;
  } catch (const std::exception& e) {  // the reader throws past its stack limit
    *why = e.what();
    return false;
  }
  if (params->isObject()) return true;
  *why = "not an object";
  return false;
}

std::string Compact(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

}  // namespace

int main(int argc, char** argv) {
  std::string modulePath = DefaultModulePath();
  int arg = 1;
  bool debug = false;
  if (arg < argc && std::strcmp(argv[arg], "--debug") == 0) {
    debug = true;
    ++arg;
  }
  if (arg < argc && std::strcmp(argv[arg], "--module") == 0) {
    if (arg + 1 >= argc) return Usage("--module needs a path");
    modulePath = argv[arg + 1];
    arg += 2;
  }
  if (arg >= argc) return Usage("no method given");
  const std::string method = argv[arg++];
  Json::Value params(Json::objectValue);
  if (arg < argc) {
    std::string why;
    if (!ParseParams(argv[arg++], &params, &why)) {
      while (!why.empty() && why.back() == '\n') why.pop_back();
      return Usage("PARAMS_JSON must be a JSON object: " + why);
    }
  }
  if (arg < argc) return Usage("too many arguments");

  openlog("plovo-api", LOG_PERROR, LOG_USER);
  setlogmask(LOG_UPTO(debug ? LOG_DEBUG : LOG_INFO));
  void* module = dlopen(modulePath.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (module == nullptr) {
    std::cerr << "plovo-api: cannot load module: " << dlerror() << "\n";
    return 2;
  }
  using GetTableFn = const VELT::APIDesc* (*)();
  auto getTable = reinterpret_cast<GetTableFn>(dlsym(module, "GetAPITable"));
  auto process = reinterpret_cast<VELT::APIHandler>(dlsym(module, "Process"));
  if (getTable == nullptr || process == nullptr) {
    std::cerr << "plovo-api: " << modulePath << " lacks GetAPITable or Process\n";
    return 2;
  }

  // A listed method goes to its row's handler; any other name still goes to
  // the module's Process so that its own answer to an unknown method shows.
  VELT::APIHandler handler = process;
  int version = 1;
  for (const VELT::APIDesc* row = getTable(); row != nullptr && row->api != nullptr; ++row) {
    if (std::strcmp(row->api, kApiName) == 0 && method == row->method) {
      handler = row->handler;
      version = row->version;
      break;
    }
  }

  VELT::APIRequest request(kApiName, version, method, params);
  VELT::APIResponse response;
  handler(&request, &response);

  // A module answers each request once; say so when it did not.
  if (response.AnswerCount() > 1) {
    std::cerr << "plovo-api: the module answered " << response.AnswerCount()
              << " times; the last answer counts\n";
  }
  // Written by hand: the JSON library would sort "data" before "success".
  if (response.AnswerCount() > 0 && response.IsSuccess()) {
    std::cout << "{\"success\":true,\"data\":" << Compact(response.GetData()) << "}" << std::endl;
    return 0;
  }
  const bool answered = response.AnswerCount() > 0;
  std::cout << "{\"success\":false,\"error\":{\"code\":"
            << (answered ? response.GetErrorCode() : kUnanswered)
            << ",\"data\":" << Compact(answered ? response.GetData() : Json::Value()) << "}}"
            << std::endl;
  return 1;
}
