// The per-user connection cap: refused connections are logged once, however often the user knocks
// at its cap or comes back to it.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <thread>
#include <vector>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "support/log_capture.h"
#include "support/scoped_admission_limits.h"

namespace typhora::testing {
namespace {

TEST(LumoAdmissionTest, AUserKnockingAtItsCapIsLoggedOnceNotPerConnection) {
  LumoAdmission& admission = LumoAdmission::shared();
  const ScopedAdmissionLimits limits([](LumoAdmissionLimits& l) { l.connectionsPerUser = 8; });
  LogCapture log;
  constexpr uid_t kUser = 4242421;
  for (int i = 0; i < 8; ++i) ASSERT_TRUE(admission.admit(kUser));
  // Flapping at the cap: one in, one out, a hundred times.
  for (int i = 0; i < 100; ++i) {
    EXPECT_FALSE(admission.admit(kUser));
    admission.release(kUser);
    EXPECT_TRUE(admission.admit(kUser));
  }
  const std::string line = "holds too many connections";
  std::size_t logged = 0;
  for (const LogLine& l : log.lines()) logged += l.message.find(line) != std::string::npos;
  EXPECT_EQ(logged, 1u);
  // Down to nothing and back over the cap, as a storm of connections does round after round.
  for (int round = 0; round < 10; ++round) {
    for (int i = 0; i < 8; ++i) admission.release(kUser);
    for (int i = 0; i < 8; ++i) ASSERT_TRUE(admission.admit(kUser));
    EXPECT_FALSE(admission.admit(kUser));
  }
  logged = 0;
  for (const LogLine& l : log.lines()) logged += l.message.find(line) != std::string::npos;
  EXPECT_EQ(logged, 1u);
  for (int i = 0; i < 8; ++i) admission.release(kUser);
}

// Accepted connections count against the cap of unfinished handshakes from the accept on, even
// while the listener's delegate has not greeted them yet; only one whose hello went out and that
// stayed silent past the grace may be cut off to make room.
TEST(LumoAdmissionTest, UngreetedConnectionsCountAgainstTheCapAndAreNeverCutOff) {
  LumoAdmission& admission = LumoAdmission::shared();
  const ScopedAdmissionLimits limits([](LumoAdmissionLimits& l) { l.unidentified = 4; });
  std::vector<std::shared_ptr<LumoConnection>> accepted;
  std::vector<UniqueFd> peers;
  for (int i = 0; i < 4; ++i) {
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    peers.emplace_back(pair[1]);
    auto connection = LumoConnection::adopt(UniqueFd(pair[0]), ProcessPin::ofSocketPeer(pair[0]));
    admission.awaitHello(connection->auditToken().uid, connection);
    accepted.push_back(connection);
  }
  EXPECT_FALSE(admission.mayAccept([] {}));  // full, and nobody has been greeted
  std::this_thread::sleep_for(LumoAdmission::kHelloGrace);
  EXPECT_FALSE(admission.mayAccept([] {}));  // still nobody owes an answer to a hello
  admission.helloSent(accepted[2]->auditToken().uid, accepted[2].get());
  std::this_thread::sleep_for(LumoAdmission::kHelloGrace);
  EXPECT_TRUE(admission.mayAccept([] {}));  // the greeted, silent one made room
  EXPECT_FALSE(accepted[2]->isValid());
  EXPECT_TRUE(accepted[0]->isValid());
  EXPECT_EQ(admission.unidentifiedCount(), 3u);
  for (auto& connection : accepted) connection->invalidate();
  EXPECT_EQ(admission.unidentifiedCount(), 0u);
}

}  // namespace
}  // namespace typhora::testing
