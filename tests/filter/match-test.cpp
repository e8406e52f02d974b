// Black-list and white-list matching: each rule's code, the order in which
// the rules are tried, case, and how paths are split.
#include <gtest/gtest.h>

#include <string>

#include "filter-text.h"
#include "filter/filter-match.h"

namespace {

using plovo_test::BlackList;
using plovo_test::WhiteList;

// One member for every rule, each distinct enough to be hit alone.
const char kBlackList[] =
    "[Common]\n"
    "black_char = \"!Q\"\n"
    "black_name = \"Common-Name\"\n"
    "black_prefix = \"cpre\"\n"
    "black_suffix = \"csuf\"\n"
    "black_dir_prefix = \"/Blocked/Dir\"\n"
    "max_length = 30\n"
    "max_path = 100\n"
    "max_dst_path = 200\n"
    "[File]\n"
    "black_char = \"%\"\n"
    "black_prefix = \"fpre\"\n"
    "black_suffix = \"fsuf\"\n"
    "black_glob = \"*.TMP\", \"x*y*z\", \"a?c\"\n"
    "black_ext = \"jpg\"\n"
    "black_name = \"File-Name\"\n"
    "max_size = 1000\n"
    "[Directory]\n"
    "black_char = \"^\"\n"
    "black_name = \"Dir-Name\"\n"
    "black_prefix = \"dpre\"\n"
    "black_suffix = \"dsuf\"\n"
    "black_glob = \"*.D\"\n";

TEST(FilterMatch, EachRuleGivesItsCodeInOrder) {
  BlackList list(kBlackList);
  ASSERT_EQ(0, list.output.result) << list.output.err;
  const std::string name31(31, 'n');
  const struct {
    std::string path;
    bool isDirectory;
    int code;
  } cases[] = {
      {"/a/b/ok.txt", false, 0},
      {"ok.txt", false, 0},
      {"/", true, 0},
      {"/Blocked/Dir", true, -264},
      {"/blocked/DIR/x.txt", false, -264},
      {"/Blocked/Dirx/y.txt", false, 0},
      {"/a/" + name31.substr(1), false, 0},  // max_length 30: a name of 30 passes
      {"/a/" + name31, false, -265},
      {"/a/!" + name31, false, -265},  // max_length before black_char
      {"/a/b!c.txt", false, -258},
      {"/a/aqua", false, -258},  // "Q" folded like the name
      {"/a/b!%c.txt", false, -258},  // Common before File
      {"/a/COMMON-NAME", false, -261},
      {"/a/CPREfix.txt", false, -259},
      {"/a/cpre", false, -259},  // a prefix or suffix may be the whole name
      {"/a/name.CSUF", false, -260},
      {"/a/csuf", false, -260},
      {"/a/fpre", false, -515},
      {"/a/fsuf", false, -516},
      {"/dpre", true, -771},
      {"/dsuf", true, -772},
      {"/a/b%c.txt", false, -514},
      {"/a/fpre.txt", false, -515},
      {"/a/fpre.jpg", false, -515},  // prefix before extension
      {"/a/x.fsuf", false, -516},
      {"/a/x.tmp", false, -519},
      {"/a/XaYbZ", false, -519},
      {"/a/xyz", false, -519},
      {"/a/xzy", false, 0},
      {"/a/xz", false, 0},  // the middle "y" must be there
      {"/a/xayz", false, -519},
      {"/a/a?c", false, -519},
      {"/a/abc", false, 0},  // "?" is no wildcard
      {"/a/file-name", false, -517},
      {"/a/photo.JPG", false, -518},
      {"/a/.jpg", false, -518},
      {"/a/jpg", false, 0},  // no dot, no extension
      {"/a/x.jpg.txt", false, 0},
      {"/a/DIR-NAME/ok.txt", false, -773},
      {"/a/dir-name", true, -773},
      {"/a/dir-name", false, 0},  // Directory rules are not for a file's name
      {"/a/file-name/ok.txt", false, 0},  // nor File rules for folders
      {"/a/b!c/ok.txt", false, -258},
      {"/a/x^y/ok.txt", false, -770},
      {"/a/DPREx/ok.txt", false, -771},
      {"/a/y.d/ok.txt", false, -775},
      {"/a/xdsuf/ok.txt", false, -772},
      {"/dir-name/b^c/ok.txt", false, -773},  // the first component decides
      {"/b^c/dir-name/ok.txt", false, -770},
      {"/dpre.d", true, -771},  // prefix before glob
      {"/" + name31 + "/ok.txt", false, -265},
      {"//a///x^y//", true, -770},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path + (c.isDirectory ? " (folder)" : ""));
    EXPECT_EQ(c.code, filter_test_path(&list.record, c.path.c_str(), c.isDirectory));
  }
}

// Each path breaks exactly two rules that follow each other in the order:
// the earlier one's code must come out. Together the rows cover every
// neighbouring pair, so swapping any two neighbours fails a row.
TEST(FilterMatch, OfTwoRulesBrokenTheEarlierDecides) {
  const struct {
    const char* list;
    const char* path;
    bool isDirectory;
    int code;
  } cases[] = {
      {"[Common]\nblack_dir_prefix = \"/d\"\nmax_length = 1\n", "/d/ab", false, -264},
      {"[Common]\nmax_length = 1\nblack_char = \"a\"\n", "/d/ab", false, -265},
      {"[Common]\nblack_char = \"a\"\nblack_name = \"ab\"\n", "/d/ab", false, -258},
      {"[Common]\nblack_name = \"ab\"\nblack_prefix = \"a\"\n", "/d/ab", false, -261},
      {"[Common]\nblack_prefix = \"a\"\nblack_suffix = \"b\"\n", "/d/ab", false, -259},
      {"[Common]\nblack_suffix = \"b\"\n[File]\nblack_char = \"a\"\n", "/d/ab", false, -260},
      {"[File]\nblack_char = \"a\"\nblack_prefix = \"a\"\n", "/d/ab", false, -514},
      {"[File]\nblack_prefix = \"a\"\nblack_suffix = \"b\"\n", "/d/ab", false, -515},
      {"[File]\nblack_suffix = \"b\"\nblack_glob = \"a*\"\n", "/d/ab", false, -516},
      {"[File]\nblack_glob = \"a*\"\nblack_name = \"ab\"\n", "/d/ab", false, -519},
      {"[File]\nblack_name = \"a.b\"\nblack_ext = \"b\"\n", "/d/a.b", false, -517},
      // The file's own name before its folders.
      {"[Common]\nmax_length = 3\n[File]\nblack_ext = \"b\"\n", "/long/a.b", false, -518},
      {"[File]\nblack_name = \"ab\"\n[Directory]\nblack_name = \"d\"\n", "/d/ab", false, -517},
      {"[Common]\nblack_suffix = \"b\"\n[Directory]\nblack_char = \"a\"\n", "/ab", true, -260},
      {"[Directory]\nblack_char = \"a\"\nblack_name = \"ab\"\n", "/ab", true, -770},
      {"[Directory]\nblack_name = \"ab\"\nblack_prefix = \"a\"\n", "/ab", true, -773},
      {"[Directory]\nblack_prefix = \"a\"\nblack_glob = \"a*\"\n", "/ab", true, -771},
      {"[Directory]\nblack_glob = \"a*\"\nblack_suffix = \"b\"\n", "/ab", true, -775},
      // An earlier folder before a later one.
      {"[Common]\nmax_length = 2\n[Directory]\nblack_suffix = \"b\"\n", "/ab/abc", true, -772},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.list) + c.path);
    BlackList list(c.list);
    ASSERT_EQ(0, list.output.result) << list.output.err;
    EXPECT_EQ(c.code, filter_test_path(&list.record, c.path, c.isDirectory));
  }
}

TEST(FilterMatch, PartsThatDoNotFitGiveMinusOne) {
  BlackList list("");
  const std::string name511(511, 'n');
  const std::string dir4095 = "/" + std::string(4094, 'd');
  EXPECT_EQ(0, filter_test_path(&list.record, ("/a/" + name511).c_str(), false));
  EXPECT_EQ(-1, filter_test_path(&list.record, ("/a/" + name511 + "n").c_str(), false));
  EXPECT_EQ(0, filter_test_path(&list.record, (dir4095 + "/f").c_str(), false));
  EXPECT_EQ(-1, filter_test_path(&list.record, (dir4095 + "d/f").c_str(), false));
  EXPECT_EQ(0, filter_test_path(&list.record, dir4095.c_str(), true));
  EXPECT_EQ(-1, filter_test_path(&list.record, (dir4095 + "d").c_str(), true));
  WhiteList white("[Common]\nwhite_name = \"*\"\n");
  EXPECT_EQ(-1, white_list_test(&white.record, ("/a/" + name511 + "n").c_str(), false));
}

TEST(FilterMatch, SizesAndPathLengths) {
  BlackList list(kBlackList);
  EXPECT_EQ(0, filter_test_file_size(&list.record, 1000));
  EXPECT_EQ(-523, filter_test_file_size(&list.record, 1001));
  EXPECT_EQ(0, filter_test_full_path_size(&list.record, 100, 200));
  EXPECT_EQ(-266, filter_test_full_path_size(&list.record, 101, 201));
  EXPECT_EQ(-268, filter_test_full_path_size(&list.record, 100, 201));
  BlackList none("[File]\nmax_size = 0\n");  // 0 is no limit
  EXPECT_EQ(0, filter_test_file_size(&none.record, UINT64_MAX));
  EXPECT_EQ(0, filter_test_full_path_size(&none.record, UINT64_MAX, UINT64_MAX));
}

TEST(FilterMatch, WhiteListAdmitsByNameExtensionOrFolder) {
  const struct {
    const char* list;
    const char* path;
    bool isDirectory;
    int code;
  } cases[] = {
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/b/x.JPG", false, 0},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/b/x.png", false, -1},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/KEEP/x.png", false, 0},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/b/keep", false, 0},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/keep/b", true, 0},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/b", true, -1},
      {"[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n", "/a/x.jpg", true, -1},
      {"[Common]\nwhite_name = \"*\"\n", "/any/thing.at.all", false, 0},
      {"[Common]\nwhite_name = \"*\"\n", "/any", true, 0},
      {"[Common]\nwhite_name = \"*\"\n", "/", true, -1},
      {"[File]\nwhite_ext = \"*\"\n", "/a/no-extension", false, 0},
      {"[File]\nwhite_ext = \"*\"\n", "/a", true, -1},
      {"[Common]\nwhite_name = \"keep*\"\n", "/a/keeper", false, -1},  // only "*" alone is special
      {"", "/a/b.jpg", false, -1},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.list) + " " + c.path);
    WhiteList list(c.list);
    ASSERT_EQ(0, list.output.result) << list.output.err;
    EXPECT_EQ(c.code, white_list_test(&list.record, c.path, c.isDirectory));
  }
}

TEST(FilterMatch, MembersRemovedOrInsertedLaterMatchAsTheSetNowHolds) {
  BlackList list("[Common]\nblack_name = \"one\", \"Two\", \"three\"\n");
  vt_string_set& names = list.record.common.black_name;
  ASSERT_EQ(0, vt_string_set_remove(&names, "one", 3));
  EXPECT_EQ(-1, vt_string_set_remove(&names, "two", 3));  // removal is by exact text
  EXPECT_EQ(0, filter_test_path(&list.record, "/a/one", false));
  EXPECT_EQ(-261, filter_test_path(&list.record, "/a/TWO", false));
  EXPECT_EQ(-261, filter_test_path(&list.record, "/a/three", false));
  for (int i = 0; i < 100; ++i) ASSERT_EQ(0, vt_string_set_insert(&names, ("n" + std::to_string(i)).c_str(), 2 + (i > 9)));
  EXPECT_EQ(-261, filter_test_path(&list.record, "/a/N99", false));
  EXPECT_EQ(-261, filter_test_path(&list.record, "/a/three", false));
}

TEST(FilterMatch, NonAsciiBytesCompareExactly) {
  BlackList list("[Common]\nblack_name = \"\\xc3\\x89t\\xc3\\xa9\"\n");  // "Été" in UTF-8
  EXPECT_EQ(-261, filter_test_path(&list.record, "/a/\xc3\x89T\xc3\xa9", false));
  EXPECT_EQ(0, filter_test_path(&list.record, "/a/\xc3\xa9t\xc3\xa9", false));
}

}  // namespace
