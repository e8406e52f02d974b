// Where the tools that host the module find it by default.
#ifndef PLOVO_TOOLS_MODULE_PATH_H
#define PLOVO_TOOLS_MODULE_PATH_H

#include <unistd.h>

#include <string>

// The module installed beside the running program:
// <bin>/../lib/libplovo-webapi.so.
inline std::string DefaultModulePath() {
  char self[4096];
  ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
  if (n <= 0) return "libplovo-webapi.so";
  std::string dir(self, static_cast<size_t>(n));
  dir.erase(dir.rfind('/'));
  return dir + "/../lib/libplovo-webapi.so";
}

#endif
