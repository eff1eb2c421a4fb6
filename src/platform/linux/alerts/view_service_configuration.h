// How a view service is started: "<root>/etc/typhora/view-services/<service name>.plist", a
// property list (CBOR or JSON) {"Program": "<absolute path on this machine>", "Arguments": [...]}.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace typhora {

struct ViewServiceConfiguration {
  std::string program;
  std::vector<std::string> arguments;  // after the program's name, before the controller's

  // The configuration of `serviceName` under `deviceRoot`; nullopt with `error` set when it is
  // missing or malformed.
  static std::optional<ViewServiceConfiguration> load(const std::string& deviceRoot,
                                                      const std::string& serviceName,
                                                      std::string* error);
};

}  // namespace typhora
