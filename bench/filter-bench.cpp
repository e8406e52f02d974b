// filter_test_path over one million paths against a black list of 50 names,
// 20 extensions, 10 globs and 10 prefixes in every section that has such a
// rule, against a baseline that only splits each path into its components
// and folds them to lower case: the work no matcher can avoid.
//
// The paths are made with a fixed seed: 2 to 8 components, each name 5 to
// 40 characters of mixed case, most file names with an extension; about
// one component in fifty is a black-listed name or carries a black-listed
// prefix, so that some paths fail at each depth. The list's members are
// made by the same generator and read through the file reader.
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "bench-support.h"
#include "filter/filter-match.h"
#include "filter/filter.h"

namespace {

constexpr size_t kPaths = 1000000;

std::vector<std::string> gPaths;
black_list_filter gFilter;

const char kNameChars[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_- ";

struct Generator {
  std::mt19937_64 random{20261123};

  size_t Uniform(size_t low, size_t high) { return std::uniform_int_distribution<size_t>(low, high)(random); }
  std::string Name(size_t low, size_t high) {
    std::string name(Uniform(low, high), ' ');
    for (char& c : name) c = kNameChars[Uniform(0, sizeof(kNameChars) - 2)];
    return name;
  }
  std::vector<std::string> Names(size_t count, size_t low, size_t high) {
    std::vector<std::string> names;
    for (size_t i = 0; i < count; ++i) names.push_back(Name(low, high));
    return names;
  }
};

std::string Quoted(const std::vector<std::string>& members) {
  std::string text;
  for (const std::string& m : members) text += (text.empty() ? "\"" : ", \"") + m + "\"";
  return text;
}

// The list as a task's black list file and the paths tested against it.
void Prepare() {
  Generator g;
  const auto names = g.Names(50, 5, 40);
  const auto extensions = g.Names(20, 2, 5);
  const auto prefixes = g.Names(10, 2, 6);
  std::vector<std::string> globs;
  for (int i = 0; i < 10; ++i) {
    globs.push_back(i % 3 == 0 ? "*." + g.Name(2, 4) : i % 3 == 1 ? g.Name(2, 4) + "*" : g.Name(1, 3) + "*" + g.Name(1, 3));
  }
  const std::string text = "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_char = \"\\\\:*?<>|\"\n"
                           "black_prefix = " + Quoted(prefixes) + "\nblack_name = " + Quoted(names) +
                           "\n[File]\nblack_prefix = " + Quoted(prefixes) + "\nblack_glob = " + Quoted(globs) +
                           "\nblack_ext = " + Quoted(extensions) + "\nblack_name = " + Quoted(names) +
                           "\n[Directory]\nblack_name = " + Quoted(names) + "\nblack_prefix = " + Quoted(prefixes) +
                           "\nblack_glob = " + Quoted(globs) + "\n";
  FILE* in = fmemopen(const_cast<char*>(text.data()), text.size(), "r");
  filter_init(&gFilter);
  if (in == nullptr || parse_stream(in, &black_list_filter_schema, &gFilter) != 0) {
    plovo_bench::Die("the benchmark's black list does not read");
  }
  fclose(in);

  gPaths.reserve(kPaths);
  for (size_t i = 0; i < kPaths; ++i) {
    const size_t depth = g.Uniform(2, 8);
    std::string path;
    for (size_t d = 0; d < depth; ++d) {
      std::string name = g.Name(5, 40);
      if (g.Uniform(0, 99) < 1) name = names[g.Uniform(0, names.size() - 1)];
      if (g.Uniform(0, 99) < 1) name = prefixes[g.Uniform(0, prefixes.size() - 1)] + name;
      for (char& c : name) {
        if (g.Uniform(0, 7) == 0) c = static_cast<char>(toupper(static_cast<unsigned char>(c)));
      }
      path += "/" + name;
    }
    if (g.Uniform(0, 9) < 8) path += "." + (g.Uniform(0, 19) == 0 ? extensions[g.Uniform(0, 19)] : g.Name(2, 4));
    gPaths.push_back(path);
  }
}

// The floor: every component found and folded once.
void BM_SplitAndFold(benchmark::State& state) {
  char folded[4096 + 512 + 1];
  uint64_t sum = 0;
  for (auto _ : state) {
    for (const std::string& path : gPaths) {
      size_t start = 0;
      const size_t length = path.size();
      while (start < length) {
        const char* slash = static_cast<const char*>(memchr(path.data() + start, '/', length - start));
        const size_t end = slash == nullptr ? length : static_cast<size_t>(slash - path.data());
        for (size_t i = start; i < end; ++i) folded[i] = static_cast<char>(vt_fold(static_cast<unsigned char>(path[i])));
        sum += end - start;
        start = end + 1;
      }
      benchmark::DoNotOptimize(folded);
    }
  }
  benchmark::DoNotOptimize(sum);
  state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * gPaths.size()));
}

void BM_FilterTestPath(benchmark::State& state) {
  int64_t failed = 0;
  for (auto _ : state) {
    failed = 0;
    for (const std::string& path : gPaths) failed += filter_test_path(&gFilter, path.c_str(), false) != 0;
  }
  state.counters["failed_paths"] = static_cast<double>(failed);
  state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * gPaths.size()));
}

}  // namespace

int main(int argc, char** argv) {
  Prepare();
  plovo_bench::RegisterRepeated("split_and_fold", BM_SplitAndFold, 9, benchmark::kMillisecond)->Iterations(1);
  plovo_bench::RegisterRepeated("filter_test_path", BM_FilterTestPath, 9, benchmark::kMillisecond)->Iterations(1);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  const auto subject = reporter.MedianSeconds("filter_test_path");
  const auto baseline = reporter.MedianSeconds("split_and_fold");
  filter_destroy(&gFilter);
  if (!subject || !baseline) {
    std::printf("summary filter: incomplete, no ratio\n");
    return 1;
  }
  const double ratio = *baseline / *subject;
  std::printf("summary filter: filter_test_path %.0f paths/s, split_and_fold %.0f paths/s, ratio %.3f "
              "(target >= 0.25: %s)\n",
              kPaths / *subject, kPaths / *baseline, ratio, plovo_bench::Verdict(ratio >= 0.25));
  return 0;
}
