// The filter files' text format: a schema-driven reader and printer.
//
// A file holds "[Section]" headers, each followed by "key = value" lines;
// blanks (space, tab, vertical tab, form feed, carriage return) may lead a
// line, "#" starts a comment, and a string-set value whose line ends right
// after a "," goes on in the next line, which begins with a double quote.
// Values are numbers (digits, optionally "." and digits; a fractional part
// is read and dropped), quoted strings with C escapes, or sets of quoted
// strings separated by ",". A line is read as fgets reads it into a buffer
// of 6145 bytes: pieces of at most 6144 bytes, the line feed counted, each a
// line of its own for the messages (so a line of 6144 characters is followed
// by an empty line holding its line feed). A file holds at most
// kFilterFileMax bytes. Section and key names hold at most 32 letters,
// digits, "-" or "_"; numbers and strings at most 1023 characters (strings
// counted after unescaping; a number's dot counted).
//
// The reader knows the records only through a schema: a static table of
// sections, each with the offset of its sub-record in the target record,
// and keys, each with its kind and the offset of its value in the
// sub-record. Two keys that share an offset fill the same field (the later
// one is an alias): both are read, only the first is printed.
//
// Nothing here logs. The reader's two messages are part of its interface:
// "warning: unknown key (%s)\n" on standard output and
// "parser: %s at line %d\n" on standard error.
#ifndef PLOVO_FILTER_FILTER_PARSER_H
#define PLOVO_FILTER_FILTER_PARSER_H

#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "filter/vt-string.h"

// Key kinds: how a value is written and stored.
enum {
  KEY_KIND_UINT32 = 0,      // integer, stored as uint32_t
  KEY_KIND_UINT64 = 1,      // integer, stored as uint64_t
  KEY_KIND_STRING = 2,      // one quoted string, stored as vt_string
  KEY_KIND_STRING_SET = 3,  // quoted strings separated by ",", stored as vt_string_set
};

struct key_schema {
  const char* name;
  uint64_t kind;
  uint64_t offset;  // of the value inside the section's sub-record
};

struct section_schema {
  const char* name;
  uint64_t offset;  // of the sub-record inside the target record
  uint64_t key_count;
  key_schema keys[64];
};

struct filter_schema {
  uint64_t one;  // 1 in every schema
  uint64_t section_count;
  section_schema sections[32];
};

// The reader's error codes. parse() reports them negated; the missing
// separator of a string set is reported as +22, which the error message
// names "Unknown error".
enum {
  PARSE_NO_ERROR = 0,
  PARSE_SECTION_MISSING_LEFT_BRACKET = 1,  // never raised
  PARSE_SECTION_MISSING_RIGHT_BRACKET = 2,
  PARSE_SECTION_MISSING_SECTION = 3,
  PARSE_SECTION_ILLEGAL_CHARACTER = 4,
  PARSE_SECTION_TOO_LONG = 5,
  PARSE_SECTION_UNDEFINED_SECTION = 6,
  PARSE_KEY_MISSING_KEY = 7,
  PARSE_KEY_ILLEGAL_CHARACTER = 8,
  PARSE_KEY_TOO_LONG = 9,
  PARSE_KEY_UNDEFINED_KEY = 10,  // never raised: unknown keys are warnings
  PARSE_VALUE_NUMERIC_MISSING_INTEGER_PART = 11,
  PARSE_VALUE_NUMERIC_MISSING_FRACTIONAL_PART = 12,
  PARSE_VALUE_NUMERIC_MISSING_VALUE = 13,
  PARSE_VALUE_NUMERIC_ILLEGAL_SYNTAX = 14,  // also a number too large for its field
  PARSE_VALUE_STRING_MISSING_LEFT_QUOTE = 15,
  PARSE_VALUE_STRING_MISSING_RIGHT_QUOTE = 16,  // the line ends inside a string
  PARSE_VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE = 17,
  PARSE_VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE = 18,
  PARSE_VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE = 19,
  PARSE_VALUE_STRING_ILLEGAL_CHARACTER = 20,  // the text ends, or a NUL byte comes, inside a string
  PARSE_VALUE_STRING_EMPTY = 21,
  PARSE_VALUE_SET_MISSING_SEPARATER = 22,
  PARSE_VALUE_TOO_LONG = 23,
  PARSE_LINE_NOT_ENDED = 24,
  PARSE_LINE_NOT_EXPECTED = 25,
  PARSE_INTERNAL_ERROR = 26,  // also: not a regular file (line 0), a file over kFilterFileMax bytes
};

constexpr size_t kFilterLineBuffer = 6145;  // so pieces of at most 6144 bytes, the line feed counted
constexpr size_t kFilterNameMax = 32;
constexpr size_t kFilterValueMax = 1023;
// A list file is a few kilobytes; the bound keeps what a hostile one can
// cost (memory, and time per path tested) small.
constexpr size_t kFilterFileMax = 1 << 20;

// The name of an error code as the error message prints it: the table's name
// for 0 to -26, "Unknown error" for anything else.
const char* parse_error_name(int code);

// Reads the file at path into record, whose layout schema describes and
// which the caller has initialised. Returns 0 on success, 1 on success with
// at least one unknown key (each warned of on standard output), 2 when the
// file cannot be opened (no message) or on a parse error (printed on
// standard error with its line). A path that is not a regular file (a FIFO,
// a device, a folder) is refused unread: INTERNAL_ERROR at line 0. A file
// longer than kFilterFileMax bytes fails with INTERNAL_ERROR at the line
// that passes the bound. After 2 the record may be partly filled; the
// caller destroys it.
int parse(const char* path, const filter_schema* schema, void* record);
// The same from an open stream, which stays open; the size bound holds.
int parse_stream(FILE* stream, const filter_schema* schema, void* record);

// Exact, case-sensitive search by name; nullptr when there is none.
const section_schema* search_section_schema(const char* name, const filter_schema* schema);
const key_schema* search_key_schema(const char* name, const section_schema* section);

// Prints record as the reader reads it: every section of the schema with
// its header; in each, every field once, under the first key naming its
// offset; numbers always, strings and sets only when not empty; a set of
// more than five members goes on in continuation lines, five a line.
// Returns 0, or -1 when the stream reports a write error.
int print_record(FILE* stream, const filter_schema* schema, const void* record);

// Writes s in the printed form into out (quotes not included, no NUL):
// printable ASCII as it is except "$", "@" and "`"; a backslash before a
// double quote or a backslash; tab, line feed, vertical tab and form feed as
// \t \n \v \f; every other byte as \x and two lower-case hex digits. At most
// kFilterValueMax characters are written; a string that needs more is cut
// before the first byte that does not fit. Returns how many bytes of s were
// written; *written receives the characters written.
size_t vt_string_escape(const vt_string* s, char out[kFilterValueMax], size_t* written);

#endif
