// The application handler's list of web-content connections: each check-in adds its own, the
// end of one removes only that one, also while other threads add and end connections.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using testing::FakeIpcEndpoint;
using testing::FakePlatform;
using testing::LogCapture;

constexpr const char* kInvalidated =
    "TYBrisvel checkinForBrisvelProcess connection invalidationHandler.";

class WebContentSupportTest : public ::testing::Test {
 protected:
  // Each connection's invalidation handler owns the handler, as the real layer holds it until the
  // web-content process ends: end the ones still listed so the handler can go.
  void TearDown() override {
    for (auto& connection : handler_->webcontentProcessConnections()) connection->invalidate();
  }

  void checkin() {
    handler_->checkinForBrisvelProcess(endpoint_, [this](std::vector<Value>) { ++replies_; });
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::shared_ptr<TyphoraHandler> handler_ = std::make_shared<TyphoraHandler>(daemon_);
  std::shared_ptr<const IpcEndpoint> endpoint_ =
      std::make_shared<FakeIpcEndpoint>(std::weak_ptr<testing::FakeIpcListener>());
  std::atomic<int> replies_{0};
};

TEST_F(WebContentSupportTest, TwoCheckinsLeaveTwoConnectionsAndTheEndOfOneRemovesOnlyIt) {
  LogCapture log;
  checkin();
  checkin();
  auto connections = handler_->webcontentProcessConnections();
  ASSERT_EQ(connections.size(), 2u);
  EXPECT_EQ(log.count("TYBrisvel calling ping2"), 2u);
  connections[0]->invalidate();
  EXPECT_THAT(handler_->webcontentProcessConnections(), ::testing::ElementsAre(connections[1]));
  EXPECT_EQ(log.count(kInvalidated), 1u);
  // The web-content process never answered the ping: the application is not answered either.
  EXPECT_TRUE(
      log.contains("lumo error: -[TyphoraHandler checkinForBrisvelProcess:reply:]"
                   "_block_invoke_2 - "));
  EXPECT_EQ(replies_.load(), 0);
}

TEST_F(WebContentSupportTest, ConcurrentCheckinsAndEndsLeaveExactlyTheLiveConnections) {
  LogCapture log;
  constexpr int kAdders = 4;
  constexpr int kEach = 150;
  std::atomic<int> addersLeft{kAdders};
  std::vector<std::thread> threads;
  for (int t = 0; t < kAdders; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < kEach; ++i) checkin();
      --addersLeft;
    });
  }
  for (int t = 0; t < 2; ++t) {
    threads.emplace_back([&] {
      while (addersLeft.load() > 0 || !handler_->webcontentProcessConnections().empty()) {
        for (auto& connection : handler_->webcontentProcessConnections()) connection->invalidate();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_TRUE(handler_->webcontentProcessConnections().empty());
  EXPECT_EQ(log.count(kInvalidated), static_cast<std::size_t>(kAdders * kEach));
}

}  // namespace
}  // namespace typhora
