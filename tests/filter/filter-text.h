// Reading filter records from text and printing them to text, for the
// filter suites.
#ifndef PLOVO_TESTS_FILTER_FILTER_TEXT_H
#define PLOVO_TESTS_FILTER_FILTER_TEXT_H

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "filter/filter.h"

namespace plovo_test {

struct ParseOutput {
  int result;
  std::string out;  // what the reader printed on stdout
  std::string err;  // and on stderr
};

// Parses text into record (initialised by the caller) through a stream.
inline ParseOutput ParseText(const std::string& text, const filter_schema& schema, void* record) {
  std::string copy = text.empty() ? std::string(" ") : text;  // fmemopen refuses an empty buffer
  FILE* in = fmemopen(copy.data(), copy.size(), "r");
  EXPECT_NE(nullptr, in);
  ::testing::internal::CaptureStdout();
  ::testing::internal::CaptureStderr();
  ParseOutput output;
  output.result = parse_stream(in, &schema, record);
  output.out = ::testing::internal::GetCapturedStdout();
  output.err = ::testing::internal::GetCapturedStderr();
  fclose(in);
  return output;
}

inline std::string PrintText(const filter_schema& schema, const void* record) {
  char* text = nullptr;
  size_t length = 0;
  FILE* out = open_memstream(&text, &length);
  EXPECT_EQ(0, print_record(out, &schema, record));
  fclose(out);
  std::string result(text, length);
  free(text);
  return result;
}

// A black list read from text, freed with the object.
struct BlackList {
  black_list_filter record;
  ParseOutput output;
  explicit BlackList(const std::string& text) {
    filter_init(&record);
    output = ParseText(text, black_list_filter_schema, &record);
  }
  ~BlackList() { filter_destroy(&record); }
  BlackList(const BlackList&) = delete;
  BlackList& operator=(const BlackList&) = delete;
  std::string Print() const { return PrintText(black_list_filter_schema, &record); }
};

struct WhiteList {
  white_list record;
  ParseOutput output;
  explicit WhiteList(const std::string& text) {
    white_list_init(&record);
    output = ParseText(text, white_list_schema, &record);
  }
  ~WhiteList() { white_list_destroy(&record); }
  WhiteList(const WhiteList&) = delete;
  WhiteList& operator=(const WhiteList&) = delete;
  std::string Print() const { return PrintText(white_list_schema, &record); }
};

inline std::string Member(const vt_string_set& set, size_t i) {
  return i < set.count ? std::string(set.items[i].data, set.items[i].length) : std::string("<none>");
}

}  // namespace plovo_test

#endif
