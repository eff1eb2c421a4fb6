// `typhoractl load --clients N`: N client processes calling the daemon at once for a bounded
// time (see LoadWorker), then one JSON report: throughput and latencies per operation, the font
// changes the clients were told of, the daemon's resident memory over the run and its threads at
// the end, and every error.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "load_worker.h"

namespace typhora::ctl {

// The value at fraction `p` of an ascending list (0 for an empty one).
double percentile(const std::vector<double>& sorted, double p);

class LoadMix {
 public:
  LoadMix(const ClientOptions& options, const LoadPlan& plan);
  // Returns the process exit status: 0 when every call was answered.
  int run();

 private:
  struct Child {
    pid_t pid = -1;
    int fd = -1;
    std::string output;
  };
  bool spawnWorkers();
  // Reads the workers' reports, sampling the daemon every few seconds; false when some worker
  // had to be stopped.
  bool collect(pid_t daemon);
  int report(double elapsedSeconds, pid_t daemon) const;

  ClientOptions options_;
  LoadPlan plan_;
  std::vector<Child> children_;
  std::vector<long> rssSamples_;
  std::vector<std::string> errors_;
};

}  // namespace typhora::ctl
