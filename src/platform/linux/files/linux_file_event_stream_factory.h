// Makes inotify file event streams whose paths live under one device root.
#pragma once

#include <string>

#include "platform/dispatch/clock.h"
#include "platform/storage/file_event_stream.h"

namespace typhora {

class LinuxFileEventStreamFactory final : public FileEventStreamFactory {
 public:
  // Batches are timed on `clock`.
  LinuxFileEventStreamFactory(std::string deviceRoot, Clock& clock);
  std::unique_ptr<FileEventStream> createStream(std::vector<std::string> paths,
                                                double latencySeconds,
                                                FileEventStream::Callback callback) override;

 private:
  std::string deviceRoot_;
  Clock& clock_;
};

}  // namespace typhora
