// The interface the lumo tests serve and call.
#pragma once

#include <memory>

#include "platform/ipc/ipc_interface.h"

namespace typhora {

inline std::shared_ptr<const IpcInterface> lumoTestInterface() {
  using K = IpcType::Kind;
  static const auto description = std::make_shared<const IpcInterface>(
      "LumoTest", std::vector<IpcOperation>{
                      {"echo:reply:", {{K::Any, true}}, true, {{K::Any, true}}},
                      {"count:reply:", {{K::Integer, false}}, true, {{K::Integer, false}}},
                      {"hang:reply:", {}, true, {}},
                      {"endpoint:reply:", {}, true, {{K::Endpoint, false}}},
                      {"useEndpoint:reply:", {{K::Endpoint, false}}, true, {{K::Any, true}}},
                      {"note:", {{K::String, false}}, false, {}},
                  });
  return description;
}

}  // namespace typhora
