// Streams that deliver only what a test hands them, on their dispatch queue.
#pragma once

#include <mutex>
#include <vector>

#include "platform/storage/file_event_stream.h"

namespace typhora::testing {

class FakeFileEventStreamFactory final : public FileEventStreamFactory {
 public:
  struct Stream {
    std::vector<std::string> paths;
    double latency = 0;
    FileEventStream::Callback callback;
    std::shared_ptr<SerialQueue> queue;
    bool started = false;
  };

  std::unique_ptr<FileEventStream> createStream(std::vector<std::string> paths,
                                                double latencySeconds,
                                                FileEventStream::Callback callback) override {
    std::lock_guard lock(mutex_);
    streams_.push_back(std::make_shared<Stream>(
        Stream{std::move(paths), latencySeconds, std::move(callback), nullptr, false}));
    return std::make_unique<Handle>(*this, streams_.back());
  }

  std::vector<Stream> streams() const {
    std::lock_guard lock(mutex_);
    std::vector<Stream> copies;
    for (const auto& stream : streams_) copies.push_back(*stream);
    return copies;
  }
  // Delivers one batch to every started stream, on its queue.
  void deliver(const std::vector<std::string>& eventPaths) {
    std::lock_guard lock(mutex_);
    for (const auto& stream : streams_) {
      if (!stream->started || !stream->queue) continue;
      stream->queue->async([stream, eventPaths] { stream->callback(eventPaths); });
    }
  }

 private:
  class Handle final : public FileEventStream {
   public:
    Handle(FakeFileEventStreamFactory& owner, std::shared_ptr<Stream> stream)
        : owner_(owner), stream_(std::move(stream)) {}
    void setDispatchQueue(std::shared_ptr<SerialQueue> queue) override {
      std::lock_guard lock(owner_.mutex_);
      stream_->queue = std::move(queue);
    }
    bool start() override {
      std::lock_guard lock(owner_.mutex_);
      stream_->started = true;
      return true;
    }

   private:
    FakeFileEventStreamFactory& owner_;
    std::shared_ptr<Stream> stream_;
  };

  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<Stream>> streams_;
};

}  // namespace typhora::testing
