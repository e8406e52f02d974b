#include "filter/filter.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <string>

#define KEY(name, kind, sub, field) {name, kind, offsetof(sub, field)}

const filter_schema black_list_filter_schema = {
    1,
    4,
    {
        {"Version", offsetof(black_list_filter, version), 2,
         {KEY("major", KEY_KIND_UINT32, filter_version, major),
          KEY("minor", KEY_KIND_UINT32, filter_version, minor)}},
        {"Common", offsetof(black_list_filter, common), 9,
         {KEY("black_char", KEY_KIND_STRING, filter_common, black_char),
          KEY("black_prefix", KEY_KIND_STRING_SET, filter_common, black_prefix),
          KEY("black_suffix", KEY_KIND_STRING_SET, filter_common, black_suffix),
          KEY("black_name", KEY_KIND_STRING_SET, filter_common, black_name),
          KEY("black_dir_prefix", KEY_KIND_STRING_SET, filter_common, black_dir_prefix),
          KEY("black_path_prefix_selective_sync", KEY_KIND_STRING_SET, filter_common, black_dir_prefix),
          KEY("max_length", KEY_KIND_UINT64, filter_common, max_length),
          KEY("max_path", KEY_KIND_UINT64, filter_common, max_path),
          KEY("max_dst_path", KEY_KIND_UINT64, filter_common, max_dst_path)}},
        {"File", offsetof(black_list_filter, file), 10,
         {KEY("black_char", KEY_KIND_STRING, filter_file, black_char),
          KEY("black_prefix", KEY_KIND_STRING_SET, filter_file, black_prefix),
          KEY("black_suffix", KEY_KIND_STRING_SET, filter_file, black_suffix),
          KEY("black_glob", KEY_KIND_STRING_SET, filter_file, black_glob),
          KEY("black_ext", KEY_KIND_STRING_SET, filter_file, black_ext),
          KEY("black_ext_selective_sync", KEY_KIND_STRING_SET, filter_file, black_ext),
          KEY("black_name", KEY_KIND_STRING_SET, filter_file, black_name),
          KEY("black_name_selective_sync", KEY_KIND_STRING_SET, filter_file, black_name),
          KEY("max_size", KEY_KIND_UINT64, filter_file, max_size),
          KEY("max_size_selective_sync", KEY_KIND_UINT64, filter_file, max_size)}},
        {"Directory", offsetof(black_list_filter, directory), 5,
         {KEY("black_char", KEY_KIND_STRING, filter_directory, black_char),
          KEY("black_name", KEY_KIND_STRING_SET, filter_directory, black_name),
          KEY("black_prefix", KEY_KIND_STRING_SET, filter_directory, black_prefix),
          KEY("black_suffix", KEY_KIND_STRING_SET, filter_directory, black_suffix),
          KEY("black_glob", KEY_KIND_STRING_SET, filter_directory, black_glob)}},
    },
};

const filter_schema white_list_schema = {
    1,
    3,
    {
        {"Version", offsetof(white_list, version), 2,
         {KEY("major", KEY_KIND_UINT32, filter_version, major),
          KEY("minor", KEY_KIND_UINT32, filter_version, minor)}},
        {"Common", offsetof(white_list, common), 1,
         {KEY("white_name", KEY_KIND_STRING_SET, white_list_common, white_name)}},
        {"File", offsetof(white_list, file), 1,
         {KEY("white_ext", KEY_KIND_STRING_SET, white_list_file, white_ext)}},
    },
};

namespace {

// Syncs the folder that holds path, so that a rename in it survives a
// power cut.
bool SyncFolder(const char* path) {
  const char* slash = strrchr(path, '/');
  const std::string folder = slash == nullptr ? "." : slash == path ? "/" : std::string(path, slash);
  const int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return false;
  const bool ok = fsync(fd) == 0;
  close(fd);
  return ok;
}

// Prints through print into a temporary file beside path and renames it
// over path. On any failure before the rename the temporary is removed.
template <typename Record>
int WriteRecord(const char* path, const Record* record, int (*print)(FILE*, const Record*)) {
  std::string temporary = std::string(path) + ".XXXXXX";
  const int fd = mkstemp(temporary.data());
  if (fd < 0) return -1;
  FILE* stream = fdopen(fd, "w");
  if (stream == nullptr) {
    close(fd);
    unlink(temporary.c_str());
    return -1;
  }
  // A list longer than the reader takes would be written and then never
  // read, and a black list that does not load lets everything through.
  bool ok = fchmod(fd, 0644) == 0 && print(stream, record) == 0 && fflush(stream) == 0 &&
            ftello(stream) <= static_cast<off_t>(kFilterFileMax) && fsync(fd) == 0;
  ok = fclose(stream) == 0 && ok;
  ok = ok && rename(temporary.c_str(), path) == 0;
  if (!ok) {
    unlink(temporary.c_str());
    return -1;
  }
  return SyncFolder(path) ? 0 : -1;
}

}  // namespace

void filter_init(black_list_filter* filter) {
  filter->version = filter_version{};
  vt_string_init(&filter->common.black_char);
  vt_string_set_init(&filter->common.black_name);
  vt_string_set_init(&filter->common.black_suffix);
  vt_string_set_init(&filter->common.black_prefix);
  vt_string_set_init(&filter->common.black_dir_prefix);
  filter->common.max_length = 0;
  filter->common.max_path = 0;
  filter->common.max_dst_path = 0;
  vt_string_init(&filter->file.black_char);
  vt_string_set_init(&filter->file.black_prefix);
  vt_string_set_init(&filter->file.black_suffix);
  vt_string_set_init(&filter->file.black_glob);
  vt_string_set_init(&filter->file.black_ext);
  vt_string_set_init(&filter->file.black_name);
  filter->file.max_size = 0;
  vt_string_init(&filter->directory.black_char);
  vt_string_set_init(&filter->directory.black_name);
  vt_string_set_init(&filter->directory.black_prefix);
  vt_string_set_init(&filter->directory.black_suffix);
  vt_string_set_init(&filter->directory.black_glob);
}

int filter_read(const char* path, black_list_filter* filter) {
  return parse(path, &black_list_filter_schema, filter);
}

int filter_print(FILE* stream, const black_list_filter* filter) {
  return print_record(stream, &black_list_filter_schema, filter);
}

int filter_write(const char* path, const black_list_filter* filter) {
  return WriteRecord(path, filter, filter_print);
}

int filter_copy(black_list_filter* dst, const black_list_filter* src) {
  if (dst == src) return 0;
  black_list_filter copy;
  filter_init(&copy);
  copy.version = src->version;
  copy.common.max_length = src->common.max_length;
  copy.common.max_path = src->common.max_path;
  copy.common.max_dst_path = src->common.max_dst_path;
  copy.file.max_size = src->file.max_size;
  const bool ok =
      vt_string_copy(&copy.common.black_char, &src->common.black_char) == 0 &&
      vt_string_set_copy(&copy.common.black_name, &src->common.black_name) == 0 &&
      vt_string_set_copy(&copy.common.black_suffix, &src->common.black_suffix) == 0 &&
      vt_string_set_copy(&copy.common.black_prefix, &src->common.black_prefix) == 0 &&
      vt_string_set_copy(&copy.common.black_dir_prefix, &src->common.black_dir_prefix) == 0 &&
      vt_string_copy(&copy.file.black_char, &src->file.black_char) == 0 &&
      vt_string_set_copy(&copy.file.black_prefix, &src->file.black_prefix) == 0 &&
      vt_string_set_copy(&copy.file.black_suffix, &src->file.black_suffix) == 0 &&
      vt_string_set_copy(&copy.file.black_glob, &src->file.black_glob) == 0 &&
      vt_string_set_copy(&copy.file.black_ext, &src->file.black_ext) == 0 &&
      vt_string_set_copy(&copy.file.black_name, &src->file.black_name) == 0 &&
      vt_string_copy(&copy.directory.black_char, &src->directory.black_char) == 0 &&
      vt_string_set_copy(&copy.directory.black_name, &src->directory.black_name) == 0 &&
      vt_string_set_copy(&copy.directory.black_prefix, &src->directory.black_prefix) == 0 &&
      vt_string_set_copy(&copy.directory.black_suffix, &src->directory.black_suffix) == 0 &&
      vt_string_set_copy(&copy.directory.black_glob, &src->directory.black_glob) == 0;
  if (!ok) {
    filter_destroy(&copy);
    return -1;
  }
  filter_destroy(dst);
  *dst = copy;
  return 0;
}

void filter_destroy(black_list_filter* filter) {
  vt_string_destroy(&filter->common.black_char);
  vt_string_set_destroy(&filter->common.black_name);
  vt_string_set_destroy(&filter->common.black_suffix);
  vt_string_set_destroy(&filter->common.black_prefix);
  vt_string_set_destroy(&filter->common.black_dir_prefix);
  vt_string_destroy(&filter->file.black_char);
  vt_string_set_destroy(&filter->file.black_prefix);
  vt_string_set_destroy(&filter->file.black_suffix);
  vt_string_set_destroy(&filter->file.black_glob);
  vt_string_set_destroy(&filter->file.black_ext);
  vt_string_set_destroy(&filter->file.black_name);
  vt_string_destroy(&filter->directory.black_char);
  vt_string_set_destroy(&filter->directory.black_name);
  vt_string_set_destroy(&filter->directory.black_prefix);
  vt_string_set_destroy(&filter->directory.black_suffix);
  vt_string_set_destroy(&filter->directory.black_glob);
  filter_init(filter);
}

void white_list_init(white_list* list) {
  list->version = filter_version{};
  vt_string_set_init(&list->common.white_name);
  vt_string_set_init(&list->file.white_ext);
}

int white_list_read(const char* path, white_list* list) { return parse(path, &white_list_schema, list); }

int white_list_print(FILE* stream, const white_list* list) {
  return print_record(stream, &white_list_schema, list);
}

int white_list_write(const char* path, const white_list* list) {
  return WriteRecord(path, list, white_list_print);
}

void white_list_destroy(white_list* list) {
  vt_string_set_destroy(&list->common.white_name);
  vt_string_set_destroy(&list->file.white_ext);
}
