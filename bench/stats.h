// Summaries of timing samples and the small text helpers the reports share.
// Pure code, free of Win32, so the native codec benchmark builds it too.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <string>
#include <vector>

namespace bench {

struct summary {
  std::size_t count = 0;
  double p50 = 0;
  double p99 = 0;
  double mean = 0;
  double max = 0;
};

// Nearest-rank percentile of sorted samples: the smallest sample with at
// least `fraction` of all samples at or below it.
inline double percentile_sorted(const std::vector<double>& sorted, double fraction) {
  if (sorted.empty()) return 0;
  std::size_t rank = static_cast<std::size_t>(fraction * static_cast<double>(sorted.size()) + 0.999999);
  rank = std::min(std::max<std::size_t>(rank, 1), sorted.size());
  return sorted[rank - 1];
}

inline summary summarize(std::vector<double> samples) {
  summary s;
  s.count = samples.size();
  if (samples.empty()) return s;
  std::sort(samples.begin(), samples.end());
  s.p50 = percentile_sorted(samples, 0.50);
  s.p99 = percentile_sorted(samples, 0.99);
  double total = 0;
  for (double v : samples) total += v;
  s.mean = total / static_cast<double>(samples.size());
  s.max = samples.back();
  return s;
}

inline double median(std::vector<double> samples) { return summarize(std::move(samples)).p50; }

// printf into a std::string.
template <typename... Args>
std::string format(const char* pattern, Args... args) {
  char buffer[512];
  const int n = std::snprintf(buffer, sizeof(buffer), pattern, args...);
  if (n < 0) return std::string();
  return std::string(buffer, std::min<std::size_t>(static_cast<std::size_t>(n), sizeof(buffer) - 1));
}

// "met" or "missed by N %" for a value that must stay at or below `limit`.
inline std::string verdict_at_most(double value, double limit) {
  if (value <= limit) return "met";
  return format("**missed** by %.0f %%", (value / limit - 1.0) * 100.0);
}

// The same for a strict bound.
inline std::string verdict_below(double value, double limit) {
  if (value < limit) return "met";
  return format("**missed** by %.0f %%", (value / limit - 1.0) * 100.0);
}

}  // namespace bench
