#include "font_picker_client.h"

#include <iostream>

#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {

bool FontPickerClient::shouldAcceptNewConnection(IpcListener& /*listener*/,
                                                 std::shared_ptr<IpcConnection> connection) {
  connection->setExportedInterface(typhoraFontPickerClientSupportProtocol());
  connection->setExportedObject(shared_from_this());
  connection->resume();
  return true;
}

bool FontPickerClient::invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                              IpcReply reply) {
  if (operation.wireName == op::kPing) {
    reply({arguments.at(0)});
    return true;
  }
  if (operation.wireName != op::kActivateFontsForFontPickerClient) return false;
  ++activations_;
  std::cout << JsonCodec::encode(Value::dictionary(
                   {{"role", "font-picker-client"}, {"activate", arguments.at(0)}}))
            << std::endl;
  if (!silent_) reply({Value(activates_)});
  return true;
}

}  // namespace typhora::ctl
