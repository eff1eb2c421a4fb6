#include "comparison_table.h"

#include <algorithm>
#include <cstdio>

namespace typhora::bench {

double Samples::median() const {
  if (values.empty()) return 0;
  std::vector<double> sorted = values;
  std::sort(sorted.begin(), sorted.end());
  const std::size_t mid = sorted.size() / 2;
  return sorted.size() % 2 == 1 ? sorted[mid] : (sorted[mid - 1] + sorted[mid]) / 2;
}

double Samples::spreadPercent() const {
  const double m = median();
  if (values.empty() || m == 0) return 0;
  const auto [low, high] = std::minmax_element(values.begin(), values.end());
  return (*high - *low) / m * 100.0;
}

void ComparisonTable::add(ComparisonRow row) {
  rows_.push_back(std::move(row));
}

void ComparisonTable::print(const std::string& note) const {
  std::printf("\n%-34s %-10s %12s %7s  %-26s %12s %7s %9s\n", "workload", "unit", "typhora",
              "spread", "peer", "peer", "spread", "ratio");
  for (const ComparisonRow& row : rows_) {
    const double ours = row.typhora.median();
    const double theirs = row.peerSamples.median();
    std::printf("%-34s %-10s %12.3f %6.0f%%  %-26s %12.3f %6.0f%% %9.3gx\n", row.workload.c_str(),
                row.unit.c_str(), ours, row.typhora.spreadPercent(), row.peer.c_str(), theirs,
                row.peerSamples.spreadPercent(), theirs > 0 ? ours / theirs : 0.0);
  }
  std::printf("ratio: typhora's median over the peer's (below 1 is faster). %s\n", note.c_str());
  std::fflush(stdout);
}

}  // namespace typhora::bench
