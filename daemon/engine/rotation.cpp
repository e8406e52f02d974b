#include "daemon/engine/rotation.h"

#include "daemon/engine/capture-time.h"

#include <algorithm>
#include <utility>

namespace {

constexpr time_t kDay = 86400;
constexpr time_t kMonth = 30 * kDay;
constexpr time_t kWeek = 7 * kDay;

// Which stretch of the history a version of this age falls in, as (tier,
// step): the last day keeps every version, so each gets a step of its own
// (unique); then days, then weeks. A version from the future (the clock
// was set back) is younger than a day. Ages grow along the newest-first
// walk, so the versions of one bucket come one after the other.
std::pair<int, time_t> Bucket(time_t age, size_t unique) {
  if (age < kDay) return {0, static_cast<time_t>(unique)};
  if (age < kMonth) return {1, age / kDay};
  return {2, (age - kMonth) / kWeek};
}

}  // namespace

namespace plovod {

std::string VersionName(time_t started, int sequence) {
  std::tm local{};
  localtime_r(&started, &local);
  char text[64];
  std::string name(text, strftime(text, sizeof text, "%Y-%m-%d_%H%M%S", &local));
  return sequence >= 2 ? name + "_" + std::to_string(sequence) : name;
}

bool ParseVersionName(const std::string& name, time_t& started) {
  // "YYYY-MM-DD_HHMMSS", then "_<n>" for the second and later run of a second.
  if (name.size() < 17 || name[4] != '-' || name[7] != '-' || name[10] != '_') return false;
  if (name.size() > 17) {
    const std::string sequence = name.substr(18);
    if (name[17] != '_' || sequence.empty() || sequence[0] == '0' || sequence == "1") return false;
    if (!std::all_of(sequence.begin(), sequence.end(), [](char c) { return c >= '0' && c <= '9'; })) return false;
  }
  const char* text = name.c_str();
  std::tm t{};
  t.tm_year = DecimalDigits(text, 4) - 1900;
  t.tm_mon = DecimalDigits(text + 5, 2) - 1;
  t.tm_mday = DecimalDigits(text + 8, 2);
  t.tm_hour = DecimalDigits(text + 11, 2);
  t.tm_min = DecimalDigits(text + 13, 2);
  t.tm_sec = DecimalDigits(text + 15, 2);
  if (t.tm_year < 1 - 1900) return false;  // year 0, or not digits
  // Out-of-range fields move into the next one (month 13 becomes January),
  // so fields that come back changed were not a date. UTC here, so that a
  // daylight saving gap does not move the hour.
  std::tm check = t;
  timegm(&check);
  if (check.tm_year != t.tm_year || check.tm_mon != t.tm_mon || check.tm_mday != t.tm_mday ||
      check.tm_hour != t.tm_hour || check.tm_min != t.tm_min || check.tm_sec != t.tm_sec) {
    return false;
  }
  t.tm_isdst = -1;
  started = mktime(&t);
  return true;
}

std::vector<size_t> VersionsToRemove(const std::vector<time_t>& versions, time_t now, unsigned long max,
                                     int policy) {
  max = std::max(max, 1UL);
  // Newest first; of two made in the same second, the later index is the
  // newer, as in a list sorted by name ("X" before "X_2").
  std::vector<size_t> order(versions.size());
  for (size_t i = 0; i < order.size(); ++i) order[i] = i;
  std::sort(order.begin(), order.end(), [&](size_t a, size_t b) {
    return versions[a] != versions[b] ? versions[a] > versions[b] : a > b;
  });
  std::vector<size_t> removed;
  unsigned long kept = 0;
  std::pair<int, time_t> last{-1, 0};
  for (size_t k = 0; k < order.size(); ++k) {
    size_t i = order[k];
    if (policy == 2) {
      // The first of a bucket met is its newest; the others go. The
      // newest of all is the first met, so it is never thinned.
      std::pair<int, time_t> bucket = Bucket(now - versions[i], k);
      if (bucket == last) {
        removed.push_back(i);
        continue;
      }
      last = bucket;
    }
    if (kept < max) {
      ++kept;
    } else {
      removed.push_back(i);
    }
  }
  std::sort(removed.begin(), removed.end());
  return removed;
}

}  // namespace plovod
