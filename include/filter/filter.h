// The black-list and white-list records, their schemas, and reading,
// printing, writing, copying and freeing them.
//
// Records are plain structures filled in place: *_init before first use,
// *_destroy to free what they hold. Reading returns what parse() returns
// (0, 1 with unknown keys, 2 on failure); after 2 the record may be partly
// filled and must still be destroyed. Extensions ("black_ext", "white_ext")
// are written without the dot: "jpg", not ".jpg". Nothing here logs.
#ifndef PLOVO_FILTER_FILTER_H
#define PLOVO_FILTER_FILTER_H

#include <cstdint>
#include <cstdio>

#include "filter/filter-parser.h"
#include "filter/vt-string.h"

struct filter_version {
  uint32_t major;
  uint32_t minor;
};

// Rules for every name: the file's own and each folder of its path.
struct filter_common {
  vt_string black_char;
  vt_string_set black_name;
  vt_string_set black_suffix;
  vt_string_set black_prefix;
  vt_string_set black_dir_prefix;  // whole paths
  uint64_t max_length;             // of one name; 0 for no limit
  uint64_t max_path;
  uint64_t max_dst_path;
};

// Rules for a file's own name.
struct filter_file {
  vt_string black_char;
  vt_string_set black_prefix;
  vt_string_set black_suffix;
  vt_string_set black_glob;
  vt_string_set black_ext;
  vt_string_set black_name;
  uint64_t max_size;  // bytes; 0 for no limit
};

// Rules for each folder of a path.
struct filter_directory {
  vt_string black_char;
  vt_string_set black_name;
  vt_string_set black_prefix;
  vt_string_set black_suffix;
  vt_string_set black_glob;
};

struct black_list_filter {
  filter_version version;
  filter_common common;
  filter_file file;
  filter_directory directory;
};

struct white_list_common {
  vt_string_set white_name;
};

struct white_list_file {
  vt_string_set white_ext;
};

struct white_list {
  filter_version version;
  white_list_common common;
  white_list_file file;
};

extern const filter_schema black_list_filter_schema;
extern const filter_schema white_list_schema;

void filter_init(black_list_filter* filter);
int filter_read(const char* path, black_list_filter* filter);
// 0, or -1 on a write error.
int filter_print(FILE* stream, const black_list_filter* filter);
// Prints into a new file (mode 0644) beside path, syncs it, renames it over
// path and syncs the folder, so that a reader, also after a power cut, sees
// the old file or the whole new one. A text longer than kFilterFileMax,
// which no reader takes, is not written. 0; or -1 with the old file in place and
// no temporary left, except when only the folder's sync failed: the new
// file is then in place but may not survive a power cut.
int filter_write(const char* path, const black_list_filter* filter);
// Makes dst (initialised) a deep copy of src: 0, or -1 with dst unchanged.
int filter_copy(black_list_filter* dst, const black_list_filter* src);
void filter_destroy(black_list_filter* filter);

void white_list_init(white_list* list);
int white_list_read(const char* path, white_list* list);
int white_list_print(FILE* stream, const white_list* list);
int white_list_write(const char* path, const white_list* list);
void white_list_destroy(white_list* list);

#endif
