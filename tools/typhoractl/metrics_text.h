// The daemon's status report as Prometheus text exposition (format 0.0.4): one gauge or counter
// a figure, queues labelled by their label.
#pragma once

#include <string>

#include "platform/value/value.h"

namespace typhora::ctl {

class MetricsText {
 public:
  static std::string fromStatus(const Value& status);
};

}  // namespace typhora::ctl
