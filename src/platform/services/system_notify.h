// System-wide notifications: bare names that any process may watch.
#pragma once

#include <string>

namespace typhora {

class SystemNotify {
 public:
  virtual ~SystemNotify() = default;
  virtual void post(const std::string& name) = 0;
};

}  // namespace typhora
