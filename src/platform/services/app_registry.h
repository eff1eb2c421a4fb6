// The registry of installed applications.
#pragma once

#include <optional>
#include <string>

namespace typhora {

class AppRegistry {
 public:
  virtual ~AppRegistry() = default;
  // The short version string of the installed application `identifier`; nullopt when no such
  // application is installed or it declares no version.
  virtual std::optional<std::string> shortVersionString(const std::string& identifier) const = 0;
};

}  // namespace typhora
