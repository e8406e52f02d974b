#include "ipc/error-code.h"

#include <iterator>

namespace {

const char* const kErrorTexts[] = {
    "Successful",
    "Interrupted",
    "I/O error",
    "System error",
    "Invalid argument",
    "Connection timeout",
    "SSL certificate verify fail",
    "Process stopped",
    "Ignore this error",
    "No permission",
    "File operation error",
    "File size too large",
    "File name not support",
    "Share not mounted",
    "Resume failed",
    "Source file is miss",
    "Destination file exists",
    "Destination file conflict",
    "Destination file type conflict",
    "Destination quota full",
    "Destination root folder is miss",
    "Destination parent folder is miss",
    "Source root folder is miss",
    "Wait for notify events",
    "Version folder conflict",
    "Task info not found",
};

}  // namespace

const char* PErrorText(int code) {
  // Compared as a negation in 64 bits so that INT_MIN cannot overflow.
  long long index = -static_cast<long long>(code);
  if (index < 0 || index >= static_cast<long long>(std::size(kErrorTexts))) return "Unknown error";
  return kErrorTexts[index];
}
