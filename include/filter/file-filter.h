// A task's two lists as the copier uses them, and the list files in the
// simple form the web interface edits: a list of names and a list of
// extensions. Extensions are given and kept without the dot ("jpg").
#ifndef PLOVO_FILTER_FILE_FILTER_H
#define PLOVO_FILTER_FILE_FILTER_H

#include <memory>
#include <string>
#include <vector>

#include "filter/filter.h"

// Holds at most one black list and one white list, each owned by the object
// from a successful load until its Destroy call or the destructor. A list
// that is not loaded lets everything pass. Tests may run from several
// threads at once; loading and destroying may not run beside them.
class FileFilter {
 public:
  FileFilter();
  ~FileFilter();
  FileFilter(const FileFilter&) = delete;
  FileFilter& operator=(const FileFilter&) = delete;

  // Reads the file; 0 on success. Any other parse result, unknown keys
  // included, logs "failed to read filter at '<path>'" and gives -1: the
  // new record is freed and the list loaded before, if any, stays.
  int LoadBlackList(const std::string& path);
  int LoadWhiteList(const std::string& path);

  // 0 when the list is not loaded; otherwise filter_test_path's or
  // white_list_test's result.
  int TestBlackList(const std::string& path, bool isDirectory) const;
  int TestWhiteList(const std::string& path, bool isDirectory) const;
  // The black list's result when negative, else the white list's.
  int Test(const std::string& path, bool isDirectory) const;

  void DestroyBlackList();
  void DestroyWhiteList();

 private:
  struct BlackListDeleter {
    void operator()(black_list_filter* filter) const;
  };
  struct WhiteListDeleter {
    void operator()(white_list* list) const;
  };
  std::unique_ptr<black_list_filter, BlackListDeleter> blackList_;
  std::unique_ptr<white_list, WhiteListDeleter> whiteList_;
};

// Writes a black list holding names in Common "black_name" and extensions in
// File "black_ext", and nothing else. 0, or -1 when a member is empty or too
// long to be written whole, or the file cannot be written (nothing written).
int WriteBlackList(const std::string& path, const std::vector<std::string>& names,
                   const std::vector<std::string>& extensions);
// The same for a white list: Common "white_name" and File "white_ext".
int WriteWhiteList(const std::string& path, const std::vector<std::string>& names,
                   const std::vector<std::string>& extensions);
// Append the members of those two keys, in file order, to names and
// extensions. 0 (unknown keys are no failure), or -1 when the file does not
// parse (the vectors are then left as they were).
int ReadBlackList(const std::string& path, std::vector<std::string>& names, std::vector<std::string>& extensions);
int ReadWhiteList(const std::string& path, std::vector<std::string>& names, std::vector<std::string>& extensions);

#endif
