// A watcher of the event socket that prints each notification as one JSON line and lets the
// command stop after a number of them.
#pragma once

#include <atomic>

#include "platform/dispatch/semaphore.h"
#include "platform/ipc/ipc_connection.h"

namespace typhora::ctl {

class NotificationPrinter final : public IpcExportedObject {
 public:
  explicit NotificationPrinter(long count) : remaining_(count) {}
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  // Wakes when the count is reached (never for a count of 0).
  Semaphore& done() { return done_; }

 private:
  std::atomic<long> remaining_;
  Semaphore done_;
};

}  // namespace typhora::ctl
