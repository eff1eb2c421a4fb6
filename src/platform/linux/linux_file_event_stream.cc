#include "platform/linux/linux_file_event_stream.h"

#include <sys/epoll.h>

#include <algorithm>
#include <chrono>

#include "platform/linux/lumo_event_loop.h"

namespace typhora {

LinuxFileEventStream::LinuxFileEventStream(DeviceRoot root, std::vector<std::string> paths,
                                           double latencySeconds, Callback callback)
    : state_(std::make_shared<State>(std::move(root))) {
  state_->paths = std::move(paths);
  state_->latency = std::chrono::duration_cast<Duration>(
      std::chrono::duration<double>(std::max(latencySeconds, 0.0)));
  state_->callback = std::move(callback);
}

LinuxFileEventStream::~LinuxFileEventStream() {
  // After remove() no new read starts; one in progress keeps the state alive to its end.
  if (fd_ >= 0) LumoEventLoop::shared().remove(fd_);
}

void LinuxFileEventStream::setDispatchQueue(std::shared_ptr<SerialQueue> queue) {
  state_->queue = std::move(queue);
}

bool LinuxFileEventStream::start() {
  if (fd_ >= 0 || !state_->queue) return false;
  std::vector<std::string> roots;
  for (const std::string& path : state_->paths) roots.push_back(state_->root.onDisk(path));
  state_->tree = std::make_unique<InotifyTree>(std::move(roots));
  if (!state_->tree->valid()) return false;
  fd_ = state_->tree->fd();
  std::weak_ptr<State> weak = state_;
  LumoEventLoop::shared().add(fd_, EPOLLIN, [weak](std::uint32_t) {
    if (auto state = weak.lock()) readEvents(state);
  });
  return true;
}

void LinuxFileEventStream::readEvents(const std::shared_ptr<State>& state) {
  std::vector<std::string> changes = state->tree->readChanges();
  bool first = false;
  {
    std::lock_guard lock(state->mutex);
    for (const std::string& machinePath : changes) {
      std::string path = state->root.fromDisk(machinePath);
      auto at = std::lower_bound(state->seen.begin(), state->seen.end(), path);
      if (path.empty() || (at != state->seen.end() && *at == path)) continue;
      state->seen.insert(at, path);
      first = first || state->batch.empty();
      state->batch.push_back(std::move(path));
    }
  }
  if (!first) return;
  std::weak_ptr<State> weak = state;
  state->queue->asyncAfter(state->latency, [weak] {
    if (auto alive = weak.lock()) deliver(alive);
  });
}

void LinuxFileEventStream::deliver(const std::shared_ptr<State>& state) {
  std::vector<std::string> batch;
  {
    std::lock_guard lock(state->mutex);
    batch.swap(state->batch);
    state->seen.clear();
  }
  if (!batch.empty()) state->callback(batch);
}

}  // namespace typhora
