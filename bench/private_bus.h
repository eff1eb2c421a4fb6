// A dbus-daemon started for the comparison run on a private socket in a temporary directory
// (never the system or session bus), and a server on it answering through sd-bus.
#pragma once

#include <sys/types.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "platform/value/value.h"

namespace typhora::bench {

class PrivateBus {
 public:
  PrivateBus();
  ~PrivateBus();
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;

  bool ready() const { return ready_; }
  const std::string& address() const { return address_; }
  // A new client connection to the bus, or null.
  sd_bus* connect() const;

 private:
  std::string dir_;
  std::string address_;
  pid_t pid_ = -1;
  bool ready_ = false;
};

// Serves "Ping" (empty call) and "Answer" (the current answer as a{sv}) on its own thread.
class BusServer {
 public:
  static constexpr const char* kName = "org.typhora.Compare";
  static constexpr const char* kPath = "/compare";

  explicit BusServer(const PrivateBus& bus);
  ~BusServer();
  BusServer(const BusServer&) = delete;
  BusServer& operator=(const BusServer&) = delete;

  bool ready() const { return ready_; }
  void setAnswer(Value answer);

 private:
  static int ping(sd_bus_message* call, void* self, sd_bus_error* error);
  static int answer(sd_bus_message* call, void* self, sd_bus_error* error);
  void serve();

  sd_bus* bus_ = nullptr;
  sd_bus_slot* slot_ = nullptr;
  std::mutex mutex_;
  Value answer_;
  std::atomic<bool> stop_{false};
  bool ready_ = false;
  std::thread thread_;
};

// Calls `method` of the server with no arguments and reads the whole reply; false on error.
bool callBus(sd_bus* client, const char* method);

}  // namespace typhora::bench
