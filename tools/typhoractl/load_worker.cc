#include "load_worker.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <mutex>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/linux/lumo/lumo_service.h"

namespace typhora::ctl {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kMaxErrorsKept = 20;

// Counts the font changes the daemon tells this client of.
class ChangeListener final : public IpcExportedObject {
 public:
  bool invoke(const IpcOperation& operation, const std::vector<Value>&, IpcReply) override {
    if (operation.wireName == op::kFontAddedInfo) ++received;
    return true;
  }
  std::atomic<long> received{0};
};

Clock::duration seconds(double value) {
  return std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(value));
}

}  // namespace

LoadWorker::LoadWorker(const ClientOptions& options, const LoadPlan& plan, int index)
    : options_(options), plan_(plan), index_(index) {}

bool LoadWorker::timedCall(const std::string& name, const std::string& wireName,
                           std::vector<Value> args) {
  std::string error;
  bool answered = false;
  const Clock::time_point sent = Clock::now();
  connection_->synchronousRemoteObjectProxy([&error](const std::string& text) { error = text; })
      ->call(wireName, std::move(args), [&answered](std::vector<Value>) { answered = true; });
  Operation& operation = operations_[name];
  if (!answered) {
    ++operation.errors;
    if (errors_.size() < kMaxErrorsKept) errors_.push_back(name + ": " + error);
    return false;
  }
  const std::chrono::duration<double, std::milli> took = Clock::now() - sent;
  operation.latencies.push_back(took.count());
  return true;
}

int LoadWorker::run(int fd) {
  auto listener = std::make_shared<ChangeListener>();
  LumoService service(options_.runtimeDir);
  connection_ = service.connectToService(kServiceName);
  connection_->setRemoteInterface(typhoraDaemonProtocol());
  connection_->setExportedInterface(typhoraClientProtocol());
  connection_->setExportedObject(listener);
  connection_->resume();
  const Clock::time_point start = Clock::now();
  const Clock::time_point end = start + seconds(plan_.seconds);
  // Spread each client's changes and requests over their period, so they do not come in bursts.
  const double phase = static_cast<double>(index_ + 1) / plan_.clients;
  Clock::time_point nextChange = start + seconds(plan_.changeEverySeconds * phase);
  Clock::time_point nextRequest = start + seconds(plan_.requestEverySeconds * phase);
  const Value change =
      Value::dictionary({{"added", true}, {"urls", Value::array({Value(plan_.changedUrl)})}});
  const Value request =
      Value::array({Value::dictionary({{kSVFontFamilyNameAttribute, Value(plan_.family)}})});
  bool alive = true;
  for (Clock::time_point now = start; alive && now < end; now = Clock::now()) {
    if (plan_.changeEverySeconds > 0 && now >= nextChange) {
      nextChange += seconds(plan_.changeEverySeconds);
      alive = timedCall("fontChanged", op::kFontChanged, {change});
    } else if (plan_.requestEverySeconds > 0 && now >= nextRequest) {
      nextRequest += seconds(plan_.requestEverySeconds);
      alive = timedCall("requestFonts", op::kRequestFonts, {request});
    } else {
      alive = timedCall("checkin", op::kCheckin, {});
    }
  }
  connection_->invalidate();
  report(fd, listener->received.load());
  return alive ? 0 : 1;
}

void LoadWorker::report(int fd, long notifications) const {
  std::string text;
  for (const auto& [name, operation] : operations_) {
    text += name + " " + std::to_string(operation.errors);
    for (double ms : operation.latencies) {
      text += ' ';  // appended piecewise: g++ 12 warns falsely on "literal" + std::string&&
      text += std::to_string(ms);
    }
    text += "\n";
  }
  text += "notifications ";
  text += std::to_string(notifications);
  text += '\n';
  for (const std::string& error : errors_) {
    std::string line = error;
    std::replace(line.begin(), line.end(), '\n', ' ');
    text += "error " + line + "\n";
  }
  for (std::size_t written = 0; written < text.size();) {
    const ssize_t n = write(fd, text.data() + written, text.size() - written);
    if (n <= 0) break;
    written += static_cast<std::size_t>(n);
  }
}

}  // namespace typhora::ctl
