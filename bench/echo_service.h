// A lumo service in this process answering "ping:" with nothing and "large:reply:" with a blob,
// on real sockets through the real I/O loop: the transport alone, without the daemon's work.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/lumo/lumo_service.h"

namespace typhora::bench {

class EchoService {
 public:
  static constexpr std::size_t kLargeReplyBytes = 1'500'000;

  EchoService();
  ~EchoService();
  EchoService(const EchoService&) = delete;
  EchoService& operator=(const EchoService&) = delete;

  std::shared_ptr<IpcConnection> connect();
  // The size of an empty call's frame on the wire.
  static std::size_t emptyCallFrameSize();

 private:
  class Server;
  std::string dir_;
  LumoService service_;
  std::shared_ptr<Server> server_;
  std::shared_ptr<IpcListener> listener_;
};

// One synchronous call of `op`; false when no reply came.
bool callEcho(const std::shared_ptr<IpcRemoteProxy>& proxy, const char* op);

}  // namespace typhora::bench
