// The filter file reader and printer (every error at its line, what reads
// into which field, what prints and that it reads back) and black-list and
// white-list matching (each rule's code, the rules' order, case, splitting).
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <utility>
#include <vector>

#include "bounded.h"
#include "filter/filter-match.h"
#include "filter/filter.h"
#include "sandbox.h"

namespace {

using Edits = std::vector<std::pair<std::string, std::string>>;

// A record read from text through a stream, what the reader printed on
// stdout and stderr; freed with the object.
template <typename Record, void (*Init)(Record*), void (*Destroy)(Record*), const filter_schema* Schema>
struct Parsed {
  Record record;
  int result;
  std::string out, err;
  explicit Parsed(std::string text) {
    Init(&record);
    if (text.empty()) text = " ";  // fmemopen refuses an empty buffer
    FILE* in = fmemopen(text.data(), text.size(), "r");
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    result = parse_stream(in, Schema, &record);
    out = testing::internal::GetCapturedStdout();
    err = testing::internal::GetCapturedStderr();
    fclose(in);
  }
  ~Parsed() { Destroy(&record); }
  Parsed(const Parsed&) = delete;
  Parsed& operator=(const Parsed&) = delete;
  std::string Print() const {
    char* text = nullptr;
    size_t length = 0;
    FILE* out = open_memstream(&text, &length);
    EXPECT_EQ(0, print_record(out, Schema, &record));
    fclose(out);
    std::string printed(text, length);
    free(text);
    return printed;
  }
};
using BlackList = Parsed<black_list_filter, filter_init, filter_destroy, &black_list_filter_schema>;
using WhiteList = Parsed<white_list, white_list_init, white_list_destroy, &white_list_schema>;

const std::string kEmptyBlack =
    "[Version]\nmajor = 0\nminor = 0\n[Common]\nmax_length = 0\nmax_path = 0\nmax_dst_path = 0\n"
    "[File]\nmax_size = 0\n[Directory]\n";

// text with the first occurrence of each "from" replaced by its "to".
std::string Edit(std::string text, const Edits& edits) {
  for (const auto& [from, to] : edits) text.replace(text.find(from), from.size(), to);
  return text;
}

// Comment lines of 1024 bytes each.
std::string Comments(int lines) {
  std::string text;
  for (int i = 0; i < lines; ++i) text += "#" + std::string(1022, 'c') + "\n";
  return text;
}

TEST(FilterParse, EachErrorIsReportedWithItsNameAndLine) {
  const std::string s33(33, 's');
  const struct {
    std::string text;
    const char* message;
  } cases[] = {
      {"# comment\n\n[Common\n", "SECTION_MISSING_RIGHT_BRACKET at line 3"},
      {"[Com#mon]\n", "SECTION_MISSING_RIGHT_BRACKET at line 1"},
      {"[]\n", "SECTION_MISSING_SECTION at line 1"},
      {"[Com mon]\n", "SECTION_ILLEGAL_CHARACTER at line 1"},
      {"[" + s33 + "]\n", "SECTION_TOO_LONG at line 1"},
      {"[" + std::string(32, 's') + "]\n", "SECTION_UNDEFINED_SECTION at line 1"},
      {"[Common]\n[common]\n", "SECTION_UNDEFINED_SECTION at line 2"},
      {"[Common]\n= 5\n", "KEY_MISSING_KEY at line 2"},
      {"[Common]\nmax_path 5\n", "KEY_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nmax.path = 5\n", "KEY_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\n" + s33 + " = 5\n", "KEY_TOO_LONG at line 2"},
      {"[Common]\nmax_path = x\n", "VALUE_NUMERIC_MISSING_INTEGER_PART at line 2"},
      {"[Common]\nmax_path = 5.\n", "VALUE_NUMERIC_MISSING_FRACTIONAL_PART at line 2"},
      {"[Common]\nmax_path =   \n", "VALUE_NUMERIC_MISSING_VALUE at line 2"},
      {"[Common]\nmax_path = 5x\n", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Common]\nmax_path = 18446744073709551616\n", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Version]\nmajor = 4294967296\n", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Common]\nblack_name = abc\n", "VALUE_STRING_MISSING_LEFT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"a\", b\n", "VALUE_STRING_MISSING_LEFT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"abc\n", "VALUE_STRING_MISSING_RIGHT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"abc\\\n", "VALUE_STRING_MISSING_RIGHT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"\\q\"\n", "VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE at line 2"},
      {"[Common]\nblack_name = \"\\8\"\n", "VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE at line 2"},
      {"[Common]\nblack_name = \"\\x4g\"\n", "VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE at line 2"},
      {"[Common]\nblack_name = \"\\400\"\n", "VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE at line 2"},
      {"[Common]\nblack_name = \"\\018\"\n", "VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE at line 2"},
      {"[Common]\nblack_name = \"abc", "VALUE_STRING_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nblack_name = \"a" + std::string(1, '\0') + "\"\n", "VALUE_STRING_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nblack_name = \"\"\n", "VALUE_STRING_EMPTY at line 2"},
      {"[Common]\nblack_name = \"a\" \"b\"\n", "Unknown error at line 2"},  // the missing separator is +22
      {"[Common]\nblack_name = \"" + std::string(1024, 'a') + "\"\n", "VALUE_TOO_LONG at line 2"},
      {"[Common]\nmax_path = " + std::string(1024, '1') + "\n", "VALUE_TOO_LONG at line 2"},
      {"[Common]\nmax_path = " + std::string(1022, '0') + ".0\n", "VALUE_TOO_LONG at line 2"},  // the dot counts
      {"[Common]  x\n", "LINE_NOT_ENDED at line 1"},
      {"[Common]\nmax_path = 5 6\n", "LINE_NOT_ENDED at line 2"},
      {"[Common]\nblack_char = \"a\", \"b\"\n", "LINE_NOT_ENDED at line 2"},
      {"[Common]\nblack_name = \"a\" x\n", "LINE_NOT_ENDED at line 2"},
      {"# before any section\nmax_path = 5\n", "LINE_NOT_EXPECTED at line 2"},
      {"[Common]\n\"a\"\n", "LINE_NOT_EXPECTED at line 2"},
      {"[Common]\nblack_name = \"a\",\nmax_path = 5\n", "LINE_NOT_EXPECTED at line 3"},
      // Lines are read in pieces of at most 6144 bytes, the line feed
      // counted, each piece a line: a comment of 6143, 6144, 6145 bytes.
      {"[Common]\n#" + std::string(6142, '%') + "\nx\n", "KEY_ILLEGAL_CHARACTER at line 3"},
      {"[Common]\n#" + std::string(6143, '%') + "\nx\n", "KEY_ILLEGAL_CHARACTER at line 4"},
      {"[Common]\n#" + std::string(6144, '%') + "\nx\n", "KEY_MISSING_KEY at line 3"},
      {Comments(1024) + "\n", "INTERNAL_ERROR at line 1025"},  // one byte over 1 MiB
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text.substr(0, 80));
    BlackList list(c.text);
    EXPECT_EQ(2, list.result);
    EXPECT_EQ(std::string("parser: ") + c.message + "\n", list.err);
  }
  EXPECT_STREQ("NO_ERROR", parse_error_name(0));
  EXPECT_STREQ("Unknown error", parse_error_name(-27));
}

TEST(FilterParse, AcceptedTextsPrintAsExpectedAndReadBack) {
  const std::string five = "\"a\", \"b\", \"c\", \"d\", \"e\"";
  const struct {
    std::string out;  // the warnings; with them the result is 1
    std::string text;
    Edits printed;  // the edits that turn the empty list's print into the text's
  } cases[] = {
      {"", "# one\n\n  \t# two\n\r\n", {}},
      {"", "[Common]  \t# all names\n", {}},
      {"", "[Common]\r\nmax_path = 7\r\n\rblack_name = \"a\"\r\n",  // a carriage return is a blank
       {{"max_length", "black_name = \"a\"\nmax_length"}, {"max_path = 0", "max_path = 7"}}},
      {"", "[File]\nmax_size = 18446744073709551615\n", {{"max_size = 0", "max_size = 18446744073709551615"}}},
      {"", "[Version]\nmajor = 3.75 # three\nmajor = 4\nminor = 0004294967295\n",
       {{"major = 0\nminor = 0", "major = 4\nminor = 4294967295"}}},
      {"", "[Common]\nblack_path_prefix_selective_sync = \"/p\"\nblack_dir_prefix = \"/q\"\n[File]\n"
       "black_ext_selective_sync = \"jpg\"\nblack_name_selective_sync = \"n\"\nmax_size_selective_sync = 9\n",
       {{"max_length", "black_dir_prefix = \"/p\", \"/q\"\nmax_length"},
        {"max_size = 0", "black_ext = \"jpg\"\nblack_name = \"n\"\nmax_size = 9"}}},
      {"", "[Common]\nmax_path = " + std::string(1023, '0') + "\n", {}},
      {"", "[Common]\nmax_path = " + std::string(1021, '0') + ".0\n", {}},
      {"warning: unknown key (future)\nwarning: unknown key (Black_name)\n",
       "[Common]\nfuture = \"x\",\n  \"y\"\nBlack_name = 12.5\nmax_path = 1\n", {{"max_path = 0", "max_path = 1"}}},
      {"", "[File]\nblack_ext = \"a\", \"b\",  # more below\n\n# between\n  \"c\",\n\"d\"\nmax_size = 1\n",
       {{"max_size = 0", "black_ext = \"a\", \"b\", \"c\", \"d\"\nmax_size = 1"}}},
      {"", "[File]\nblack_ext = " + five + ", \"f\"\n", {{"max_size", "black_ext = " + five + ",\n\"f\"\nmax_size"}}},
      {"", "[File]\nblack_ext = " + five + "\n", {{"max_size", "black_ext = " + five + "\nmax_size"}}},
      {"", "[Directory]\nblack_name = \"\\a\\b\\f\\n\\r\\t\\v\", \"\\'\\\"\\\\\\?\", \"\\x41\\x4a\\x4B\", \"\\101\\000\\377\"\n",
       {{"[Directory]\n", "[Directory]\nblack_name = \"\\x07\\x08\\f\\n\\x0d\\t\\v\", \"'\\\"\\\\?\", \"AJK\", \"A\\x00\\xff\"\n"}}},
      {"", Comments(1024), {}},  // exactly 1 MiB
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text.substr(0, 80));
    BlackList list(c.text);
    EXPECT_EQ(c.out.empty() ? 0 : 1, list.result) << list.err;
    EXPECT_EQ("", list.err);
    EXPECT_EQ(c.out, list.out);
    const std::string printed = list.Print();
    EXPECT_EQ(Edit(kEmptyBlack, c.printed), printed);
    BlackList again(printed);
    EXPECT_EQ(0, again.result) << again.err;
    EXPECT_EQ(printed, again.Print());
  }
}

TEST(FilterPrint, StringsAreEscapedAndCutAtWholeEscapesWithin1023Characters) {
  std::string dollars;  // 1023 "$" read (the limit counts unescaped bytes); 255 escapes fit
  for (int i = 0; i < 255; ++i) dollars += "\\x24";
  const struct {
    std::string raw, printed;  // between the quotes
  } cases[] = {
      {std::string("\x01\"\\$@`\t\n\v\f\r\x7f\xff ok", 16), "\\x01\\\"\\\\\\x24\\x40\\x60\\t\\n\\v\\f\\x0d\\x7f\\xff ok"},
      {std::string(1023, 'a'), std::string(1023, 'a')},
      {std::string(1024, 'a'), std::string(1023, 'a')},
      {std::string(1022, 'a') + "$", std::string(1022, 'a')},  // the escape does not fit whole
      {std::string(1023, '$'), dollars},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.raw.size());
    BlackList list("");
    ASSERT_EQ(0, vt_string_assign(&list.record.directory.black_char, c.raw.data(), c.raw.size()));
    const std::string printed = list.Print();
    EXPECT_EQ(Edit(kEmptyBlack, {{"[Directory]\n", "[Directory]\nblack_char = \"" + c.printed + "\"\n"}}), printed);
    BlackList again(printed);
    EXPECT_EQ(0, again.result) << again.err;
    EXPECT_EQ(printed, again.Print());
  }
}

// One member for every rule, each distinct enough to be hit alone.
const char kAll[] =
    "[Common]\nblack_char = \"!Q\"\nblack_name = \"Common-Name\"\nblack_prefix = \"cpre\"\nblack_suffix = \"csuf\"\n"
    "black_dir_prefix = \"/Blocked/Dir\"\nmax_length = 30\nmax_path = 100\nmax_dst_path = 200\n"
    "[File]\nblack_char = \"%\"\nblack_prefix = \"fpre\"\nblack_suffix = \"fsuf\"\n"
    "black_glob = \"*.TMP\", \"x*y*z\", \"a?c\"\nblack_ext = \"jpg\"\nblack_name = \"File-Name\"\nmax_size = 1000\n"
    "[Directory]\nblack_char = \"^\"\nblack_name = \"Dir-Name\"\nblack_prefix = \"dpre\"\nblack_suffix = \"dsuf\"\n"
    "black_glob = \"*.D\"\n";

TEST(FilterPrint, CopyIsDeepAndEqual) {
  BlackList list(kAll), copy("");
  ASSERT_EQ(0, filter_copy(&copy.record, &list.record));
  ASSERT_EQ(0, vt_string_set_remove(&list.record.file.black_glob, "a?c", 3));
  EXPECT_EQ(3u, copy.record.file.black_glob.count);
  ASSERT_EQ(0, vt_string_set_insert(&list.record.file.black_glob, "a?c", 3));
  EXPECT_EQ(list.Print(), copy.Print());
}

class FilterFile : public plovo_test::SandboxTest {};

TEST_F(FilterFile, OnlyARegularFileIsRead) {
  ASSERT_EQ(0, mkfifo(Path("/fifo").c_str(), 0600));
  MakeDir("/folder");
  WriteFile("/regular", "[Common]\nmax_path = 1\n");
  const std::string refused = "parser: INTERNAL_ERROR at line 0\n";
  const struct {
    std::string path;
    int result;
    std::string err;
  } cases[] = {
      {Path("/fifo"), 2, refused}, {Path("/folder"), 2, refused}, {"/dev/null", 2, refused},
      {Path("/missing"), 2, ""},   {Path("/regular"), 0, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    black_list_filter filter;
    filter_init(&filter);
    testing::internal::CaptureStderr();
    // A FIFO read would wait for a writer: opening one releases it.
    EXPECT_EQ(c.result, plovo_test::Bounded([&] { return filter_read(c.path.c_str(), &filter); },
                                            [&] { close(open(c.path.c_str(), O_WRONLY | O_NONBLOCK)); }));
    EXPECT_EQ(c.err, testing::internal::GetCapturedStderr());
    filter_destroy(&filter);
  }
}

struct PathCase {
  const char* list;
  std::string path;
  bool isDirectory;
  int code;
};

void ExpectCodes(bool white, const std::vector<PathCase>& cases) {
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.list == kAll ? "" : c.list) + c.path + (c.isDirectory ? " (folder)" : ""));
    if (white) {
      WhiteList list(c.list);
      ASSERT_EQ(0, list.result) << list.err;
      EXPECT_EQ(c.code, white_list_test(&list.record, c.path.c_str(), c.isDirectory));
    } else {
      BlackList list(c.list);
      ASSERT_EQ(0, list.result) << list.err;
      EXPECT_EQ(c.code, filter_test_path(&list.record, c.path.c_str(), c.isDirectory));
    }
  }
}

TEST(FilterMatch, EachRuleGivesItsCode) {
  const std::string n30(30, 'n'), n511(511, 'n'), d4095 = "/" + std::string(4094, 'd');
  ExpectCodes(false, {
      {kAll, "/a/b/ok.txt", false, 0},
      {kAll, "ok.txt", false, 0},
      {kAll, "/", true, 0},
      {kAll, "/Blocked/Dir", true, -264},
      {kAll, "/blocked/DIR/x.txt", false, -264},
      {kAll, "/Blocked/Dirx/y.txt", false, 0},
      {kAll, "/a/" + n30, false, 0},  // max_length 30: a name of 30 passes
      {kAll, "/a/n" + n30, false, -265},
      {kAll, "/a/b!c.txt", false, -258},
      {kAll, "/a/aqua", false, -258},  // "Q" folded like the name
      {kAll, "/a/COMMON-NAME", false, -261},
      {kAll, "/a/CPREfix.txt", false, -259},
      {kAll, "/a/cpre", false, -259},  // a prefix or suffix may be the whole name
      {kAll, "/a/name.CSUF", false, -260},
      {kAll, "/a/csuf", false, -260},
      {kAll, "/a/b%c.txt", false, -514},
      {kAll, "/a/fpre.jpg", false, -515},
      {kAll, "/a/x.fsuf", false, -516},
      {kAll, "/a/x.tmp", false, -519},
      {kAll, "/a/XaYbZ", false, -519},
      {kAll, "/a/xyz", false, -519},
      {kAll, "/a/xzy", false, 0},
      {kAll, "/a/xz", false, 0},  // the middle "y" must be there
      {kAll, "/a/a?c", false, -519},
      {kAll, "/a/abc", false, 0},  // "?" is no wildcard
      {kAll, "/a/file-name", false, -517},
      {kAll, "/a/photo.JPG", false, -518},
      {kAll, "/a/.jpg", false, -518},
      {kAll, "/a/jpg", false, 0},  // no dot, no extension
      {kAll, "/a/x.jpg.txt", false, 0},
      {kAll, "/a/DIR-NAME/ok.txt", false, -773},
      {kAll, "/a/dir-name", true, -773},
      {kAll, "/a/dir-name", false, 0},  // Directory rules are not for a file's name
      {kAll, "/a/file-name/ok.txt", false, 0},  // nor File rules for folders
      {kAll, "/a/b!c/ok.txt", false, -258},
      {kAll, "/a/x^y/ok.txt", false, -770},
      {kAll, "/a/DPREx/ok.txt", false, -771},
      {kAll, "/a/y.d/ok.txt", false, -775},
      {kAll, "/a/xdsuf/ok.txt", false, -772},
      {kAll, "/dir-name/b^c/ok.txt", false, -773},  // the first folder decides
      {kAll, "/n" + n30 + "/ok.txt", false, -265},
      {kAll, "//a///x^y//", true, -770},
      {"[Common]\nblack_name = \"\\xc3\\x89t\\xc3\\xa9\"\n", "/a/\xc3\x89T\xc3\xa9", false, -261},  // UTF-8 "Été"
      {"[Common]\nblack_name = \"\\xc3\\x89t\\xc3\\xa9\"\n", "/a/\xc3\xa9t\xc3\xa9", false, 0},  // only ASCII folds
      // A directory part of 4096 bytes or more, or a name of 512, does not split.
      {"", "/a/" + n511, false, 0},
      {"", "/a/n" + n511, false, -1},
      {"", d4095 + "/f", false, 0},
      {"", d4095 + "d/f", false, -1},
      {"", d4095 + "d", true, -1},
  });
}

// Each path breaks exactly two rules that follow each other in the order:
// the earlier one's code must come out. Together the rows cover every
// neighbouring pair, so swapping any two neighbours fails a row.
TEST(FilterMatch, OfTwoRulesBrokenTheEarlierDecides) {
  ExpectCodes(false, {
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
      {"[File]\nblack_ext = \"b\"\n[Directory]\nblack_name = \"d\"\n", "/d/a.b", false, -518},  // name before folders
      {"[Common]\nblack_suffix = \"b\"\n[Directory]\nblack_char = \"a\"\n", "/ab", true, -260},
      {"[Directory]\nblack_char = \"a\"\nblack_name = \"ab\"\n", "/ab", true, -770},
      {"[Directory]\nblack_name = \"ab\"\nblack_prefix = \"a\"\n", "/ab", true, -773},
      {"[Directory]\nblack_prefix = \"a\"\nblack_glob = \"a*\"\n", "/ab", true, -771},
      {"[Directory]\nblack_glob = \"a*\"\nblack_suffix = \"b\"\n", "/ab", true, -775},
      // An earlier folder before a later one.
      {"[Common]\nmax_length = 2\n[Directory]\nblack_suffix = \"b\"\n", "/ab/abc", true, -772},
  });
}

TEST(FilterMatch, WhiteListAdmitsByNameExtensionOrFolder) {
  const char keep[] = "[Common]\nwhite_name = \"Keep\"\n[File]\nwhite_ext = \"jpg\"\n";
  const char all[] = "[Common]\nwhite_name = \"*\"\n";
  ExpectCodes(true, {
      {keep, "/a/b/x.JPG", false, 0}, {keep, "/a/b/x.png", false, -1}, {keep, "/a/KEEP/x.png", false, 0},
      {keep, "/a/b/keep", false, 0}, {keep, "/keep/b", true, 0}, {keep, "/a/b", true, -1},
      {keep, "/a/x.jpg", true, -1},  // a folder has no extension
      {all, "/any/thing.at.all", false, 0}, {all, "/any", true, 0}, {all, "/", true, -1},
      {all, "/a/" + std::string(512, 'n'), false, -1},
      {"[File]\nwhite_ext = \"*\"\n", "/a/no-extension", false, 0},
      {"[File]\nwhite_ext = \"*\"\n", "/a", true, -1},
      {"[Common]\nwhite_name = \"keep*\"\n", "/a/keeper", false, -1},  // only "*" alone is special
      {"", "/a/b.jpg", false, -1},
  });
}

TEST(FilterMatch, SizesAndPathLengths) {
  BlackList list(kAll), none("");  // 0 is no limit
  EXPECT_EQ(0, filter_test_file_size(&list.record, 1000));
  EXPECT_EQ(-523, filter_test_file_size(&list.record, 1001));
  EXPECT_EQ(0, filter_test_full_path_size(&list.record, 100, 200));
  EXPECT_EQ(-266, filter_test_full_path_size(&list.record, 101, 201));
  EXPECT_EQ(-268, filter_test_full_path_size(&list.record, 100, 201));
  EXPECT_EQ(0, filter_test_file_size(&none.record, UINT64_MAX));
  EXPECT_EQ(0, filter_test_full_path_size(&none.record, UINT64_MAX, UINT64_MAX));
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

}  // namespace
