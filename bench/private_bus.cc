#include "private_bus.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>

namespace typhora::bench {
namespace {

namespace fs = std::filesystem;

constexpr const char* kInterface = "org.typhora.Compare";

// Values as D-Bus variants: dictionaries as a{sv}, arrays as av, data as ay.
int appendVariant(sd_bus_message* m, const Value& value);

int appendDictionary(sd_bus_message* m, const Dictionary& dictionary) {
  int r = sd_bus_message_open_container(m, 'a', "{sv}");
  for (const auto& [key, item] : dictionary) {
    if (r < 0) return r;
    r = sd_bus_message_open_container(m, 'e', "sv");
    if (r >= 0) r = sd_bus_message_append(m, "s", key.c_str());
    if (r >= 0) r = appendVariant(m, item);
    if (r >= 0) r = sd_bus_message_close_container(m);
  }
  return r < 0 ? r : sd_bus_message_close_container(m);
}

int appendVariant(sd_bus_message* m, const Value& value) {
  switch (value.type()) {
    case Value::Type::Bool:
      return sd_bus_message_append(m, "v", "b", static_cast<int>(*value.asBool()));
    case Value::Type::Int:
      return sd_bus_message_append(m, "v", "x", *value.asInt());
    case Value::Type::UInt:
      return sd_bus_message_append(m, "v", "t", *value.asUInt());
    case Value::Type::Double:
    case Value::Type::Date:
      return sd_bus_message_append(m, "v", "d", *value.asDouble());
    case Value::Type::String:
      return sd_bus_message_append(m, "v", "s", value.asString()->c_str());
    case Value::Type::Data: {
      int r = sd_bus_message_open_container(m, 'v', "ay");
      const Bytes& bytes = *value.asData();
      if (r >= 0) r = sd_bus_message_append_array(m, 'y', bytes.data(), bytes.size());
      return r < 0 ? r : sd_bus_message_close_container(m);
    }
    case Value::Type::Array: {
      int r = sd_bus_message_open_container(m, 'v', "av");
      if (r >= 0) r = sd_bus_message_open_container(m, 'a', "v");
      for (const Value& item : *value.asArray()) {
        if (r >= 0) r = appendVariant(m, item);
      }
      if (r >= 0) r = sd_bus_message_close_container(m);
      return r < 0 ? r : sd_bus_message_close_container(m);
    }
    case Value::Type::Dictionary: {
      int r = sd_bus_message_open_container(m, 'v', "a{sv}");
      if (r >= 0) r = appendDictionary(m, *value.asDictionary());
      return r < 0 ? r : sd_bus_message_close_container(m);
    }
    default:
      return sd_bus_message_append(m, "v", "s", "");
  }
}

}  // namespace

PrivateBus::PrivateBus() {
  char pattern[] = "/tmp/typhora-compare-bus-XXXXXX";
  if (mkdtemp(pattern) == nullptr) return;
  dir_ = pattern;
  const std::string socket = dir_ + "/bus";
  address_ = "unix:path=" + socket;
  std::ofstream(dir_ + "/bus.conf")
      << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN\"\n"
      << " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
      << "<busconfig><type>session</type><listen>" << address_ << "</listen>"
      << "<auth>EXTERNAL</auth><policy context=\"default\"><allow send_destination=\"*\"/>"
      << "<allow receive_sender=\"*\"/><allow own=\"*\"/></policy>"
      << "<limit name=\"max_message_size\">268435456</limit>"
      << "<limit name=\"max_incoming_bytes\">1073741824</limit>"
      << "<limit name=\"max_outgoing_bytes\">1073741824</limit></busconfig>\n";
  const std::string config = "--config-file=" + dir_ + "/bus.conf";
  pid_ = fork();
  if (pid_ == 0) {
    const int null = open("/dev/null", O_WRONLY);
    dup2(null, 2);
    execlp("dbus-daemon", "dbus-daemon", config.c_str(), "--nofork", "--nopidfile",
           static_cast<char*>(nullptr));
    _exit(127);
  }
  for (int i = 0; i < 500 && !fs::exists(socket); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ready_ = fs::exists(socket);
}

PrivateBus::~PrivateBus() {
  if (pid_ > 0) {
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
  }
  if (!dir_.empty()) fs::remove_all(dir_);
}

sd_bus* PrivateBus::connect() const {
  sd_bus* bus = nullptr;
  if (sd_bus_new(&bus) < 0) return nullptr;
  if (sd_bus_set_address(bus, address_.c_str()) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0) {
    sd_bus_unref(bus);
    return nullptr;
  }
  return bus;
}

BusServer::BusServer(const PrivateBus& bus) : bus_(bus.connect()) {
  static const sd_bus_vtable table[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD("Ping", "", "", &BusServer::ping, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD("Answer", "", "a{sv}", &BusServer::answer, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_VTABLE_END,
  };
  if (bus_ == nullptr) return;
  if (sd_bus_add_object_vtable(bus_, &slot_, kPath, kInterface, table, this) < 0) return;
  if (sd_bus_request_name(bus_, kName, 0) < 0) return;
  ready_ = true;
  thread_ = std::thread([this] { serve(); });
}

BusServer::~BusServer() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
  sd_bus_slot_unref(slot_);
  sd_bus_flush_close_unref(bus_);
}

void BusServer::setAnswer(Value answer) {
  std::lock_guard lock(mutex_);
  answer_ = std::move(answer);
}

void BusServer::serve() {
  while (!stop_) {
    const int r = sd_bus_process(bus_, nullptr);
    if (r < 0) break;
    if (r > 0) continue;
    sd_bus_wait(bus_, 100'000);
  }
}

int BusServer::ping(sd_bus_message* call, void*, sd_bus_error*) {
  return sd_bus_reply_method_return(call, "");
}

int BusServer::answer(sd_bus_message* call, void* self, sd_bus_error*) {
  Value answer;
  {
    auto* server = static_cast<BusServer*>(self);
    std::lock_guard lock(server->mutex_);
    answer = server->answer_;
  }
  sd_bus_message* reply = nullptr;
  int r = sd_bus_message_new_method_return(call, &reply);
  static const Dictionary empty;
  const Dictionary* dictionary = answer.asDictionary();
  if (r >= 0) r = appendDictionary(reply, dictionary != nullptr ? *dictionary : empty);
  if (r >= 0) r = sd_bus_send(nullptr, reply, nullptr);
  sd_bus_message_unref(reply);
  return r;
}

bool callBus(sd_bus* client, const char* method) {
  sd_bus_error error{};  // the same as SD_BUS_ERROR_NULL, which is C99 only
  sd_bus_message* reply = nullptr;
  int r = sd_bus_call_method(client, BusServer::kName, BusServer::kPath, kInterface, method, &error,
                             &reply, "");
  // The client reads what it received, as a lumo client decodes its answer.
  if (r >= 0 && std::string(method) == "Answer") r = sd_bus_message_skip(reply, "a{sv}");
  sd_bus_message_unref(reply);
  sd_bus_error_free(&error);
  return r >= 0;
}

}  // namespace typhora::bench
