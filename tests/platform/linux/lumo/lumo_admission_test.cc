// The per-user connection cap: refused connections are logged once, however often the user knocks
// at its cap or comes back to it.
#include <gtest/gtest.h>

#include "platform/linux/lumo/lumo_admission.h"
#include "support/log_capture.h"

namespace typhora::testing {
namespace {

TEST(LumoAdmissionTest, AUserKnockingAtItsCapIsLoggedOnceNotPerConnection) {
  LumoAdmission& admission = LumoAdmission::shared();
  const LumoAdmissionLimits saved = admission.limits();
  LumoAdmissionLimits limits = saved;
  limits.connectionsPerUser = 8;
  admission.setLimits(limits);
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
  admission.setLimits(saved);
}

}  // namespace
}  // namespace typhora::testing
