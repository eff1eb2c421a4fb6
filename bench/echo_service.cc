#include "echo_service.h"

#include <unistd.h>

#include <filesystem>

#include "platform/linux/lumo/transport/lumo_frame.h"

namespace typhora::bench {
namespace {

std::shared_ptr<const IpcInterface> echoInterface() {
  using K = IpcType::Kind;
  static const auto description = std::make_shared<const IpcInterface>(
      "Bench", std::vector<IpcOperation>{{"ping:", {}, true, {}},
                                         {"large:reply:", {}, true, {{K::Data, false}}}});
  return description;
}

std::string makeDir() {
  char pattern[] = "/tmp/typhora-echo-XXXXXX";
  return mkdtemp(pattern);
}

}  // namespace

class EchoService::Server final : public IpcListenerDelegate,
                                  public IpcExportedObject,
                                  public std::enable_shared_from_this<Server> {
 public:
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    c->setExportedInterface(echoInterface());
    c->setExportedObject(shared_from_this());
    c->resume();
    return true;
  }
  bool invoke(const IpcOperation& op, const std::vector<Value>&, IpcReply reply) override {
    if (op.wireName == "ping:") {
      reply({});
    } else {
      reply({large_});
    }
    return true;
  }

 private:
  Value large_ = Value(Bytes(kLargeReplyBytes, 0x5a));
};

EchoService::EchoService() : dir_(makeDir()), service_(dir_), server_(std::make_shared<Server>()) {
  listener_ = service_.makeNamedListener("bench");
  listener_->setDelegate(server_);
  listener_->resume();
}

EchoService::~EchoService() {
  listener_->invalidate();
  std::error_code ec;
  std::filesystem::remove_all(dir_, ec);
}

std::shared_ptr<IpcConnection> EchoService::connect() {
  auto c = service_.connectToService("bench");
  c->setRemoteInterface(echoInterface());
  c->resume();
  return c;
}

std::size_t EchoService::emptyCallFrameSize() {
  std::vector<std::uint8_t> frame;
  std::vector<int> fds;
  std::string error;
  encodeLumoFrame(LumoMessage{LumoMessage::Kind::Invoke, 1, "ping:", {}}, &frame, &fds, nullptr,
                  &error);
  return frame.size();
}

bool callEcho(const std::shared_ptr<IpcRemoteProxy>& proxy, const char* op) {
  bool ok = false;
  proxy->call(op, {}, [&](std::vector<Value>) { ok = true; });
  return ok;
}

}  // namespace typhora::bench
