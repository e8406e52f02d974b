// plovo-filter: shows how a task's filter file reads and what it does to a
// path, for a support engineer asking why a file was or was not copied.
//
//   plovo-filter print black|white FILE
//     Parses FILE with the list's schema (the parser's warnings and errors
//     go where it prints them) and, when it reads (0 or 1), prints the
//     record back on stdout. Exit status: the parse result, 0, 1 or 2.
//   plovo-filter test black|white FILE PATH [--dir]
//     Parses FILE (exit 2 when it does not read), then prints the result of
//     the black-list path test or the white-list test for PATH (a folder
//     with --dir) as one decimal line, and exits 0.
//
// Wrong usage prints the usage line on stderr and exits 64. When standard
// output cannot be written (a full disk, a closed pipe), a message goes to
// stderr and the exit status is 74, whatever the parse result.
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "filter/filter-match.h"
#include "filter/filter.h"

namespace {

constexpr int kUsageStatus = 64;
constexpr int kOutputErrorStatus = 74;

// status, or kOutputErrorStatus when what went to stdout did not all get out.
int Flushed(bool printed, int status) {
  if (printed && fflush(stdout) == 0 && !ferror(stdout)) return status;
  fprintf(stderr, "plovo-filter: cannot write to standard output: %s\n", strerror(errno));
  return kOutputErrorStatus;
}

int Usage() {
  fputs("usage: plovo-filter print black|white FILE | plovo-filter test black|white FILE PATH [--dir]\n", stderr);
  return kUsageStatus;
}

int Print(bool black, const char* file) {
  int result = 0;
  bool printed = true;
  if (black) {
    black_list_filter filter;
    filter_init(&filter);
    result = filter_read(file, &filter);
    if (result != 2) printed = filter_print(stdout, &filter) == 0;
    filter_destroy(&filter);
  } else {
    white_list list;
    white_list_init(&list);
    result = white_list_read(file, &list);
    if (result != 2) printed = white_list_print(stdout, &list) == 0;
    white_list_destroy(&list);
  }
  return Flushed(printed, result);
}

int Test(bool black, const char* file, const char* path, bool isDirectory) {
  int result = 0;
  if (black) {
    black_list_filter filter;
    filter_init(&filter);
    const bool read = filter_read(file, &filter) != 2;
    if (read) result = filter_test_path(&filter, path, isDirectory);
    filter_destroy(&filter);
    if (!read) return Flushed(true, 2);
  } else {
    white_list list;
    white_list_init(&list);
    const bool read = white_list_read(file, &list) != 2;
    if (read) result = white_list_test(&list, path, isDirectory);
    white_list_destroy(&list);
    if (!read) return Flushed(true, 2);
  }
  return Flushed(printf("%d\n", result) > 0, 0);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 4) return Usage();
  const bool black = strcmp(argv[2], "black") == 0;
  if (!black && strcmp(argv[2], "white") != 0) return Usage();
  if (strcmp(argv[1], "print") == 0 && argc == 4) return Print(black, argv[3]);
  if (strcmp(argv[1], "test") == 0 && (argc == 5 || (argc == 6 && strcmp(argv[5], "--dir") == 0))) {
    return Test(black, argv[3], argv[4], argc == 6);
  }
  return Usage();
}
