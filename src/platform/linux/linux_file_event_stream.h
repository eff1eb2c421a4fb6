// File events on Linux, from inotify over whole directory trees. The inotify descriptor is
// watched by lumo's I/O thread, so a stream costs no thread of its own; changes are gathered
// into a batch that goes to the dispatch queue once the stream's latency has passed since the
// batch's first change.
#pragma once

#include <memory>
#include <mutex>
#include <vector>

#include "platform/file_event_stream.h"
#include "platform/linux/device_root.h"
#include "platform/linux/inotify_tree.h"

namespace typhora {

class LinuxFileEventStream final : public FileEventStream {
 public:
  LinuxFileEventStream(DeviceRoot root, std::vector<std::string> paths, double latencySeconds,
                       Callback callback);
  ~LinuxFileEventStream() override;

  void setDispatchQueue(std::shared_ptr<SerialQueue> queue) override;
  bool start() override;

 private:
  // What the I/O thread and the dispatch queue share; outlives the stream while they use it.
  struct State {
    explicit State(DeviceRoot r) : root(std::move(r)) {}
    DeviceRoot root;
    std::vector<std::string> paths;
    Duration latency;
    Callback callback;
    std::shared_ptr<SerialQueue> queue;
    std::unique_ptr<InotifyTree> tree;  // touched on the I/O thread only, once started
    std::mutex mutex;
    std::vector<std::string> batch;
    std::vector<std::string> seen;  // sorted paths of the batch, to merge repeats
  };
  static void readEvents(const std::shared_ptr<State>& state);
  static void deliver(const std::shared_ptr<State>& state);

  std::shared_ptr<State> state_;
  int fd_ = -1;
};

class LinuxFileEventStreamFactory final : public FileEventStreamFactory {
 public:
  explicit LinuxFileEventStreamFactory(std::string root) : root_(std::move(root)) {}
  std::unique_ptr<FileEventStream> createStream(std::vector<std::string> paths,
                                                double latencySeconds,
                                                FileEventStream::Callback callback) override {
    return std::make_unique<LinuxFileEventStream>(root_, std::move(paths), latencySeconds,
                                                  std::move(callback));
  }

 private:
  DeviceRoot root_;
};

}  // namespace typhora
