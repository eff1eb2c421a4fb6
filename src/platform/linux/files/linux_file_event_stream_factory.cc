#include "platform/linux/files/linux_file_event_stream_factory.h"

#include "platform/linux/files/linux_file_event_stream.h"

namespace typhora {

LinuxFileEventStreamFactory::LinuxFileEventStreamFactory(std::string deviceRoot, Clock& clock)
    : deviceRoot_(std::move(deviceRoot)), clock_(clock) {}

std::unique_ptr<FileEventStream> LinuxFileEventStreamFactory::createStream(
    std::vector<std::string> paths, double latencySeconds, FileEventStream::Callback callback) {
  return std::make_unique<LinuxFileEventStream>(deviceRoot_, std::move(paths), latencySeconds,
                                                std::move(callback), clock_);
}

}  // namespace typhora
