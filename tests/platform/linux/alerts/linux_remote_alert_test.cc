// Remote alerts start real view-service processes: `typhoractl view-service` answers through the
// endpoint of this test's anonymous listener.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>

#include "ipc/interface_descriptions.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/alerts/linux_remote_alert.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/json_codec.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kPatience = 30s;
constexpr const char* kService = "com.zorvane.FontInstallViewService";
constexpr const char* kController = "FontInstallMissingFontsViewController";

// This process's children as "<pid> <state>", from /proc.
std::vector<std::string> children() {
  std::vector<std::string> found;
  const std::string parent = std::to_string(getpid());
  std::error_code error;
  for (const auto& entry : fs::directory_iterator("/proc", error)) {
    std::ifstream file(entry.path() / "stat");
    std::string stat;
    if (!std::getline(file, stat)) continue;
    const auto close = stat.rfind(')');  // the command name may hold anything
    if (close == std::string::npos) continue;
    char state = 0;
    std::string ppid;
    std::istringstream(stat.substr(close + 1)) >> state >> ppid;
    if (ppid == parent) found.push_back(entry.path().filename().string() + " " + state);
  }
  return found;
}

// Waits until every child has ended and been reaped; a zombie stays in the answer.
std::vector<std::string> childrenLeft() {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!children().empty() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(10ms);
  }
  return children();
}

// Accepts view-service connections and records what doneWithMissingFonts: brings.
class ViewServiceServer final : public IpcListenerDelegate,
                                public IpcExportedObject,
                                public std::enable_shared_from_this<ViewServiceServer> {
 public:
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    c->setExportedInterface(fontInstallViewServiceProtocol());
    c->setExportedObject(shared_from_this());
    c->resume();
    return true;
  }
  bool invoke(const IpcOperation& op, const std::vector<Value>& args, IpcReply) override {
    if (op.wireName != op::kDoneWithMissingFonts) return false;
    {
      std::lock_guard lock(mutex_);
      answers_.push_back(args[0]);
    }
    answered_.signal();
    return true;
  }
  std::optional<Value> waitForAnswer() {
    if (!answered_.waitFor(kPatience)) return std::nullopt;
    std::lock_guard lock(mutex_);
    return answers_.front();
  }

 private:
  std::mutex mutex_;
  std::vector<Value> answers_;
  Semaphore answered_;
};

class LinuxRemoteAlertTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/typhora-alert-XXXXXX";
    root_ = mkdtemp(pattern);
    fs::create_directories(root_ + "/etc/typhora/view-services");
    alert_ = std::make_unique<LinuxRemoteAlert>(root_);
    listener_ = service_.makeAnonymousListener();
    listener_->setDelegate(server_);
    listener_->resume();
  }
  void TearDown() override {
    listener_->invalidate();
    fs::remove_all(root_);
  }
  void configure(const std::string& service, const std::string& text) {
    std::ofstream(root_ + "/etc/typhora/view-services/" + service + ".plist") << text;
  }
  void present(const std::string& service, const Value& userInfo) {
    alert_->makeHandle({service, kController}, {listener_->endpoint()})
        ->activate(userInfo, [ends = ends_] {
          ++ends->count;
          ends->signal.signal();
        });
  }
  // Waits until `count` presented view services have ended (or could not be started).
  bool waitForEnds(int count) {
    for (int i = ends_->count.load(); i < count; ++i)
      if (!ends_->signal.waitFor(kPatience)) return false;
    return ends_->count.load() >= count;
  }

  std::string root_;
  LumoService service_{"/nonexistent"};
  std::shared_ptr<ViewServiceServer> server_ = std::make_shared<ViewServiceServer>();
  std::shared_ptr<IpcListener> listener_;
  std::unique_ptr<LinuxRemoteAlert> alert_;
  // Shared with the handlers, which the I/O thread may still be leaving when a test ends.
  struct Ends {
    std::atomic<int> count{0};
    Semaphore signal;
  };
  std::shared_ptr<Ends> ends_ = std::make_shared<Ends>();
};

TEST_F(LinuxRemoteAlertTest, TheViewServiceGetsTheUserInfoAndAnswersThroughTheEndpoint) {
  // The shell saves what the view service prints; everything else goes through untouched.
  const std::string printed = root_ + "/printed.json";
  const std::string script = "exec \"$0\" view-service --print \"$@\" > " + printed;
  configure(kService, JsonCodec::encode(Value::dictionary({
                          {"Program", "/bin/sh"},
                          {"Arguments", Value::array({"-c", script, TYPHORACTL_PATH, "--answer",
                                                      "[\"Foo-Bold\", \"Bar\"]"})},
                      })));
  ValueArray names;
  for (int i = 0; i < 20000; ++i) names.push_back("MissingFont-" + std::to_string(i));
  const Value userInfo =
      Value::dictionary({{"fontNames", names}, {"bundleIdentifier", "com.example.app"}});

  present(kService, userInfo);

  const auto answer = server_->waitForAnswer();
  ASSERT_TRUE(answer.has_value());
  EXPECT_EQ(*answer, Value::array({"Foo-Bold", "Bar"}));
  EXPECT_THAT(childrenLeft(), ::testing::IsEmpty());
  EXPECT_TRUE(waitForEnds(1));
  std::ifstream file(printed);
  std::string line;
  std::getline(file, line);
  EXPECT_GT(line.size(), 300'000u);
  EXPECT_EQ(JsonCodec::decode(line), userInfo);
}

TEST_F(LinuxRemoteAlertTest, ProgramsThatIgnoreTheirInputOrFailAreReapedQuietly) {
  configure("quits", R"({"Program": "/bin/true"})");
  configure("fails", R"({"Program": "/bin/sh", "Arguments": ["-c", "exit 3"]})");
  ValueArray big(100000, Value("unread"));
  for (int i = 0; i < 5; ++i) present("quits", Value::dictionary({{"names", big}}));
  testing::LogCapture log;
  present("fails", Value::dictionary({}));
  // Writing to a pipe nobody reads any more must not raise SIGPIPE in this process.
  EXPECT_THAT(childrenLeft(), ::testing::IsEmpty());
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!log.contains("ended with status 3") && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_TRUE(log.contains("ended with status 3"));
  // Each end is reported once, after the process was reaped.
  EXPECT_TRUE(waitForEnds(6));
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(ends_->count.load(), 6);
}

TEST_F(LinuxRemoteAlertTest, BadConfigurationsAreLoggedAndStartNothing) {
  configure("garbled", "{\"Program\": ");
  configure("relative", R"({"Program": "bin/true"})");
  configure("arguments", R"({"Program": "/bin/true", "Arguments": [1]})");
  configure("absent-program", R"({"Program": "/nonexistent/view-service"})");
  testing::LogCapture log;
  for (const char* service : {"missing", "garbled", "relative", "arguments", "absent-program",
                              "../view-services/garbled"}) {
    present(service, Value::dictionary({}));
    EXPECT_TRUE(log.contains(std::string("of view service ") + service + ": ")) << service;
  }
  for (const auto& line : log.lines()) EXPECT_EQ(line.level, LogLevel::Error) << line.message;
  EXPECT_THAT(children(), ::testing::IsEmpty());
  // Nothing was started, so nothing will answer: each says so at once.
  EXPECT_EQ(ends_->count.load(), 6);
}

}  // namespace
}  // namespace typhora
