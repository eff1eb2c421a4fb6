// What kind of build of the system runs on the device.
#pragma once

#include <string>

namespace typhora {

class BuildVariant {
 public:
  virtual ~BuildVariant() = default;
  // Whether this is an internal build for `subsystem` (internal builds shorten some delays).
  virtual bool isInternalBuild(const std::string& subsystem) const = 0;
};

}  // namespace typhora
