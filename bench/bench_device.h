// A device root with a user-fonts file of N records, this program installed as an enumerating
// application, and the real typhorad serving it from a child process.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "platform/ipc/ipc_connection.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/value.h"

namespace typhora::bench {

// The user-fonts information of `records` fonts in 50 providers; every seventh is disabled.
Value userFontsOf(int records);

class BenchDevice {
 public:
  explicit BenchDevice(int fonts);
  ~BenchDevice();
  BenchDevice(const BenchDevice&) = delete;
  BenchDevice& operator=(const BenchDevice&) = delete;

  std::string root() const { return dir_ + "/root"; }
  std::string runtimeDir() const { return dir_ + "/run"; }

  // Starts the daemon; false when it did not make its socket.
  bool start();
  // Starts the daemon without waiting (for timing its start-up).
  void spawn();
  void stop();
  pid_t pid() const { return pid_; }

  // Writes the user-fonts file again as the registry does, by rename: the same bytes in a new
  // file. False when it could not.
  bool rewriteUserFonts() const;

  // A connection to the service with its handshake done.
  std::shared_ptr<IpcConnection> connect(LumoService& service) const;

 private:
  std::string userFontsFile() const;

  std::string dir_;
  pid_t pid_ = -1;
};

// One check-in on `connection`: its answer, or null when none came.
Value checkIn(const std::shared_ptr<IpcConnection>& connection);

}  // namespace typhora::bench
