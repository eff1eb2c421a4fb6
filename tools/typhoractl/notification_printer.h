// Prints each message a peer is sent as one JSON line and lets the command stop after a number
// of them: the event socket's notifications to a watcher, or, with a formatter, what the daemon
// tells a checked-in client.
#pragma once

#include <atomic>
#include <functional>

#include "platform/dispatch/semaphore.h"
#include "platform/ipc/ipc_connection.h"

namespace typhora::ctl {

class NotificationPrinter final : public IpcExportedObject {
 public:
  // The line printed for a message's arguments.
  using Formatter = std::function<Value(const std::vector<Value>& arguments)>;
  explicit NotificationPrinter(long count, Formatter format = nullptr)
      : remaining_(count), format_(std::move(format)) {}
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  // Wakes when the count is reached (never for a count of 0).
  Semaphore& done() { return done_; }

 private:
  std::atomic<long> remaining_;
  Formatter format_;
  Semaphore done_;
};

}  // namespace typhora::ctl
