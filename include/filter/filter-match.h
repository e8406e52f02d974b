// Whether a path passes a black list or a white list.
//
// All comparisons ignore ASCII letter case. A path is split at its last "/"
// into the directory part and the name; a file's extension is the text after
// the last "." of its name, without the dot ("jpg", not ".jpg"; a name with
// no dot has an empty extension). The components of the directory part (for
// a folder, of the whole path) are its non-empty pieces between "/". A
// directory part of 4096 bytes or more, or a name of 512 or more, cannot be
// split and gives -1. In globs only "*" is special: any run of characters.
//
// The tests never log and never change the lists; several threads may test
// against one list at once.
#ifndef PLOVO_FILTER_FILTER_MATCH_H
#define PLOVO_FILTER_FILTER_MATCH_H

#include <cstdint>

#include "filter/filter.h"

// Black-list results: minus (section * 0x100 + rule), section 1 Common,
// 2 File, 3 Directory. 0 passes.
enum {
  FILTER_PASS = 0,
  FILTER_SPLIT_FAILED = -1,
  FILTER_COMMON_BLACK_CHAR = -0x102,        // -258
  FILTER_COMMON_BLACK_PREFIX = -0x103,      // -259
  FILTER_COMMON_BLACK_SUFFIX = -0x104,      // -260
  FILTER_COMMON_BLACK_NAME = -0x105,        // -261
  FILTER_COMMON_BLACK_DIR_PREFIX = -0x108,  // -264
  FILTER_COMMON_MAX_LENGTH = -0x109,        // -265
  FILTER_COMMON_MAX_PATH = -0x10a,          // -266
  FILTER_COMMON_MAX_DST_PATH = -0x10c,      // -268
  FILTER_FILE_BLACK_CHAR = -0x202,          // -514
  FILTER_FILE_BLACK_PREFIX = -0x203,        // -515
  FILTER_FILE_BLACK_SUFFIX = -0x204,        // -516
  FILTER_FILE_BLACK_NAME = -0x205,          // -517
  FILTER_FILE_BLACK_EXT = -0x206,           // -518
  FILTER_FILE_BLACK_GLOB = -0x207,          // -519
  FILTER_FILE_MAX_SIZE = -0x20b,            // -523
  FILTER_DIRECTORY_BLACK_CHAR = -0x302,     // -770
  FILTER_DIRECTORY_BLACK_PREFIX = -0x303,   // -771
  FILTER_DIRECTORY_BLACK_SUFFIX = -0x304,   // -772
  FILTER_DIRECTORY_BLACK_NAME = -0x305,     // -773
  FILTER_DIRECTORY_BLACK_GLOB = -0x307,     // -775
};

// 0, FILTER_SPLIT_FAILED, or the code of the first rule the path breaks:
// the path under a Common black_dir_prefix member; then for a file its name
// by the Common rules (max_length, black_char, black_name, black_prefix,
// black_suffix) and the File rules (black_char, black_prefix, black_suffix,
// black_glob, black_name, black_ext on the extension); then each component
// of the directory part in order by the Common rules and the Directory
// rules (black_char, black_name, black_prefix, black_glob, black_suffix).
int filter_test_path(const black_list_filter* filter, const char* path, bool isDirectory);
// FILTER_FILE_MAX_SIZE when max_size is not 0 and size exceeds it, else 0.
int filter_test_file_size(const black_list_filter* filter, uint64_t size);
// FILTER_COMMON_MAX_PATH, else FILTER_COMMON_MAX_DST_PATH, when a non-zero
// limit is exceeded; else 0.
int filter_test_full_path_size(const black_list_filter* filter, uint64_t sourceLength,
                               uint64_t destinationLength);
// 0 when a file's name is in white_name or its extension in white_ext, or a
// component of the directory part (for a folder, of the whole path) is in
// white_name; a member "*" matches anything. Otherwise -1, also for a path
// with no component at all ("/" as a folder).
int white_list_test(const white_list* list, const char* path, bool isDirectory);

#endif
