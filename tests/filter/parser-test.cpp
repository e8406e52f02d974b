// The filter file reader and printer: every error at its line with its
// message, what reads into which field, and that what is printed reads back.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

#include "bounded.h"
#include "filter-text.h"
#include "filter/filter.h"
#include "sandbox.h"

namespace {

using plovo_test::BlackList;
using plovo_test::Member;
using plovo_test::WhiteList;

const std::string kEmptyBlack =
    "[Version]\nmajor = 0\nminor = 0\n[Common]\nmax_length = 0\nmax_path = 0\nmax_dst_path = 0\n"
    "[File]\nmax_size = 0\n[Directory]\n";

TEST(FilterParse, EachErrorIsReportedWithItsNameAndLine) {
  const std::string s33(33, 's');
  const struct {
    const char* text;
    std::string extra;  // appended to text
    const char* message;
  } cases[] = {
      {"# comment\n\n[Common\n", "", "SECTION_MISSING_RIGHT_BRACKET at line 3"},
      {"[Com#mon]\n", "", "SECTION_MISSING_RIGHT_BRACKET at line 1"},
      {"[]\n", "", "SECTION_MISSING_SECTION at line 1"},
      {"[Com mon]\n", "", "SECTION_ILLEGAL_CHARACTER at line 1"},
      {"[", s33 + "]\n", "SECTION_TOO_LONG at line 1"},
      {"[", std::string(32, 's') + "]\n", "SECTION_UNDEFINED_SECTION at line 1"},
      {"[Common]\n[common]\n", "", "SECTION_UNDEFINED_SECTION at line 2"},
      {"[Common]\n= 5\n", "", "KEY_MISSING_KEY at line 2"},
      {"[Common]\nmax_path 5\n", "", "KEY_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nmax.path = 5\n", "", "KEY_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\n", s33 + " = 5\n", "KEY_TOO_LONG at line 2"},
      {"[Common]\nmax_path = x\n", "", "VALUE_NUMERIC_MISSING_INTEGER_PART at line 2"},
      {"[Common]\nmax_path = 5.\n", "", "VALUE_NUMERIC_MISSING_FRACTIONAL_PART at line 2"},
      {"[Common]\nmax_path =   \n", "", "VALUE_NUMERIC_MISSING_VALUE at line 2"},
      {"[Common]\nmax_path = 5x\n", "", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Common]\nmax_path = 18446744073709551616\n", "", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Version]\nmajor = 4294967296\n", "", "VALUE_NUMERIC_ILLEGAL_SYNTAX at line 2"},
      {"[Common]\nblack_name = abc\n", "", "VALUE_STRING_MISSING_LEFT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"a\", b\n", "", "VALUE_STRING_MISSING_LEFT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"abc\n", "", "VALUE_STRING_MISSING_RIGHT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"abc\\\n", "", "VALUE_STRING_MISSING_RIGHT_QUOTE at line 2"},
      {"[Common]\nblack_name = \"\\q\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE at line 2"},
      {"[Common]\nblack_name = \"\\8\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE at line 2"},
      {"[Common]\nblack_name = \"\\x4g\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE at line 2"},
      {"[Common]\nblack_name = \"\\x4\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE at line 2"},
      {"[Common]\nblack_name = \"\\400\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE at line 2"},
      {"[Common]\nblack_name = \"\\018\"\n", "", "VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE at line 2"},
      {"[Common]\nblack_name = \"abc", "", "VALUE_STRING_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nblack_name = \"a", std::string(1, '\0') + "\"\n", "VALUE_STRING_ILLEGAL_CHARACTER at line 2"},
      {"[Common]\nblack_name = \"\"\n", "", "VALUE_STRING_EMPTY at line 2"},
      {"[Common]\nblack_name = \"a\" \"b\"\n", "", "Unknown error at line 2"},
      {"[Common]\nblack_name = \"", std::string(1024, 'a') + "\"\n", "VALUE_TOO_LONG at line 2"},
      {"[Common]\nblack_name = \"", std::string(1024, '$') + "\"\n", "VALUE_TOO_LONG at line 2"},
      {"[Common]\nmax_path = ", std::string(1024, '1') + "\n", "VALUE_TOO_LONG at line 2"},
      {"[Common]\nmax_path = ", std::string(1022, '0') + ".0\n", "VALUE_TOO_LONG at line 2"},  // the dot counts
      {"[Common]  x\n", "", "LINE_NOT_ENDED at line 1"},
      {"[Common]\nmax_path = 5 6\n", "", "LINE_NOT_ENDED at line 2"},
      {"[Common]\nblack_char = \"a\", \"b\"\n", "", "LINE_NOT_ENDED at line 2"},
      {"[Common]\nblack_name = \"a\" x\n", "", "LINE_NOT_ENDED at line 2"},
      {"# before any section\nmax_path = 5\n", "", "LINE_NOT_EXPECTED at line 2"},
      {"[Common]\n\"a\"\n", "", "LINE_NOT_EXPECTED at line 2"},
      {"[Common]\nblack_name = \"a\",\nmax_path = 5\n", "", "LINE_NOT_EXPECTED at line 3"},
      {"[Common]\nblack_name = \"a\",\n[File]\n", "", "LINE_NOT_EXPECTED at line 3"},
  };
  for (const auto& c : cases) {
    const std::string text = c.text + c.extra;
    SCOPED_TRACE(text.substr(0, 80));
    BlackList list(text);
    EXPECT_EQ(2, list.output.result);
    EXPECT_EQ(std::string("parser: ") + c.message + "\n", list.output.err);
  }
}

TEST(FilterParse, ErrorNamesOutsideTheTableAreUnknown) {
  EXPECT_STREQ("NO_ERROR", parse_error_name(0));
  EXPECT_STREQ("INTERNAL_ERROR", parse_error_name(-26));
  EXPECT_STREQ("Unknown error", parse_error_name(-27));
  EXPECT_STREQ("Unknown error", parse_error_name(22));
}

TEST(FilterParse, AcceptedTextsPrintAsExpected) {
  const struct {
    const char* name;
    std::string text;
    int result;
    std::string printed;
  } cases[] = {
      {"comments and blanks only", "# one\n\n  \t# two\n\r\n", 0, kEmptyBlack},
      {"a header followed by a comment", "[Common]  \t# all names\n", 0, kEmptyBlack},
      {"CRLF line ends and a carriage return as a blank",
       "[Common]\r\nmax_path = 7\r\n\rblack_name = \"a\"\r\n", 0,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_name = \"a\"\nmax_length = 0\nmax_path = 7\n"
       "max_dst_path = 0\n[File]\nmax_size = 0\n[Directory]\n"},
      {"the largest 64-bit value", "[File]\nmax_size = 18446744073709551615\n", 0,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nmax_length = 0\nmax_path = 0\nmax_dst_path = 0\n"
       "[File]\nmax_size = 18446744073709551615\n[Directory]\n"},
      {"a fractional part is dropped; the last of two values wins",
       "[Version]\nmajor = 3.75 # three\nmajor = 4\nminor = 0004294967295\n", 0,
       "[Version]\nmajor = 4\nminor = 4294967295\n" + kEmptyBlack.substr(30)},
      {"aliases fill their field and print under its first name",
       "[Common]\nblack_path_prefix_selective_sync = \"/p\"\nblack_dir_prefix = \"/q\"\n"
       "[File]\nblack_ext_selective_sync = \"jpg\"\nblack_name_selective_sync = \"n\"\n"
       "max_size_selective_sync = 9\n",
       0,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_dir_prefix = \"/p\", \"/q\"\nmax_length = 0\n"
       "max_path = 0\nmax_dst_path = 0\n[File]\nblack_ext = \"jpg\"\nblack_name = \"n\"\nmax_size = 9\n"
       "[Directory]\n"},
      {"a number of 1023 characters", "[Common]\nmax_path = " + std::string(1023, '0') + "\n", 0, kEmptyBlack},
      {"a number of 1023 characters, the dot included",
       "[Common]\nmax_path = " + std::string(1021, '0') + ".0\n", 0, kEmptyBlack},
      {"unknown keys are read by their look and dropped",
       "[Common]\nfuture = \"x\",\n  \"y\"\nlater = 12.5\nmax_path = 1\n", 1,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nmax_length = 0\nmax_path = 1\nmax_dst_path = 0\n"
       "[File]\nmax_size = 0\n[Directory]\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    BlackList list(c.text);
    EXPECT_EQ(c.result, list.output.result) << list.output.err;
    EXPECT_EQ("", list.output.err);
    EXPECT_EQ(c.printed, list.Print());
  }
}

TEST(FilterParse, UnknownKeysAreWarnedOfOnStdout) {
  BlackList list("[Common]\nfuture = \"x\"\n[File]\nlater = 3\n");
  EXPECT_EQ(1, list.output.result);
  EXPECT_EQ("warning: unknown key (future)\nwarning: unknown key (later)\n", list.output.out);
}

TEST(FilterParse, EscapesReadAsTheirBytes) {
  BlackList list(
      "[Directory]\nblack_name = \"\\a\\b\\f\\n\\r\\t\\v\", \"\\'\\\"\\\\\\?\", \"\\x41\\x4a\\x4B\", \"\\101\\000\\377\"\n");
  ASSERT_EQ(0, list.output.result) << list.output.err;
  const vt_string_set& names = list.record.directory.black_name;
  ASSERT_EQ(4u, names.count);
  EXPECT_EQ("\a\b\f\n\r\t\v", Member(names, 0));
  EXPECT_EQ("'\"\\?", Member(names, 1));
  EXPECT_EQ("AJK", Member(names, 2));
  EXPECT_EQ(std::string("A\0\xff", 3), Member(names, 3));
}

TEST(FilterParse, ContinuationLinesAddToTheSetInFileOrder) {
  BlackList list("[File]\nblack_ext = \"a\", \"b\",  # more below\n\n# between\n  \"c\",\n\"d\"\nmax_size = 1\n");
  ASSERT_EQ(0, list.output.result) << list.output.err;
  const vt_string_set& ext = list.record.file.black_ext;
  ASSERT_EQ(4u, ext.count);
  EXPECT_EQ("a", Member(ext, 0));
  EXPECT_EQ("d", Member(ext, 3));
  EXPECT_EQ(1u, list.record.file.max_size);
}

TEST(FilterPrint, SixMembersPrintFiveOnTheFirstLineAndReadBack) {
  WhiteList list("[File]\nwhite_ext = \"a\", \"b\", \"c\", \"d\", \"e\", \"f\"\n");
  ASSERT_EQ(0, list.output.result);
  const std::string printed = list.Print();
  EXPECT_EQ(
      "[Version]\nmajor = 0\nminor = 0\n[Common]\n[File]\n"
      "white_ext = \"a\", \"b\", \"c\", \"d\", \"e\",\n\"f\"\n",
      printed);
  WhiteList again(printed);
  ASSERT_EQ(0, again.output.result);
  ASSERT_EQ(6u, again.record.file.white_ext.count);
  for (size_t i = 0; i < 6; ++i) EXPECT_EQ(Member(list.record.file.white_ext, i), Member(again.record.file.white_ext, i));

  WhiteList five("[File]\nwhite_ext = \"a\", \"b\", \"c\", \"d\", \"e\"\n");
  EXPECT_NE(std::string::npos, five.Print().find("white_ext = \"a\", \"b\", \"c\", \"d\", \"e\"\n"));
}

TEST(FilterPrint, EscapesRoundTrip) {
  const std::string raw("\x01\"\\$@`\t\n\v\f\r\x7f\xff ok", 16);
  black_list_filter filter;
  filter_init(&filter);
  ASSERT_EQ(0, vt_string_assign(&filter.file.black_char, raw.data(), raw.size()));
  const std::string printed = plovo_test::PrintText(black_list_filter_schema, &filter);
  filter_destroy(&filter);
  EXPECT_NE(std::string::npos,
            printed.find("black_char = \"\\x01\\\"\\\\\\x24\\x40\\x60\\t\\n\\v\\f\\x0d\\x7f\\xff ok\"\n"))
      << printed;
  BlackList again(printed);
  ASSERT_EQ(0, again.output.result) << again.output.err;
  EXPECT_EQ(raw, std::string(again.record.file.black_char.data, again.record.file.black_char.length));
}

TEST(FilterPrint, AStringIsCutAtWholeEscapesWithin1023Characters) {
  // 1023 "$" read (the limit counts unescaped bytes) but need 4092 to print:
  // 255 whole escapes fit.
  BlackList list("[File]\nblack_name = \"" + std::string(1023, '$') + "\"\n");
  ASSERT_EQ(0, list.output.result) << list.output.err;
  std::string expected = "black_name = \"";
  for (int i = 0; i < 255; ++i) expected += "\\x24";
  EXPECT_NE(std::string::npos, list.Print().find(expected + "\"\n"));
  BlackList again(list.Print());
  EXPECT_EQ(std::string(255, '$'), Member(again.record.file.black_name, 0));
}

TEST(FilterPrint, APlainStringIsCutAt1023Characters) {
  const struct {
    std::string raw;
    std::string printed;  // between the quotes
  } cases[] = {
      {std::string(1022, 'a'), std::string(1022, 'a')},
      {std::string(1023, 'a'), std::string(1023, 'a')},
      {std::string(1024, 'a'), std::string(1023, 'a')},
      {std::string(1022, 'a') + "$", std::string(1022, 'a')},  // the escape does not fit whole
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.raw.size());
    black_list_filter filter;
    filter_init(&filter);
    ASSERT_EQ(0, vt_string_assign(&filter.directory.black_char, c.raw.data(), c.raw.size()));
    const std::string printed = plovo_test::PrintText(black_list_filter_schema, &filter);
    filter_destroy(&filter);
    EXPECT_NE(std::string::npos, printed.find("[Directory]\nblack_char = \"" + c.printed + "\"\n")) << printed.size();
  }
}

TEST(FilterPrint, CopyIsDeepAndEqual) {
  BlackList list("[Version]\nminor = 2\n[Common]\nblack_char = \"x\"\n[File]\nblack_glob = \"*.a\", \"b*\"\n"
                 "[Directory]\nblack_suffix = \"~\"\n");
  black_list_filter copy;
  filter_init(&copy);
  ASSERT_EQ(0, filter_copy(&copy, &list.record));
  ASSERT_EQ(0, vt_string_set_remove(&list.record.file.black_glob, "b*", 2));
  EXPECT_EQ(2u, copy.file.black_glob.count);
  ASSERT_EQ(0, vt_string_set_insert(&list.record.file.black_glob, "b*", 2));
  EXPECT_EQ(list.Print(), plovo_test::PrintText(black_list_filter_schema, &copy));
  filter_destroy(&copy);
}

TEST(FilterParse, MissingFileGivesTwo) {
  black_list_filter filter;
  filter_init(&filter);
  EXPECT_EQ(2, filter_read("/nonexistent/plovo/blacklist.filter", &filter));
  filter_destroy(&filter);
}

TEST(FilterParse, LinesAreReadInPiecesOf6144BytesWithTheLineFeed) {
  // Each piece counts as a line: the line "x" after the comment shows where
  // the count stands.
  const struct {
    size_t commentLength;  // characters of the comment line, "#" included
    const char* message;
  } cases[] = {
      {6143, "parser: KEY_ILLEGAL_CHARACTER at line 3\n"},  // the line and its line feed in one piece
      {6144, "parser: KEY_ILLEGAL_CHARACTER at line 4\n"},  // the line feed alone in a second piece
      {6145, "parser: KEY_MISSING_KEY at line 3\n"},        // the 6145th character begins a line
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.commentLength);
    BlackList list("[Common]\n#" + std::string(c.commentLength - 2, '%') + "%\nx\n");
    EXPECT_EQ(2, list.output.result);
    EXPECT_EQ(c.message, list.output.err);
  }
}

TEST(FilterParse, AFileOverOneMebibyteFailsAtTheLineThatPassesTheBound) {
  // Comment lines of 1024 bytes after the header, the last one shortened so
  // that the text is exactly the bound.
  std::string text = "[Common]\n";
  int lines = 1;
  while (text.size() < kFilterFileMax) {
    const size_t room = kFilterFileMax - text.size();
    text += "#" + std::string(std::min<size_t>(room, 1024) - 2, 'c') + "\n";
    ++lines;
  }
  ASSERT_EQ(kFilterFileMax, text.size());
  BlackList exact(text);
  EXPECT_EQ(0, exact.output.result) << exact.output.err;
  BlackList over(text + "\n");
  EXPECT_EQ(2, over.output.result);
  EXPECT_EQ("parser: INTERNAL_ERROR at line " + std::to_string(lines + 1) + "\n", over.output.err);
}

class FilterFile : public plovo_test::SandboxTest {
 protected:
  // filter_read of path, bounded in time; its stderr in *err.
  int Read(const std::string& path, std::string* err) {
    black_list_filter filter;
    filter_init(&filter);
    ::testing::internal::CaptureStderr();
    const int result = plovo_test::Bounded([&] { return filter_read(path.c_str(), &filter); },
                                           [&] { close(open(path.c_str(), O_WRONLY | O_NONBLOCK)); });
    *err = ::testing::internal::GetCapturedStderr();
    filter_destroy(&filter);
    return result;
  }
};

TEST_F(FilterFile, OnlyARegularFileIsRead) {
  ASSERT_EQ(0, mkfifo(Path("/fifo").c_str(), 0600));
  MakeDir("/folder");
  WriteFile("/regular", "[Common]\nmax_path = 1\n");
  const struct {
    std::string path;
    int result;
    const char* err;
  } cases[] = {
      {Path("/fifo"), 2, "parser: INTERNAL_ERROR at line 0\n"},
      {Path("/folder"), 2, "parser: INTERNAL_ERROR at line 0\n"},
      {"/dev/null", 2, "parser: INTERNAL_ERROR at line 0\n"},
      {Path("/missing"), 2, ""},
      {Path("/regular"), 0, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    std::string err;
    EXPECT_EQ(c.result, Read(c.path, &err));
    EXPECT_EQ(c.err, err);
  }
}

TEST(FilterSchema, SearchesAreExactAndCaseSensitive) {
  const section_schema* common = search_section_schema("Common", &black_list_filter_schema);
  ASSERT_NE(nullptr, common);
  EXPECT_EQ(nullptr, search_section_schema("common", &black_list_filter_schema));
  EXPECT_EQ(nullptr, search_section_schema("Directory", &white_list_schema));
  const key_schema* alias = search_key_schema("black_path_prefix_selective_sync", common);
  ASSERT_NE(nullptr, alias);
  EXPECT_EQ(search_key_schema("black_dir_prefix", common)->offset, alias->offset);
  EXPECT_EQ(nullptr, search_key_schema("Black_name", common));
}

}  // namespace
