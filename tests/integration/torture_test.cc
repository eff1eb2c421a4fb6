// typhora-torture against the real daemon, with small counts: every attack is answered, the
// daemon keeps serving a well-behaved client throughout, and its descriptors come back.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <iostream>
#include <sstream>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

const std::string kTorture = std::string(TYPHORA_BINARY_DIR) + "/tools/typhora-torture";

class TortureTest : public DaemonTestBase {
 protected:
  std::vector<std::string> torture(std::vector<std::string> extra) const {
    std::vector<std::string> argv = {kTorture, "--runtime-dir", runtime_.string(), "--json"};
    argv.insert(argv.end(), extra.begin(), extra.end());
    return argv;
  }
};

TEST_F(TortureTest, EveryAttackLeavesTheDaemonServingAndRefusesEveryBorrowedIdentity) {
  startDaemon();
  auto run = runCommand(torture({"--seconds", "2", "--storm", "300"}), 180s);
  std::cout << "[figures]\n" << run.out;
  EXPECT_EQ(run.status, 0) << run.all << daemon_->output();
  std::istringstream rows(run.out);
  std::string row;
  int count = 0;
  while (std::getline(rows, row)) {
    ++count;
    EXPECT_THAT(row, HasSubstr(R"("serving":true)"));
    EXPECT_THAT(row, HasSubstr(R"("gotThrough":0,)"));
    EXPECT_THAT(row, Not(HasSubstr(R"("tries":0,)")));
  }
  EXPECT_EQ(count, 8) << run.out;
  EXPECT_EQ(daemon_->waitFor(0ms), -1) << daemon_->output();
  // What a hostile peer reaches is logged once per peer, not once per message.
  EXPECT_LT(daemon_->countLines("holds too many connections"), 5u) << daemon_->output();
}

TEST_F(TortureTest, ADaemonThatStopsServingFailsTheRow) {
  startDaemon();
  ChildProcess run(torture({"--seconds", "4", "--only", "churn"}));
  std::this_thread::sleep_for(1s);
  daemon_->kill(SIGKILL);
  daemon_->wait();
  ASSERT_EQ(run.waitFor(60s), 1) << run.output();
  run.finishOutput();
  EXPECT_THAT(run.standardOutput(), HasSubstr(R"("serving":false)"));
}

}  // namespace
}  // namespace typhora::testing
