// Rows of the comparison run: per workload, repeated rounds of typhora and of its peer measured
// in the same process run, printed as medians, spreads and the ratio typhora / peer.
#pragma once

#include <string>
#include <vector>

namespace typhora::bench {

struct Samples {
  std::vector<double> values;
  double median() const;
  // (max - min) / median, in percent: how far the rounds drifted.
  double spreadPercent() const;
};

struct ComparisonRow {
  std::string workload;
  std::string unit;  // what one figure measures, e.g. "us/call"
  Samples typhora;
  std::string peer;
  Samples peerSamples;
};

class ComparisonTable {
 public:
  void add(ComparisonRow row);
  // Prints the table so far; `note` goes under it (load average, rounds).
  void print(const std::string& note) const;

 private:
  std::vector<ComparisonRow> rows_;
};

}  // namespace typhora::bench
