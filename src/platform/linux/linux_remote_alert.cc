#include "platform/linux/linux_remote_alert.h"

#include "platform/linux/view_service_launch.h"
#include "platform/log.h"
#include "platform/plist_reader.h"

namespace typhora {

namespace {

class LinuxRemoteAlertHandle final : public RemoteAlertHandle {
 public:
  LinuxRemoteAlertHandle(std::string configurationPath, RemoteAlertDefinition definition,
                         RemoteAlertConfiguration configuration)
      : configurationPath_(std::move(configurationPath)),
        definition_(std::move(definition)),
        configuration_(std::move(configuration)) {}

  void activate(const Value& userInfo) override {
    std::string error;
    std::optional<Value> settings = PlistReader::readFile(configurationPath_, {}, &error);
    const std::string* program = settings ? settings->get("Program").asString() : nullptr;
    if (program == nullptr) {
      TYLog_Error(kTYLogTyphoraDaemon, "view service %@ is not configured: %@",
                  definition_.serviceName, settings ? std::string("no \"Program\"") : error);
      return;
    }
    std::vector<std::string> arguments;
    if (const ValueArray* configured = settings->get("Arguments").asArray()) {
      for (const Value& argument : *configured)
        if (const std::string* text = argument.asString()) arguments.push_back(*text);
    }
    arguments.insert(arguments.end(), {"--controller", definition_.viewControllerClassName});
    ViewServiceLaunch::start(*program, arguments, configuration_.endpoint, userInfo);
  }

 private:
  std::string configurationPath_;
  RemoteAlertDefinition definition_;
  RemoteAlertConfiguration configuration_;
};

bool isFileName(const std::string& name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
}

}  // namespace

std::unique_ptr<RemoteAlertHandle> LinuxRemoteAlert::makeHandle(
    RemoteAlertDefinition definition, RemoteAlertConfiguration configuration) {
  const std::string path =
      isFileName(definition.serviceName)
          ? root_.onDisk("/etc/typhora/view-services/" + definition.serviceName + ".plist")
          : std::string();
  return std::make_unique<LinuxRemoteAlertHandle>(path, std::move(definition),
                                                  std::move(configuration));
}

}  // namespace typhora
