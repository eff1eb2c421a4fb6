// A peer process for the lumo tests. Modes:
//   call DIR OP JSON       calls OP of service "test.a" with one argument, prints the reply
//   hang DIR               calls "hang:reply:" (never answered) and waits
//   serve-c DIR            serves "test.c": useEndpoint:reply: connects to the endpoint given
//                          and answers with what its echo:reply: says
//   forward DIR            asks "test.a" for an endpoint and hands it to "test.c"
//   exec-after-call DIR    calls echo:reply:, then becomes /bin/sleep
//   flood DIR [BYTES]      sends calls of BYTES (1 MiB) on a raw socket, never reading answers
//   garbage DIR            sends bytes that are no frame, then a valid call
//   notes DIR N            N times: connects, sends the one-way note: and closes at once
//   ordered DIR N          on one connection, sends the notes "0" to "N-1", then one echo:reply:
//                          (answered only once the notes are handled)
//   callers DIR T N        on one connection, T threads each make N synchronous count:reply:
//                          calls while one more thread makes asynchronous ones; prints the
//                          number of wrong or missing answers
//   listen DIR N           stays connected until the service has sent it N note:s, printing each
//                          note's length; prints "ready" once the service knows it
//   deaf DIR               connects and never reads; prints "ready" once the service knows it
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <iostream>
#include <thread>

#include "platform/dispatch/semaphore.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/linux/lumo/transport/lumo_frame.h"
#include "platform/value/json_codec.h"
#include "support/lumo_test_interface.h"
#include "support/raw_lumo_client.h"

using namespace typhora;

namespace {

std::vector<Value> callA(LumoService& service, const std::string& op, std::vector<Value> args,
                         bool* ok) {
  auto connection = service.connectToService("test.a");
  connection->setRemoteInterface(lumoTestInterface());
  connection->resume();
  std::vector<Value> reply;
  *ok = false;
  connection->synchronousRemoteObjectProxy([](const std::string& e) { std::cerr << e << "\n"; })
      ->call(op, std::move(args), [&](std::vector<Value> r) {
        reply = std::move(r);
        *ok = true;
      });
  connection->invalidate();
  return reply;
}

int rawConnect(const std::string& dir) {
  int fd = raw::connectTo(dir + "/test.a");
  return fd >= 0 && raw::handshake(fd) ? fd : -1;
}

class UseEndpoint final : public IpcExportedObject {
 public:
  explicit UseEndpoint(LumoService& service) : service_(service) {}
  bool invoke(const IpcOperation&, const std::vector<Value>& args, IpcReply reply) override {
    auto connection = service_.connect(*args[0].asEndpoint());
    connection->setRemoteInterface(lumoTestInterface());
    connection->resume();
    Value answer;
    connection->synchronousRemoteObjectProxy([](const std::string&) {})
        ->call("echo:reply:", {Value("from c")}, [&](std::vector<Value> r) { answer = r.at(0); });
    connection->invalidate();
    reply({answer});
    return true;
  }

 private:
  LumoService& service_;
};

// Counts the notes the service sends, printing each one's length.
class NoteCounter final : public IpcExportedObject {
 public:
  explicit NoteCounter(int expected) : left_(expected) {}
  bool invoke(const IpcOperation& op, const std::vector<Value>& args, IpcReply) override {
    if (op.wireName != "note:") return false;
    std::cout << "note " << args[0].asString()->size() << std::endl;
    if (--left_ == 0) done.signal();
    return true;
  }
  Semaphore done;

 private:
  int left_;
};

class Delegate final : public IpcListenerDelegate {
 public:
  explicit Delegate(LumoService& service) : service_(service) {}
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    c->setExportedInterface(lumoTestInterface());
    c->setExportedObject(std::make_shared<UseEndpoint>(service_));
    c->resume();
    return true;
  }

 private:
  LumoService& service_;
};

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return 2;
  const std::string mode = argv[1];
  const std::string dir = argv[2];
  LumoService service(dir);
  bool ok = false;
  if (mode == "call" && argc == 5) {
    auto reply = callA(service, argv[3], {*JsonCodec::decode(argv[4])}, &ok);
    std::cout << JsonCodec::encode(Value(ValueArray(reply))) << std::endl;
    return ok ? 0 : 1;
  }
  if (mode == "notes" && argc == 4) {
    for (int i = std::stoi(argv[3]); i > 0; --i) {
      auto connection = LumoConnection::toPath(dir + "/test.a");
      connection->setRemoteInterface(lumoTestInterface());
      connection->resume();
      connection->remoteObjectProxy({})->call("note:", {Value("n")});
      if (!connection->waitUntilSent(std::chrono::seconds(10))) return 1;
      connection->invalidate();
    }
    return 0;
  }
  if (mode == "ordered" && argc == 4) {
    auto connection = service.connectToService("test.a");
    connection->setRemoteInterface(lumoTestInterface());
    connection->resume();
    for (int i = 0, n = std::stoi(argv[3]); i < n; ++i) {
      connection->remoteObjectProxy({})->call("note:", {Value(std::to_string(i))});
    }
    std::vector<Value> reply;
    connection->synchronousRemoteObjectProxy({})->call(
        "echo:reply:", {Value("done")}, [&](std::vector<Value> values) { reply = values; });
    return reply.size() == 1 ? 0 : 1;
  }
  if (mode == "callers" && argc == 5) {
    const int threads = std::stoi(argv[3]);
    const int calls = std::stoi(argv[4]);
    auto connection = service.connectToService("test.a");
    connection->setRemoteInterface(lumoTestInterface());
    connection->resume();
    std::atomic<int> wrong{0};
    Semaphore asyncAnswered;
    std::vector<std::thread> callers;
    for (int t = 0; t <= threads; ++t) {
      callers.emplace_back([&, t] {
        const bool async = t == threads;
        auto proxy =
            async ? connection->remoteObjectProxy([&](const std::string&) { ++wrong; })
                  : connection->synchronousRemoteObjectProxy([&](const std::string&) { ++wrong; });
        for (int i = 0; i < calls; ++i) {
          const std::int64_t n = t * 1'000'000 + i;
          auto answered = std::make_shared<std::atomic<bool>>(false);
          proxy->call("count:reply:", {Value(n)}, [&, n, answered](std::vector<Value> r) {
            *answered = true;
            if (r.size() != 1 || r[0].asInt() != n + 1) ++wrong;
            if (async) asyncAnswered.signal();
          });
          if (!async && !*answered) ++wrong;
        }
        if (async) {
          for (int i = 0; i < calls; ++i)
            if (!asyncAnswered.waitFor(std::chrono::seconds(20))) ++wrong;
        }
      });
    }
    for (auto& caller : callers) caller.join();
    connection->invalidate();
    std::cout << wrong.load() << std::endl;
    return wrong == 0 ? 0 : 1;
  }
  if (mode == "listen" && argc == 4) {
    auto counter = std::make_shared<NoteCounter>(std::stoi(argv[3]));
    auto connection = service.connectToService("test.a");
    connection->setRemoteInterface(lumoTestInterface());
    connection->setExportedInterface(lumoTestInterface());
    connection->setExportedObject(counter);
    connection->resume();
    callA(service, "echo:reply:", {Value("known")}, &ok);  // answered after this one's accept
    std::cout << "ready" << std::endl;
    counter->done.wait();
    return 0;
  }
  if (mode == "deaf") {
    const int fd = rawConnect(dir);
    callA(service, "echo:reply:", {Value("known")}, &ok);
    std::cout << (fd >= 0 ? "ready" : "no connection") << std::endl;
    pause();
  }
  if (mode == "hang") {
    std::cout << "calling" << std::endl;
    callA(service, "hang:reply:", {}, &ok);
    return 0;
  }
  if (mode == "serve-c") {
    auto delegate = std::make_shared<Delegate>(service);
    auto listener = service.makeNamedListener("test.c");
    listener->setDelegate(delegate);
    listener->resume();
    std::cout << "ready" << std::endl;
    Semaphore forever;
    forever.wait();
  }
  if (mode == "forward") {
    auto endpoint = callA(service, "endpoint:reply:", {}, &ok);
    if (!ok) return 1;
    auto c = service.connectToService("test.c");
    c->setRemoteInterface(lumoTestInterface());
    c->resume();
    Value answer;
    c->synchronousRemoteObjectProxy([](const std::string& e) {
       std::cerr << e << "\n";
     })->call("useEndpoint:reply:", {endpoint.at(0)}, [&](std::vector<Value> r) {
      answer = r.at(0);
    });
    std::cout << answer.description() << std::endl;
    return answer.isNull() ? 1 : 0;
  }
  if (mode == "exec-after-call") {
    callA(service, "echo:reply:", {Value("before exec")}, &ok);
    execl("/bin/sleep", "sleep", "30", static_cast<char*>(nullptr));
    return 1;
  }
  if (mode == "flood") {
    int fd = rawConnect(dir);
    const std::size_t bytes = argc > 3 ? std::stoul(argv[3]) : 1u << 20;
    auto frame = raw::frameOf("echo:reply:", {Value(std::string(bytes, 'f'))}, 1);
    for (std::size_t sent = 0; sent < 200u << 20; sent += frame.size()) {
      if (send(fd, frame.data(), frame.size(), MSG_NOSIGNAL) < 0) break;
    }
    std::cout << "flooded" << std::endl;
    pause();
  }
  if (mode == "garbage") {
    int fd = rawConnect(dir);
    const char junk[] = "GET / HTTP/1.1\r\n\r\n";
    send(fd, junk, sizeof junk, MSG_NOSIGNAL);
    char byte;
    return recv(fd, &byte, 1, 0) == 0 ? 0 : 1;  // the listener side closes on us
  }
  return 2;
}
