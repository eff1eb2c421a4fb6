#include "platform/linux/files/linux_file_event_stream.h"

#include <sys/epoll.h>

#include <algorithm>
#include <atomic>
#include <mutex>
#include <unordered_set>

#include "platform/linux/files/inotify_tree.h"
#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/log/log.h"

namespace typhora {

struct LinuxFileEventStream::Shared {
  Shared(std::string deviceRoot, std::vector<std::string> paths, Duration latencyIn,
         Callback callbackIn, Clock& clockIn)
      : tree(std::move(deviceRoot), std::move(paths)),
        latency(latencyIn),
        callback(std::move(callbackIn)),
        clock(clockIn) {}

  const std::shared_ptr<SerialQueue> work = SerialQueue::create("com.zorvane.typhora.file-events");
  InotifyTree tree;  // on `work`
  const Duration latency;
  const Callback callback;
  Clock& clock;
  int fd = -1;                            // set by start(), then read only
  std::shared_ptr<SerialQueue> dispatch;  // set before start(), then read only

  // The open batch, on `work`: paths in order of their first event, and its closing alarm.
  std::vector<std::string> batch;
  std::unordered_set<std::string> inBatch;
  std::shared_ptr<ClockAlarm> alarm;

  std::atomic<bool> stopped{false};
  std::mutex delivering;  // held while the callback runs, so that stopping can wait for it
};

namespace {

using SharedPtr = std::shared_ptr<LinuxFileEventStream::Shared>;

constexpr double kLongestLatencySeconds = 3600;

Duration latencyOf(double seconds) {
  seconds = std::min(std::max(0.0, seconds), kLongestLatencySeconds);
  return std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds));
}

void deliver(const SharedPtr& shared, const std::vector<std::string>& paths) {
  std::lock_guard lock(shared->delivering);
  if (shared->stopped) return;
  shared->callback(paths);
}

void closeBatch(const SharedPtr& shared) {
  shared->alarm.reset();
  if (shared->stopped || shared->batch.empty()) return;
  std::vector<std::string> paths = std::move(shared->batch);
  shared->batch.clear();
  shared->inBatch.clear();
  shared->dispatch->async([shared, paths = std::move(paths)] { deliver(shared, paths); });
}

void openBatchIfNeeded(const SharedPtr& shared) {
  if (shared->batch.empty() || shared->alarm) return;
  std::weak_ptr<LinuxFileEventStream::Shared> weak = shared;
  shared->alarm = shared->clock.schedule(shared->latency, shared->latency / 10, [weak] {
    if (auto strong = weak.lock()) strong->work->async([strong] { closeBatch(strong); });
  });
}

void readEvents(const SharedPtr& shared) {
  if (shared->stopped) return;
  std::vector<std::string> paths;
  shared->tree.readAvailable(&paths);
  for (std::string& path : paths) {
    if (shared->inBatch.insert(path).second) shared->batch.push_back(std::move(path));
  }
  openBatchIfNeeded(shared);
  // Watch again; a no-op once the stream is stopped and its descriptor removed from the loop.
  LumoEventLoop::shared().modify(shared->fd, EPOLLIN);
}

}  // namespace

LinuxFileEventStream::LinuxFileEventStream(std::string deviceRoot, std::vector<std::string> paths,
                                           double latencySeconds, Callback callback, Clock& clock)
    : shared_(std::make_shared<Shared>(std::move(deviceRoot), std::move(paths),
                                       latencyOf(latencySeconds), std::move(callback), clock)) {}

LinuxFileEventStream::~LinuxFileEventStream() {
  if (started_) LumoEventLoop::shared().remove(shared_->fd);
  shared_->stopped = true;
  // A callback running on another queue finishes before the stream is gone. On the dispatch
  // queue itself none can be running (the queue is serial), and waiting would deadlock.
  if (!shared_->dispatch || !shared_->dispatch->isCurrent()) {
    std::lock_guard wait(shared_->delivering);
  }
}

void LinuxFileEventStream::setDispatchQueue(std::shared_ptr<SerialQueue> queue) {
  if (!started_) shared_->dispatch = std::move(queue);
}

bool LinuxFileEventStream::start() {
  if (started_) return true;
  if (!shared_->dispatch) {
    TYLog_Error(kTYLogTyphoraDaemon, "file events: no dispatch queue set before start");
    return false;
  }
  std::string error;
  bool opened = false;
  // Every watch is in place when start() returns: events from then on are seen.
  shared_->work->sync([&] { opened = shared_->tree.start(&error); });
  if (!opened) {
    TYLog_Error(kTYLogTyphoraDaemon, "file events: cannot start: %s", error);
    return false;
  }
  started_ = true;
  shared_->fd = shared_->tree.fd();
  SharedPtr shared = shared_;
  // While a read is queued the descriptor is not watched (see the header).
  LumoEventLoop::shared().add(shared_->fd, EPOLLIN, [shared](std::uint32_t) {
    LumoEventLoop::shared().modify(shared->fd, 0);
    shared->work->async([shared] { readEvents(shared); });
  });
  return true;
}

}  // namespace typhora
