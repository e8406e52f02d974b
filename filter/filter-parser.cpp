#include "filter/filter-parser.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cinttypes>
#include <cstring>

namespace {

const char* const kErrorNames[] = {
    "NO_ERROR",
    "SECTION_MISSING_LEFT_BRACKET",
    "SECTION_MISSING_RIGHT_BRACKET",
    "SECTION_MISSING_SECTION",
    "SECTION_ILLEGAL_CHARACTER",
    "SECTION_TOO_LONG",
    "SECTION_UNDEFINED_SECTION",
    "KEY_MISSING_KEY",
    "KEY_ILLEGAL_CHARACTER",
    "KEY_TOO_LONG",
    "KEY_UNDEFINED_KEY",
    "VALUE_NUMERIC_MISSING_INTEGER_PART",
    "VALUE_NUMERIC_MISSING_FRACTIONAL_PART",
    "VALUE_NUMERIC_MISSING_VALUE",
    "VALUE_NUMERIC_ILLEGAL_SYNTAX",
    "VALUE_STRING_MISSING_LEFT_QUOTE",
    "VALUE_STRING_MISSING_RIGHT_QUOTE",
    "VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE",
    "VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE",
    "VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE",
    "VALUE_STRING_ILLEGAL_CHARACTER",
    "VALUE_STRING_EMPTY",
    "VALUE_SET_MISSING_SEPARATER",
    "VALUE_TOO_LONG",
    "LINE_NOT_ENDED",
    "LINE_NOT_EXPECTED",
    "INTERNAL_ERROR",
};
constexpr int kErrorCount = sizeof(kErrorNames) / sizeof(kErrorNames[0]);

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\v' || c == '\f' || c == '\r'; }
bool IsDigit(char c) { return c >= '0' && c <= '9'; }
bool IsNameChar(char c) {
  return IsDigit(c) || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '-' || c == '_';
}
int HexValue(char c) {
  if (IsDigit(c)) return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}
bool IsOctal(char c) { return c >= '0' && c <= '7'; }

enum class Expect { kSection, kKey, kContinuation };

// The reader's state between lines and its position in the current line.
struct Reader {
  const filter_schema* schema;
  char* record;
  const section_schema* section = nullptr;
  char* sectionRecord = nullptr;
  Expect expect = Expect::kSection;
  vt_string_set* continued = nullptr;  // what a continuation line adds to; nullptr drops it
  int unknownKeys = 0;
  const char* p = nullptr;
  const char* end = nullptr;
  bool newline = false;  // whether the line ended with a line feed
};

void SkipBlanks(Reader& r) {
  while (r.p < r.end && IsBlank(*r.p)) ++r.p;
}
// Whether nothing but a comment is left (blanks already skipped).
bool AtLineEnd(const Reader& r) { return r.p == r.end || *r.p == '#'; }

// Reads one line into buffer as fgets would, without the line feed. Returns
// the bytes taken from the stream, the line feed included; 0 at the end.
size_t ReadLine(FILE* stream, char* buffer, size_t* length, bool* newline) {
  size_t n = 0;
  int c = 0;
  while (n < kFilterLineBuffer - 1 && (c = getc(stream)) != EOF) {
    buffer[n++] = static_cast<char>(c);
    if (c == '\n') break;
  }
  *newline = n > 0 && buffer[n - 1] == '\n';
  *length = *newline ? n - 1 : n;
  return n;
}

int Fail(int error, int lineNumber) {
  fprintf(stderr, "parser: %s at line %d\n", parse_error_name(error), lineNumber);
  return 2;
}

int ParseSection(Reader& r) {
  ++r.p;  // "["
  char name[kFilterNameMax + 1];
  size_t n = 0;
  for (;;) {
    if (AtLineEnd(r)) return -PARSE_SECTION_MISSING_RIGHT_BRACKET;
    const char c = *r.p++;
    if (c == ']') break;
    if (!IsNameChar(c)) return -PARSE_SECTION_ILLEGAL_CHARACTER;
    if (n == kFilterNameMax) return -PARSE_SECTION_TOO_LONG;
    name[n++] = c;
  }
  if (n == 0) return -PARSE_SECTION_MISSING_SECTION;
  name[n] = '\0';
  SkipBlanks(r);
  if (!AtLineEnd(r)) return -PARSE_LINE_NOT_ENDED;
  const section_schema* section = search_section_schema(name, r.schema);
  if (section == nullptr) return -PARSE_SECTION_UNDEFINED_SECTION;
  r.section = section;
  r.sectionRecord = r.record + section->offset;
  r.expect = Expect::kKey;
  return 0;
}

// A number and the rest of its line. *value receives the integer part;
// *overflow tells that it does not fit 64 bits.
int ParseNumber(Reader& r, uint64_t* value, bool* overflow) {
  if (AtLineEnd(r)) return -PARSE_VALUE_NUMERIC_MISSING_VALUE;
  if (!IsDigit(*r.p)) return -PARSE_VALUE_NUMERIC_MISSING_INTEGER_PART;
  size_t length = 0;
  *value = 0;
  *overflow = false;
  for (; r.p < r.end && IsDigit(*r.p); ++r.p) {
    if (++length > kFilterValueMax) return -PARSE_VALUE_TOO_LONG;
    const unsigned digit = static_cast<unsigned>(*r.p - '0');
    if (*value > (UINT64_MAX - digit) / 10) *overflow = true;
    *value = *value * 10 + digit;
  }
  if (r.p < r.end && *r.p == '.') {
    ++r.p;
    if (r.p == r.end || !IsDigit(*r.p)) return -PARSE_VALUE_NUMERIC_MISSING_FRACTIONAL_PART;
    for (++length; r.p < r.end && IsDigit(*r.p); ++r.p) {
      if (++length > kFilterValueMax) return -PARSE_VALUE_TOO_LONG;
    }
  }
  if (r.p < r.end && !IsBlank(*r.p) && *r.p != '#') return -PARSE_VALUE_NUMERIC_ILLEGAL_SYNTAX;
  SkipBlanks(r);
  return AtLineEnd(r) ? 0 : -PARSE_LINE_NOT_ENDED;
}

// One quoted string, unescaped into out (kFilterValueMax bytes).
int ParseString(Reader& r, char* out, size_t* length) {
  // Where the line runs out inside a string: a line feed ends the line, the
  // end of the text (or of the line buffer) ends everything.
  const int ranOut = r.newline ? -PARSE_VALUE_STRING_MISSING_RIGHT_QUOTE : -PARSE_VALUE_STRING_ILLEGAL_CHARACTER;
  ++r.p;  // the opening quote
  size_t n = 0;
  for (;;) {
    if (r.p == r.end) return ranOut;
    char c = *r.p++;
    if (c == '"') break;
    if (c == '\0') return -PARSE_VALUE_STRING_ILLEGAL_CHARACTER;
    if (c == '\\') {
      if (r.p == r.end) return ranOut;
      const char e = *r.p++;
      switch (e) {
        case 'a': c = '\a'; break;
        case 'b': c = '\b'; break;
        case 'f': c = '\f'; break;
        case 'n': c = '\n'; break;
        case 'r': c = '\r'; break;
        case 't': c = '\t'; break;
        case 'v': c = '\v'; break;
        case '\'': case '"': case '\\': case '?': c = e; break;
        case 'x':
          if (r.end - r.p < 2 || HexValue(r.p[0]) < 0 || HexValue(r.p[1]) < 0) {
            return -PARSE_VALUE_STRING_ESCAPE_ILLEGAL_HEX_VALUE;
          }
          c = static_cast<char>(HexValue(r.p[0]) * 16 + HexValue(r.p[1]));
          r.p += 2;
          break;
        default:
          if (!IsOctal(e)) return -PARSE_VALUE_STRING_ESCAPE_ILLEGAL_SEQUENCE;
          if (e > '3' || r.end - r.p < 2 || !IsOctal(r.p[0]) || !IsOctal(r.p[1])) {
            return -PARSE_VALUE_STRING_ESCAPE_ILLEGAL_OCT_VALUE;
          }
          c = static_cast<char>((e - '0') * 64 + (r.p[0] - '0') * 8 + (r.p[1] - '0'));
          r.p += 2;
      }
    }
    if (n == kFilterValueMax) return -PARSE_VALUE_TOO_LONG;
    out[n++] = c;
  }
  if (n == 0) return -PARSE_VALUE_STRING_EMPTY;
  *length = n;
  return 0;
}

// Members of a set up to the end of the line; set nullptr drops them.
int ParseSetMembers(Reader& r, vt_string_set* set) {
  for (;;) {
    if (r.p == r.end || *r.p != '"') return -PARSE_VALUE_STRING_MISSING_LEFT_QUOTE;
    char member[kFilterValueMax];
    size_t length = 0;
    if (const int error = ParseString(r, member, &length); error != 0) return error;
    if (set != nullptr && vt_string_set_insert(set, member, length) != 0) return -PARSE_INTERNAL_ERROR;
    SkipBlanks(r);
    if (r.p < r.end && *r.p == ',') {
      ++r.p;
      SkipBlanks(r);
      if (AtLineEnd(r)) {
        r.expect = Expect::kContinuation;
        r.continued = set;
        return 0;
      }
      continue;
    }
    if (AtLineEnd(r)) {
      r.expect = Expect::kKey;
      return 0;
    }
    // Kept positive on purpose: the message names it "Unknown error".
    if (*r.p == '"') return PARSE_VALUE_SET_MISSING_SEPARATER;
    return -PARSE_LINE_NOT_ENDED;
  }
}

int ParseKey(Reader& r) {
  char name[kFilterNameMax + 1];
  size_t n = 0;
  for (; r.p < r.end && IsNameChar(*r.p); ++r.p) {
    if (n == kFilterNameMax) return -PARSE_KEY_TOO_LONG;
    name[n++] = *r.p;
  }
  if (n == 0) return -PARSE_KEY_MISSING_KEY;
  name[n] = '\0';
  SkipBlanks(r);
  if (r.p == r.end || *r.p != '=') return -PARSE_KEY_ILLEGAL_CHARACTER;
  ++r.p;
  SkipBlanks(r);

  uint64_t number = 0;
  bool overflow = false;
  const key_schema* key = search_key_schema(name, r.section);
  if (key == nullptr) {
    printf("warning: unknown key (%s)\n", name);
    ++r.unknownKeys;
    // Read by its look and dropped.
    if (r.p < r.end && *r.p == '"') return ParseSetMembers(r, nullptr);
    return ParseNumber(r, &number, &overflow);
  }
  char* field = r.sectionRecord + key->offset;
  switch (key->kind) {
    case KEY_KIND_UINT32:
    case KEY_KIND_UINT64: {
      if (const int error = ParseNumber(r, &number, &overflow); error != 0) return error;
      if (key->kind == KEY_KIND_UINT64) {
        if (overflow) return -PARSE_VALUE_NUMERIC_ILLEGAL_SYNTAX;
        memcpy(field, &number, sizeof(uint64_t));
      } else {
        if (overflow || number > UINT32_MAX) return -PARSE_VALUE_NUMERIC_ILLEGAL_SYNTAX;
        const auto small = static_cast<uint32_t>(number);
        memcpy(field, &small, sizeof(uint32_t));
      }
      return 0;
    }
    case KEY_KIND_STRING: {
      if (r.p == r.end || *r.p != '"') return -PARSE_VALUE_STRING_MISSING_LEFT_QUOTE;
      char value[kFilterValueMax];
      size_t length = 0;
      if (const int error = ParseString(r, value, &length); error != 0) return error;
      SkipBlanks(r);
      if (!AtLineEnd(r)) return -PARSE_LINE_NOT_ENDED;
      auto* string = reinterpret_cast<vt_string*>(field);
      return vt_string_assign(string, value, length) == 0 ? 0 : -PARSE_INTERNAL_ERROR;
    }
    case KEY_KIND_STRING_SET:
      return ParseSetMembers(r, reinterpret_cast<vt_string_set*>(field));
    default:
      return -PARSE_INTERNAL_ERROR;
  }
}

int ParseLine(Reader& r) {
  SkipBlanks(r);
  if (AtLineEnd(r)) return 0;
  if (r.expect == Expect::kContinuation) {
    if (*r.p != '"') return -PARSE_LINE_NOT_EXPECTED;
    return ParseSetMembers(r, r.continued);
  }
  if (*r.p == '[') return ParseSection(r);
  if (*r.p == '"' || r.expect == Expect::kSection) return -PARSE_LINE_NOT_EXPECTED;
  return ParseKey(r);
}

void PrintEscaped(FILE* stream, const vt_string& s) {
  char out[kFilterValueMax];
  size_t written = 0;
  vt_string_escape(&s, out, &written);
  fputc('"', stream);
  fwrite(out, 1, written, stream);
  fputc('"', stream);
}

}  // namespace

const char* parse_error_name(int code) {
  if (code > 0 || code <= -kErrorCount) return "Unknown error";
  return kErrorNames[-code];
}

int parse(const char* path, const filter_schema* schema, void* record) {
  // Non-blocking, so that a FIFO without a writer cannot hold the open; the
  // reads that follow block as usual.
  const int fd = open(path, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) return 2;
  struct stat st;
  const int flags = fcntl(fd, F_GETFL);
  // Only a regular file is sure to end: a FIFO, a device or a terminal may
  // feed the reader for ever.
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || flags < 0 || fcntl(fd, F_SETFL, flags & ~O_NONBLOCK) != 0) {
    close(fd);
    return Fail(-PARSE_INTERNAL_ERROR, 0);
  }
  FILE* stream = fdopen(fd, "r");
  if (stream == nullptr) {
    close(fd);
    return 2;
  }
  const int result = parse_stream(stream, schema, record);
  fclose(stream);
  return result;
}

int parse_stream(FILE* stream, const filter_schema* schema, void* record) {
  Reader r;
  r.schema = schema;
  r.record = static_cast<char*>(record);
  char line[kFilterLineBuffer];
  size_t length = 0;
  int lineNumber = 0;
  size_t total = 0;
  while (const size_t taken = ReadLine(stream, line, &length, &r.newline)) {
    ++lineNumber;
    // Bounds the memory a record takes and the time a test against it costs.
    total += taken;
    if (total > kFilterFileMax) return Fail(-PARSE_INTERNAL_ERROR, lineNumber);
    r.p = line;
    r.end = line + length;
    if (const int error = ParseLine(r); error != 0) return Fail(error, lineNumber);
  }
  if (ferror(stream)) return 2;
  return r.unknownKeys > 0 ? 1 : 0;
}

const section_schema* search_section_schema(const char* name, const filter_schema* schema) {
  for (uint64_t i = 0; i < schema->section_count; ++i) {
    if (strcmp(schema->sections[i].name, name) == 0) return &schema->sections[i];
  }
  return nullptr;
}

const key_schema* search_key_schema(const char* name, const section_schema* section) {
  for (uint64_t i = 0; i < section->key_count; ++i) {
    if (strcmp(section->keys[i].name, name) == 0) return &section->keys[i];
  }
  return nullptr;
}

size_t vt_string_escape(const vt_string* s, char out[kFilterValueMax], size_t* written) {
  static const char kHex[] = "0123456789abcdef";
  size_t n = 0;
  size_t i = 0;
  for (; i < s->length; ++i) {
    const auto c = static_cast<unsigned char>(s->data[i]);
    char piece[4];
    size_t k = 2;
    piece[0] = '\\';
    switch (c) {
      case '"': case '\\': piece[1] = static_cast<char>(c); break;
      case '\t': piece[1] = 't'; break;
      case '\n': piece[1] = 'n'; break;
      case '\v': piece[1] = 'v'; break;
      case '\f': piece[1] = 'f'; break;
      default:
        // "$", "@" and "`" mean something to the shells and templates these
        // files pass through.
        if (c >= 0x20 && c < 0x7f && c != '$' && c != '@' && c != '`') {
          piece[0] = static_cast<char>(c);
          k = 1;
        } else {
          piece[1] = 'x';
          piece[2] = kHex[c >> 4];
          piece[3] = kHex[c & 15];
          k = 4;
        }
    }
    if (n + k > kFilterValueMax) break;
    memcpy(out + n, piece, k);
    n += k;
  }
  *written = n;
  return i;
}

int print_record(FILE* stream, const filter_schema* schema, const void* record) {
  const char* base = static_cast<const char*>(record);
  for (uint64_t s = 0; s < schema->section_count; ++s) {
    const section_schema& section = schema->sections[s];
    const char* sub = base + section.offset;
    fprintf(stream, "[%s]\n", section.name);
    for (uint64_t k = 0; k < section.key_count; ++k) {
      const key_schema& key = section.keys[k];
      bool alias = false;
      for (uint64_t j = 0; j < k; ++j) alias = alias || section.keys[j].offset == key.offset;
      if (alias) continue;
      const char* field = sub + key.offset;
      if (key.kind == KEY_KIND_UINT32) {
        uint32_t value;
        memcpy(&value, field, sizeof(value));
        fprintf(stream, "%s = %" PRIu32 "\n", key.name, value);
      } else if (key.kind == KEY_KIND_UINT64) {
        uint64_t value;
        memcpy(&value, field, sizeof(value));
        fprintf(stream, "%s = %" PRIu64 "\n", key.name, value);
      } else if (key.kind == KEY_KIND_STRING) {
        const auto* string = reinterpret_cast<const vt_string*>(field);
        if (string->length == 0) continue;
        fprintf(stream, "%s = ", key.name);
        PrintEscaped(stream, *string);
        fputc('\n', stream);
      } else if (key.kind == KEY_KIND_STRING_SET) {
        const auto* set = reinterpret_cast<const vt_string_set*>(field);
        if (set->count == 0) continue;
        fprintf(stream, "%s = ", key.name);
        for (size_t i = 0; i < set->count; ++i) {
          if (i > 0) fputs(i % 5 == 0 ? ",\n" : ", ", stream);
          PrintEscaped(stream, set->items[i]);
        }
        fputc('\n', stream);
      }
    }
  }
  return ferror(stream) ? -1 : 0;
}
