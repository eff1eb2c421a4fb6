// A file event stream on inotify, over directory trees under a device root.
//
// The inotify descriptor is watched by lumo's I/O loop, which only hands the reading over: while
// a read is queued the descriptor is not watched, so events wait in the kernel (where a flood
// ends in an overflow, which the stream reports) and never pile up in memory. Reading, watching
// new directories and batching run on the stream's own serial queue; batches go out on the
// dispatch queue, each once the latency has passed (on the stream's clock) since its first event.
//
// Destroying the stream stops it: no callback starts afterwards, and one already running on
// another queue is waited for.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/clock.h"
#include "platform/storage/file_event_stream.h"

namespace typhora {

class LinuxFileEventStream final : public FileEventStream {
 public:
  LinuxFileEventStream(std::string deviceRoot, std::vector<std::string> paths,
                       double latencySeconds, Callback callback, Clock& clock);
  ~LinuxFileEventStream() override;
  LinuxFileEventStream(const LinuxFileEventStream&) = delete;
  LinuxFileEventStream& operator=(const LinuxFileEventStream&) = delete;

  void setDispatchQueue(std::shared_ptr<SerialQueue> queue) override;
  // False when inotify cannot be set up or no dispatch queue was set.
  bool start() override;

  // What the I/O loop, the stream's queue and the clock's alarm share (opaque).
  struct Shared;

 private:
  std::shared_ptr<Shared> shared_;
  bool started_ = false;
};

}  // namespace typhora
