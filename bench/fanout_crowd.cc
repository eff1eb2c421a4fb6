#include "fanout_crowd.h"

#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <mutex>

#include "bench_device.h"
#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/cbor_codec.h"

namespace typhora::bench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr uid_t kFirstUser = 61000;

// Counts the font changes each of a child's connections receives.
class ChangeCounter final : public IpcExportedObject {
 public:
  explicit ChangeCounter(int connections) : connections_(connections) {}

  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply) override {
    if (operation.wireName != op::kFontAddedInfo) return false;
    std::lock_guard lock(mutex_);
    last_ = Clock::now().time_since_epoch().count();
    bytes_ = CborCodec::encode(Value(ValueArray(arguments))).size();
    if (++received_ % connections_ == 0) changed_.notify_all();
    return true;
  }

  // Waits until every connection has received `round` changes.
  bool await(long round, std::int64_t* last, std::size_t* bytes) {
    std::unique_lock lock(mutex_);
    const bool done = changed_.wait_for(lock, std::chrono::seconds(60),
                                        [&] { return received_ >= round * connections_; });
    *last = last_;
    *bytes = bytes_;
    return done;
  }

 private:
  const long connections_;
  std::mutex mutex_;
  std::condition_variable changed_;
  long received_ = 0;
  std::int64_t last_ = 0;
  std::size_t bytes_ = 0;
};

}  // namespace

void runFanoutClient(const std::string& runtimeDir, int count, uid_t uid) {
  if (setgroups(0, nullptr) != 0 || setgid(uid) != 0 || setuid(uid) != 0) _exit(3);
  auto counter = std::make_shared<ChangeCounter>(count);
  LumoService service(runtimeDir);
  std::vector<std::shared_ptr<IpcConnection>> connections;
  for (int i = 0; i < count; ++i) {
    auto connection = service.connectToService(kServiceName);
    connection->setRemoteInterface(typhoraDaemonProtocol());
    connection->setExportedInterface(typhoraClientProtocol());
    connection->setExportedObject(counter);
    connection->resume();
    if (checkIn(connection).isNull()) _exit(4);
    connections.push_back(std::move(connection));
  }
  std::printf("ready\n");
  std::fflush(stdout);
  for (long round = 1;; ++round) {
    std::int64_t last = 0;
    std::size_t bytes = 0;
    if (!counter->await(round, &last, &bytes)) _exit(5);
    std::printf("%lld %zu\n", static_cast<long long>(last), bytes);
    std::fflush(stdout);
  }
}

FanoutCrowd::FanoutCrowd(const std::string& runtimeDir, int clients, int processes) {
  const std::string self = std::filesystem::canonical("/proc/self/exe").string();
  for (int p = 0; p < processes; ++p) {
    const int share = clients / processes + (p < clients % processes ? 1 : 0);
    int pipeFds[2];
    if (pipe(pipeFds) != 0) return;
    const std::string count = std::to_string(share);
    const std::string uid = std::to_string(kFirstUser + static_cast<uid_t>(p));
    const pid_t pid = fork();
    if (pid == 0) {
      dup2(pipeFds[1], 1);
      close(pipeFds[0]);
      execl(self.c_str(), self.c_str(), "--fanout-client", runtimeDir.c_str(), count.c_str(),
            uid.c_str(), static_cast<char*>(nullptr));
      _exit(127);
    }
    close(pipeFds[1]);
    children_.push_back({pid, pipeFds[0]});
  }
  for (const Child& child : children_) {
    std::string line;
    if (!readLine(child, &line) || line != "ready") return;
  }
  ready_ = true;
}

FanoutCrowd::~FanoutCrowd() {
  for (const Child& child : children_) {
    kill(child.pid, SIGKILL);
    waitpid(child.pid, nullptr, 0);
    close(child.out);
  }
}

bool FanoutCrowd::readLine(const Child& child, std::string* line) {
  line->clear();
  char c = 0;
  for (;;) {
    pollfd wait{child.out, POLLIN, 0};
    if (poll(&wait, 1, 120'000) <= 0 || read(child.out, &c, 1) != 1) return false;
    if (c == '\n') return true;
    line->push_back(c);
  }
}

bool FanoutCrowd::awaitRound(std::int64_t* lastReceipt, std::size_t* messageBytes) {
  *lastReceipt = 0;
  for (const Child& child : children_) {
    std::string line;
    long long last = 0;
    std::size_t bytes = 0;
    if (!readLine(child, &line) || std::sscanf(line.c_str(), "%lld %zu", &last, &bytes) != 2)
      return false;
    *lastReceipt = std::max<std::int64_t>(*lastReceipt, last);
    *messageBytes = bytes;
  }
  return true;
}

}  // namespace typhora::bench
