// lumo listeners: the named service socket (bound in the runtime directory, or inherited through
// systemd socket activation) and anonymous listeners reachable only through their endpoint.
#pragma once

#include <chrono>
#include <memory>
#include <mutex>
#include <string>

#include "platform/dispatch/serial_queue.h"
#include "platform/fd/unique_fd.h"
#include "platform/ipc/ipc_listener.h"

namespace typhora {

class LumoListener final : public IpcListener, public std::enable_shared_from_this<LumoListener> {
 public:
  // Listens on `fd` (a bound, listening stream socket).
  static std::shared_ptr<LumoListener> named(UniqueFd fd, std::string path);
  // A new anonymous listener with its endpoint.
  static std::shared_ptr<LumoListener> anonymous();

  void setDelegate(std::weak_ptr<IpcListenerDelegate> delegate) override;
  void resume() override;
  void invalidate() override;
  std::shared_ptr<const IpcEndpoint> endpoint() const override { return endpoint_; }

 private:
  LumoListener() = default;
  static constexpr auto kBackOff = std::chrono::milliseconds(100);
  static constexpr int kAcceptsPerTurn = 16;

  void onReadable();
  void backOff(const std::string& why);
  // The socket unwatched and watched again (idempotent); a paused listener's peers wait in the
  // kernel.
  void pauseListening();
  void resumeListening();
  // Pins the peer, counts it against its user's connections, and asks the delegate. False when
  // out of descriptors: the listener backs off.
  bool offer(UniqueFd fd);

  bool anonymous_ = false;
  UniqueFd fd_;
  std::string path_;
  std::shared_ptr<const IpcEndpoint> endpoint_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("com.zorvane.lumo.listener");
  std::mutex mutex_;
  std::weak_ptr<IpcListenerDelegate> delegate_;
  bool resumed_ = false;
  bool valid_ = true;
  bool backingOff_ = false;
  bool paused_ = false;
};

}  // namespace typhora
