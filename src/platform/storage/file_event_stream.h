// A stream of file-system events under a set of directories. Events are per file and carry only
// their paths; the stream starts with the events from the moment it starts, with no history, and
// delivers them in batches: a batch goes out once `latency` has passed since its first event.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/serial_queue.h"

namespace typhora {

class FileEventStream {
 public:
  using Callback = std::function<void(const std::vector<std::string>& eventPaths)>;
  virtual ~FileEventStream() = default;
  // The queue the callback runs on; set before start().
  virtual void setDispatchQueue(std::shared_ptr<SerialQueue> queue) = 0;
  // False when the stream cannot be started.
  virtual bool start() = 0;
};

class FileEventStreamFactory {
 public:
  virtual ~FileEventStreamFactory() = default;
  // A stream over `paths` (the daemon's absolute paths) and everything below them.
  virtual std::unique_ptr<FileEventStream> createStream(std::vector<std::string> paths,
                                                        double latencySeconds,
                                                        FileEventStream::Callback callback) = 0;
};

}  // namespace typhora
