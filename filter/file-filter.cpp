#include "filter/file-filter.h"

#include "common/log.h"
#include "filter/filter-match.h"

namespace {

// Adds every member to set; false when one is empty, cannot be printed
// whole, or memory runs out.
bool InsertAll(vt_string_set* set, const std::vector<std::string>& members) {
  for (const std::string& member : members) {
    const vt_string value{const_cast<char*>(member.data()), member.size()};
    char escaped[kFilterValueMax];
    size_t written = 0;
    if (member.empty() || vt_string_escape(&value, escaped, &written) != member.size()) return false;
    if (vt_string_set_insert(set, member.data(), member.size()) != 0) return false;
  }
  return true;
}

void AppendAll(const vt_string_set& set, std::vector<std::string>& out) {
  for (size_t i = 0; i < set.count; ++i) out.emplace_back(set.items[i].data, set.items[i].length);
}

}  // namespace

void FileFilter::BlackListDeleter::operator()(black_list_filter* filter) const {
  filter_destroy(filter);
  delete filter;
}

void FileFilter::WhiteListDeleter::operator()(white_list* list) const {
  white_list_destroy(list);
  delete list;
}

FileFilter::FileFilter() = default;
FileFilter::~FileFilter() = default;

int FileFilter::LoadBlackList(const std::string& path) {
  std::unique_ptr<black_list_filter, BlackListDeleter> filter(new black_list_filter);
  filter_init(filter.get());
  if (filter_read(path.c_str(), filter.get()) != 0) {
    PLOVO_LIB_ERR("failed to read filter at '%s'", path.c_str());
    return -1;
  }
  blackList_ = std::move(filter);
  return 0;
}

int FileFilter::LoadWhiteList(const std::string& path) {
  std::unique_ptr<white_list, WhiteListDeleter> list(new white_list);
  white_list_init(list.get());
  if (white_list_read(path.c_str(), list.get()) != 0) {
    PLOVO_LIB_ERR("failed to read filter at '%s'", path.c_str());
    return -1;
  }
  whiteList_ = std::move(list);
  return 0;
}

int FileFilter::TestBlackList(const std::string& path, bool isDirectory) const {
  return blackList_ ? filter_test_path(blackList_.get(), path.c_str(), isDirectory) : 0;
}

int FileFilter::TestWhiteList(const std::string& path, bool isDirectory) const {
  return whiteList_ ? white_list_test(whiteList_.get(), path.c_str(), isDirectory) : 0;
}

int FileFilter::Test(const std::string& path, bool isDirectory) const {
  const int black = TestBlackList(path, isDirectory);
  return black < 0 ? black : TestWhiteList(path, isDirectory);
}

void FileFilter::DestroyBlackList() { blackList_.reset(); }
void FileFilter::DestroyWhiteList() { whiteList_.reset(); }

int WriteBlackList(const std::string& path, const std::vector<std::string>& names,
                   const std::vector<std::string>& extensions) {
  black_list_filter filter;
  filter_init(&filter);
  const bool ok = InsertAll(&filter.common.black_name, names) && InsertAll(&filter.file.black_ext, extensions) &&
                  filter_write(path.c_str(), &filter) == 0;
  filter_destroy(&filter);
  return ok ? 0 : -1;
}

int WriteWhiteList(const std::string& path, const std::vector<std::string>& names,
                   const std::vector<std::string>& extensions) {
  white_list list;
  white_list_init(&list);
  const bool ok = InsertAll(&list.common.white_name, names) && InsertAll(&list.file.white_ext, extensions) &&
                  white_list_write(path.c_str(), &list) == 0;
  white_list_destroy(&list);
  return ok ? 0 : -1;
}

int ReadBlackList(const std::string& path, std::vector<std::string>& names, std::vector<std::string>& extensions) {
  black_list_filter filter;
  filter_init(&filter);
  const bool ok = filter_read(path.c_str(), &filter) != 2;
  if (ok) {
    AppendAll(filter.common.black_name, names);
    AppendAll(filter.file.black_ext, extensions);
  }
  filter_destroy(&filter);
  return ok ? 0 : -1;
}

int ReadWhiteList(const std::string& path, std::vector<std::string>& names, std::vector<std::string>& extensions) {
  white_list list;
  white_list_init(&list);
  const bool ok = white_list_read(path.c_str(), &list) != 2;
  if (ok) {
    AppendAll(list.common.white_name, names);
    AppendAll(list.file.white_ext, extensions);
  }
  white_list_destroy(&list);
  return ok ? 0 : -1;
}
