// Named analytics events. The event's dictionary is built only when the sink wants the event.
#pragma once

#include <functional>
#include <string>

#include "platform/value/value.h"

namespace typhora {

class AnalyticsSink {
 public:
  using Builder = std::function<Value()>;
  virtual ~AnalyticsSink() = default;
  // Sends the event `name`; `builder` makes its dictionary, on the calling thread, at most once.
  virtual void sendEvent(const std::string& name, const Builder& builder) = 0;
};

}  // namespace typhora
