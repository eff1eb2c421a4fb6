#include "platform/linux/alerts/view_service_configuration.h"

#include "platform/linux/files/device_root.h"
#include "platform/value/plist_reader.h"

namespace typhora {
namespace {

constexpr const char* kConfigurationDirectory = "/etc/typhora/view-services/";
constexpr const char* kProgramKey = "Program";
constexpr const char* kArgumentsKey = "Arguments";
constexpr std::size_t kLargestConfiguration = 1u << 20;

}  // namespace

std::optional<ViewServiceConfiguration> ViewServiceConfiguration::load(
    const std::string& deviceRoot, const std::string& serviceName, std::string* error) {
  if (!DeviceRoot::isSingleComponent(serviceName)) {
    *error = "'" + serviceName + "' is not a view service name";
    return std::nullopt;
  }
  std::string root = deviceRoot;
  while (!root.empty() && root.back() == '/') root.pop_back();
  const std::string path = root + kConfigurationDirectory + serviceName + ".plist";
  DecodeLimits limits;
  limits.maxBytes = kLargestConfiguration;
  std::string why;
  auto plist = PlistReader::readFile(path, limits, &why);
  if (!plist) {
    *error = path + ": " + why;
    return std::nullopt;
  }
  ViewServiceConfiguration configuration;
  const std::string* program = plist->get(kProgramKey).asString();
  if (program == nullptr || !program->starts_with("/")) {
    *error = path + ": \"Program\" must be an absolute path";
    return std::nullopt;
  }
  configuration.program = *program;
  const Value& arguments = plist->get(kArgumentsKey);
  if (!arguments.isNull() && arguments.asArray() == nullptr) {
    *error = path + ": \"Arguments\" must be an array of strings";
    return std::nullopt;
  }
  static const ValueArray kNoArguments;
  for (const Value& argument : arguments.asArray() ? *arguments.asArray() : kNoArguments) {
    const std::string* text = argument.asString();
    if (text == nullptr || text->find('\0') != std::string::npos) {
      *error = path + ": \"Arguments\" must be an array of strings";
      return std::nullopt;
    }
    configuration.arguments.push_back(*text);
  }
  return configuration;
}

}  // namespace typhora
