// The build variant from <root>/etc/typhora/build-variant.plist:
//   {"internal": true, "subsystems": ["com.zorvane.Typhora"]}
// A build is internal for a subsystem when "internal" is true and "subsystems" is absent or
// lists it. Without the file the build is a customer build.
#pragma once

#include <string>

#include "platform/services/build_variant.h"

namespace typhora {

class LinuxBuildVariant final : public BuildVariant {
 public:
  explicit LinuxBuildVariant(const std::string& root);
  bool isInternalBuild(const std::string& subsystem) const override;

 private:
  std::string path_;
};

}  // namespace typhora
