// Feeds arbitrary bytes to the filter file reader with both lists' schemas.
// Any input must give 0, 1 or 2: never a crash, a hang, a leak or memory out
// of proportion to the input. And every record that reads with 0, printed
// and read again, must read with 0 and give the same record, but for a
// string too long to print whole, which must read back as the part printed.
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "filter/filter.h"

namespace {

// Whether b is what reading a's printed form must give.
bool SameString(const vt_string& a, const vt_string& b) {
  char escaped[kFilterValueMax];
  size_t written = 0;
  const size_t printed = vt_string_escape(&a, escaped, &written);
  return b.length == printed && (printed == 0 || memcmp(a.data, b.data, printed) == 0);
}

bool SameRecord(const filter_schema& schema, const void* a, const void* b) {
  for (uint64_t s = 0; s < schema.section_count; ++s) {
    const section_schema& section = schema.sections[s];
    for (uint64_t k = 0; k < section.key_count; ++k) {
      const key_schema& key = section.keys[k];
      const size_t offset = section.offset + key.offset;
      const char* fa = static_cast<const char*>(a) + offset;
      const char* fb = static_cast<const char*>(b) + offset;
      if (key.kind == KEY_KIND_UINT32 && memcmp(fa, fb, sizeof(uint32_t)) != 0) return false;
      if (key.kind == KEY_KIND_UINT64 && memcmp(fa, fb, sizeof(uint64_t)) != 0) return false;
      if (key.kind == KEY_KIND_STRING &&
          !SameString(*reinterpret_cast<const vt_string*>(fa), *reinterpret_cast<const vt_string*>(fb))) {
        return false;
      }
      if (key.kind == KEY_KIND_STRING_SET) {
        const auto& sa = *reinterpret_cast<const vt_string_set*>(fa);
        const auto& sb = *reinterpret_cast<const vt_string_set*>(fb);
        if (sa.count != sb.count) return false;
        for (size_t i = 0; i < sa.count; ++i) {
          if (!SameString(sa.items[i], sb.items[i])) return false;
        }
      }
    }
  }
  return true;
}

template <typename Record>
void Check(const filter_schema& schema, const uint8_t* data, size_t size, void (*init)(Record*),
           void (*destroy)(Record*)) {
  // fmemopen refuses an empty buffer; an empty file reads as nothing at all.
  FILE* in = fmemopen(const_cast<uint8_t*>(data), size, "r");
  Record first;
  init(&first);
  const int result = in == nullptr ? 0 : parse_stream(in, &schema, &first);
  if (in != nullptr) fclose(in);
  if (result < 0 || result > 2) abort();
  if (result == 0) {
    char* text = nullptr;
    size_t length = 0;
    FILE* out = open_memstream(&text, &length);
    if (out == nullptr || print_record(out, &schema, &first) != 0) abort();
    fclose(out);
    FILE* again = fmemopen(text, length, "r");
    Record second;
    init(&second);
    if (again == nullptr || parse_stream(again, &schema, &second) != 0) abort();
    fclose(again);
    if (!SameRecord(schema, &first, &second)) abort();
    destroy(&second);
    free(text);
  }
  destroy(&first);
}

FILE* gDevNull = nullptr;

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // The reader's warnings and errors would only slow the run down; the
  // fuzzer's own reports still go to the real standard error.
  gDevNull = fopen("/dev/null", "w");
  if (gDevNull == nullptr || freopen("/dev/null", "w", stdout) == nullptr) abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FILE* const realStderr = stderr;
  stderr = gDevNull;
  Check<black_list_filter>(black_list_filter_schema, data, size, filter_init, filter_destroy);
  Check<white_list>(white_list_schema, data, size, white_list_init, white_list_destroy);
  stderr = realStderr;
  return 0;
}
