#include "platform/linux/alerts/linux_remote_alert_handle.h"

#include "platform/linux/alerts/view_service_configuration.h"
#include "platform/linux/alerts/view_service_process.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/log/log.h"
#include "platform/value/json_codec.h"

namespace typhora {
namespace {

constexpr const char* kControllerOption = "--controller";

}  // namespace

LinuxRemoteAlertHandle::LinuxRemoteAlertHandle(std::string deviceRoot,
                                               RemoteAlertDefinition definition,
                                               RemoteAlertConfiguration configuration)
    : deviceRoot_(std::move(deviceRoot)),
      definition_(std::move(definition)),
      configuration_(std::move(configuration)) {}

void LinuxRemoteAlertHandle::activate(const Value& userInfo, EndedHandler ended) {
  std::string error;
  if (!present(userInfo, ended, &error)) {
    TYLog_Error(kTYLogTyphoraDaemon, "cannot present %s of view service %s: %s",
                definition_.viewControllerClassName, definition_.serviceName, error);
    if (ended) ended();
  }
}

bool LinuxRemoteAlertHandle::present(const Value& userInfo, EndedHandler ended,
                                     std::string* error) const {
  auto configuration = ViewServiceConfiguration::load(deviceRoot_, definition_.serviceName, error);
  if (!configuration) return false;
  const auto* endpoint = dynamic_cast<const LumoEndpoint*>(configuration_.endpoint.get());
  if (endpoint == nullptr) {
    *error = "the configuration has no endpoint of this platform";
    return false;
  }
  std::vector<std::string> arguments = configuration->arguments;
  arguments.push_back(kControllerOption);
  arguments.push_back(definition_.viewControllerClassName);
  return ViewServiceProcess::launch(configuration->program, arguments, endpoint->fd(),
                                    JsonCodec::encode(userInfo) + "\n", std::move(ended), error);
}

}  // namespace typhora
