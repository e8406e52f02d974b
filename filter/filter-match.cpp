#include "filter/filter-match.h"

#include <cstring>

namespace {

constexpr size_t kDirectoryMax = 4096;
constexpr size_t kNameMax = 512;

// One name folded to lower case, with its hash for the sets' tables.
struct Name {
  const char* text;
  size_t length;
  uint64_t hash;
};

Name MakeName(const char* folded, size_t length) {
  return Name{folded, length, vt_string_hash(folded, length)};
}

// The characters of a black_char string, folded, as a bit map.
struct CharMask {
  uint64_t bits[4] = {};
  bool any = false;

  explicit CharMask(const vt_string& chars) {
    for (size_t i = 0; i < chars.length; ++i) {
      const unsigned char c = vt_fold(static_cast<unsigned char>(chars.data[i]));
      bits[c >> 6] |= uint64_t{1} << (c & 63);
      any = true;
    }
  }
  bool Holds(const Name& name) const {
    if (!any) return false;
    for (size_t i = 0; i < name.length; ++i) {
      const auto c = static_cast<unsigned char>(name.text[i]);
      if (bits[c >> 6] & (uint64_t{1} << (c & 63))) return true;
    }
    return false;
  }
};

bool HasExact(const vt_string_set& set, const Name& name) {
  return vt_string_set_has_folded(&set, name.text, name.length, name.hash);
}

bool HasPrefix(const vt_string_set& set, const Name& name) {
  for (size_t i = 0; i < set.count; ++i) {
    const vt_string& m = set.folded[i];
    if (m.length <= name.length && memcmp(m.data, name.text, m.length) == 0) return true;
  }
  return false;
}

bool HasSuffix(const vt_string_set& set, const Name& name) {
  for (size_t i = 0; i < set.count; ++i) {
    const vt_string& m = set.folded[i];
    if (m.length <= name.length && memcmp(m.data, name.text + name.length - m.length, m.length) == 0) return true;
  }
  return false;
}

// Pattern p of length pl, which begins and ends with "*", against s of
// length sl. Each run of literal characters between stars is looked for
// leftmost after the run before it: a later place could only leave less
// room to the runs that follow, so the leftmost never loses a match. With
// memmem's linear search the cost stays about pl + sl, where backtracking
// to the last "*" could cost pl * sl.
bool GlobMatch(const char* p, size_t pl, const char* s, size_t sl) {
  size_t si = 0;
  for (size_t pi = 0; pi < pl;) {
    if (p[pi] == '*') {
      ++pi;
      continue;
    }
    const char* star = static_cast<const char*>(memchr(p + pi, '*', pl - pi));
    const size_t run = static_cast<size_t>(star - (p + pi));
    const char* found = static_cast<const char*>(memmem(s + si, sl - si, p + pi, run));
    if (found == nullptr) return false;
    si = static_cast<size_t>(found - s) + run;
    pi += run;
  }
  return true;
}

bool MatchesGlob(const vt_string_set& set, const Name& name) {
  for (size_t i = 0; i < set.count; ++i) {
    const vt_string& m = set.folded[i];
    const char* first = static_cast<const char*>(memchr(m.data, '*', m.length));
    if (first == nullptr) {
      if (m.length == name.length && memcmp(m.data, name.text, m.length) == 0) return true;
      continue;
    }
    // The literal head and tail settle most names without the full match.
    const char* last = static_cast<const char*>(memrchr(m.data, '*', m.length));
    const size_t head = static_cast<size_t>(first - m.data);
    const size_t tail = m.length - static_cast<size_t>(last - m.data) - 1;
    if (head + tail > name.length || memcmp(m.data, name.text, head) != 0 ||
        memcmp(last + 1, name.text + name.length - tail, tail) != 0) {
      continue;
    }
    if (GlobMatch(first, static_cast<size_t>(last - first) + 1, name.text + head, name.length - head - tail)) {
      return true;
    }
  }
  return false;
}

// Whether path equals a member or begins with one followed by "/".
bool UnderDirPrefix(const vt_string_set& set, const char* path, size_t length) {
  for (size_t i = 0; i < set.count; ++i) {
    const vt_string& m = set.folded[i];
    if (m.length > length || (m.length < length && path[m.length] != '/')) continue;
    size_t j = 0;
    while (j < m.length && vt_fold(static_cast<unsigned char>(path[j])) == static_cast<unsigned char>(m.data[j])) ++j;
    if (j == m.length) return true;
  }
  return false;
}

struct Masks {
  CharMask common, file, directory;
  explicit Masks(const black_list_filter& f)
      : common(f.common.black_char), file(f.file.black_char), directory(f.directory.black_char) {}
};

int TestCommon(const black_list_filter& f, const Masks& masks, const Name& name) {
  if (f.common.max_length != 0 && name.length > f.common.max_length) return FILTER_COMMON_MAX_LENGTH;
  if (masks.common.Holds(name)) return FILTER_COMMON_BLACK_CHAR;
  if (HasExact(f.common.black_name, name)) return FILTER_COMMON_BLACK_NAME;
  if (HasPrefix(f.common.black_prefix, name)) return FILTER_COMMON_BLACK_PREFIX;
  if (HasSuffix(f.common.black_suffix, name)) return FILTER_COMMON_BLACK_SUFFIX;
  return FILTER_PASS;
}

int TestFile(const black_list_filter& f, const Masks& masks, const Name& name, const Name& extension) {
  if (masks.file.Holds(name)) return FILTER_FILE_BLACK_CHAR;
  if (HasPrefix(f.file.black_prefix, name)) return FILTER_FILE_BLACK_PREFIX;
  if (HasSuffix(f.file.black_suffix, name)) return FILTER_FILE_BLACK_SUFFIX;
  if (MatchesGlob(f.file.black_glob, name)) return FILTER_FILE_BLACK_GLOB;
  if (HasExact(f.file.black_name, name)) return FILTER_FILE_BLACK_NAME;
  if (HasExact(f.file.black_ext, extension)) return FILTER_FILE_BLACK_EXT;
  return FILTER_PASS;
}

int TestDirectory(const black_list_filter& f, const Masks& masks, const Name& name) {
  if (masks.directory.Holds(name)) return FILTER_DIRECTORY_BLACK_CHAR;
  if (HasExact(f.directory.black_name, name)) return FILTER_DIRECTORY_BLACK_NAME;
  if (HasPrefix(f.directory.black_prefix, name)) return FILTER_DIRECTORY_BLACK_PREFIX;
  if (MatchesGlob(f.directory.black_glob, name)) return FILTER_DIRECTORY_BLACK_GLOB;
  if (HasSuffix(f.directory.black_suffix, name)) return FILTER_DIRECTORY_BLACK_SUFFIX;
  return FILTER_PASS;
}

// A path folded into a buffer of its own and split into the directory part
// (folded[0, directoryLength)) and, for a file, the name and extension.
struct SplitPath {
  char folded[kDirectoryMax + kNameMax + 1];
  size_t directoryLength = 0;
  Name name{};
  Name extension{};

  // false when the parts do not fit.
  bool Split(const char* path, bool isDirectory) {
    const size_t length = strlen(path);
    const char* slash = isDirectory ? nullptr : static_cast<const char*>(memrchr(path, '/', length));
    directoryLength = isDirectory ? length : (slash == nullptr ? 0 : static_cast<size_t>(slash - path));
    const size_t nameStart = isDirectory ? length : (slash == nullptr ? 0 : directoryLength + 1);
    if (directoryLength >= kDirectoryMax || length - nameStart >= kNameMax) return false;
    for (size_t i = 0; i < length; ++i) folded[i] = static_cast<char>(vt_fold(static_cast<unsigned char>(path[i])));
    if (!isDirectory) {
      name = MakeName(folded + nameStart, length - nameStart);
      const char* dot = static_cast<const char*>(memrchr(name.text, '.', name.length));
      const size_t extStart = dot == nullptr ? name.length : static_cast<size_t>(dot - name.text) + 1;
      extension = MakeName(name.text + extStart, name.length - extStart);
    }
    return true;
  }

  // Calls visit on each non-empty component of the directory part until it
  // returns non-zero; returns that, or 0.
  template <typename Visit>
  int ForEachComponent(Visit visit) const {
    size_t start = 0;
    while (start < directoryLength) {
      const char* slash = static_cast<const char*>(memchr(folded + start, '/', directoryLength - start));
      const size_t end = slash == nullptr ? directoryLength : static_cast<size_t>(slash - folded);
      if (end > start) {
        if (const int result = visit(MakeName(folded + start, end - start)); result != 0) return result;
      }
      start = end + 1;
    }
    return 0;
  }
};

bool HasAll(const vt_string_set& set) {
  static const uint64_t kStarHash = vt_string_hash("*", 1);
  return vt_string_set_has_folded(&set, "*", 1, kStarHash);
}

}  // namespace

int filter_test_path(const black_list_filter* filter, const char* path, bool isDirectory) {
  const black_list_filter& f = *filter;
  if (UnderDirPrefix(f.common.black_dir_prefix, path, strlen(path))) return FILTER_COMMON_BLACK_DIR_PREFIX;
  SplitPath split;
  if (!split.Split(path, isDirectory)) return FILTER_SPLIT_FAILED;
  const Masks masks(f);
  if (!isDirectory) {
    if (const int result = TestCommon(f, masks, split.name); result != 0) return result;
    if (const int result = TestFile(f, masks, split.name, split.extension); result != 0) return result;
  }
  return split.ForEachComponent([&](const Name& component) {
    if (const int result = TestCommon(f, masks, component); result != 0) return result;
    return TestDirectory(f, masks, component);
  });
}

int filter_test_file_size(const black_list_filter* filter, uint64_t size) {
  const uint64_t limit = filter->file.max_size;
  return limit != 0 && size > limit ? FILTER_FILE_MAX_SIZE : FILTER_PASS;
}

int filter_test_full_path_size(const black_list_filter* filter, uint64_t sourceLength,
                               uint64_t destinationLength) {
  const filter_common& common = filter->common;
  if (common.max_path != 0 && sourceLength > common.max_path) return FILTER_COMMON_MAX_PATH;
  if (common.max_dst_path != 0 && destinationLength > common.max_dst_path) return FILTER_COMMON_MAX_DST_PATH;
  return FILTER_PASS;
}

int white_list_test(const white_list* list, const char* path, bool isDirectory) {
  const vt_string_set& names = list->common.white_name;
  const vt_string_set& extensions = list->file.white_ext;
  SplitPath split;
  if (!split.Split(path, isDirectory)) return -1;
  if (!isDirectory && (HasAll(names) || HasExact(names, split.name) || HasAll(extensions) ||
                       HasExact(extensions, split.extension))) {
    return 0;
  }
  const bool all = HasAll(names);
  const int admitted = split.ForEachComponent([&](const Name& component) {
    return all || HasExact(names, component) ? 1 : 0;
  });
  return admitted == 1 ? 0 : -1;
}
