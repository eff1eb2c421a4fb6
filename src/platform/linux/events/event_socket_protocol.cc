#include "platform/linux/events/event_socket_protocol.h"

namespace typhora {

namespace {

using Kind = IpcType::Kind;

}  // namespace

std::shared_ptr<const IpcInterface> eventSocketProtocol() {
  static const auto description = std::make_shared<const IpcInterface>(
      "TyphoraEventSocketProtocol",
      std::vector<IpcOperation>{
          {eventop::kPostDistributedNotification,
           {{Kind::String, false}, {Kind::Dictionary, true}},
           true,
           {}},
          {eventop::kPostSystemNotification, {{Kind::String, false}}, true, {}},
          {eventop::kWatchNotifications, {}, true, {}},
          {eventop::kRunActivity, {{Kind::String, false}}, true, {{Kind::Bool, false}}},
          {eventop::kStatusReport, {}, true, {{Kind::Dictionary, false}}},
          {eventop::kGrantsReport, {{Kind::String, true}}, true, {{Kind::Dictionary, false}}},
      });
  return description;
}

std::shared_ptr<const IpcInterface> eventWatcherProtocol() {
  static const auto description = std::make_shared<const IpcInterface>(
      "TyphoraEventWatcherProtocol",
      std::vector<IpcOperation>{
          {eventop::kNotificationPosted,
           {{Kind::String, false}, {Kind::String, false}, {Kind::Dictionary, true}},
           false,
           {}},
      });
  return description;
}

}  // namespace typhora
