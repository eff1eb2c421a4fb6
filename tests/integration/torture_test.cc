// typhora-torture against the real daemon, with small counts: every attack is answered, the
// daemon keeps serving a well-behaved client throughout, and its descriptors come back.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
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
  // An entitled application asking in the foreground for a family nobody has, with a dialog
  // that takes a while to answer: the command the torture kills with the gate and dialog up.
  std::string foregroundRequester() {
    const std::string reader = installApp("reader", "com.example.reader",
                                          R"({"com.zorvane.developer.user-fonts": ["app-usage"]})");
    fs::create_directories(root_ / "etc/typhora/view-services");
    std::ofstream(root_ / "etc/typhora/view-services/com.zorvane.FontInstallViewService.plist")
        << R"({"Program": "/bin/sh", "Arguments": ["-c", "sleep 0.2; exec )" << kCtl
        << R"( view-service \"$@\"", "view-service"]})";
    const fs::path wrapper = dir_ / "foreground";
    std::ofstream(wrapper) << "#!/bin/sh\n"
                           << kCtl << " --root " << root_.string()
                           << " app-state set $$ 8 >/dev/null && exec \"$@\"\n";
    fs::permissions(wrapper, fs::perms::owner_all);
    return wrapper.string() + " " + reader + " --runtime-dir " + runtime_.string() +
           " request-fonts --family";
  }

  std::vector<std::string> torture(std::vector<std::string> extra) const {
    std::vector<std::string> argv = {kTorture, "--runtime-dir", runtime_.string(), "--json"};
    argv.insert(argv.end(), extra.begin(), extra.end());
    return argv;
  }
};

TEST_F(TortureTest, EveryAttackLeavesTheDaemonServingAndRefusesEveryBorrowedIdentity) {
  const std::string requester = foregroundRequester();
  fs::create_directories(root_ / "var/mobile/Library/UserFonts/FontFiles/com.example.shop");
  const std::string browser =
      installApp("browser", "com.example.browser",
                 R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
  startDaemon();
  auto run = runCommand(
      torture({"--seconds", "2", "--storm", "300", "--requester", requester + " Missing",
               "--token-app",
               browser + " --runtime-dir " + runtime_.string() + " sandbox-open --checkin"}),
      180s);
  std::cout << "[figures]\n" << run.out;
  EXPECT_EQ(run.status, 0) << run.all << daemon_->output();
  std::istringstream rows(run.out);
  std::string row;
  int count = 0;
  while (std::getline(rows, row)) {
    if (row.starts_with(R"({"settled")")) continue;
    ++count;
    EXPECT_THAT(row, HasSubstr(R"("serving":true)"));
    EXPECT_THAT(row, HasSubstr(R"("gotThrough":0,)"));
    EXPECT_THAT(row, Not(HasSubstr(R"("tries":0,)")));
  }
  EXPECT_EQ(count, 9) << run.out;
  EXPECT_THAT(run.out, HasSubstr("a real token replayed by another process"));
  EXPECT_THAT(run.out, HasSubstr("requesters with the gate or dialog up"));
  // Requesters killed with the gate held left it free for the next one.
  std::istringstream words(requester + " A");
  std::vector<std::string> argv;
  for (std::string w; words >> w;) argv.push_back(w);
  auto after = runCommand(argv, 30s);
  EXPECT_EQ(after.status, 0) << after.all << daemon_->output();
  EXPECT_EQ(daemon_->waitFor(0ms), -1) << daemon_->output();
  // What a hostile peer reaches is logged once per peer, not once per message.
  EXPECT_LT(daemon_->countLines("holds too many connections"), 5u) << daemon_->output();
  // Peers of one user that open connection after connection get a budget of lines, not a line
  // each: the run opens tens of thousands.
  std::cout << "[figures] " << daemon_->countLines("lumo error") << " lumo error lines\n";
  EXPECT_LT(daemon_->countLines("lumo error"), 600u);
  EXPECT_GT(daemon_->countLines("were not logged"), 0u);
  EXPECT_EQ(daemon_->countLines("Broken pipe"), 0u);
}

// Tens of thousands of connections opened, greeted and closed leave the heap's middle free; the
// daemon gives those pages back once the churn is over.
TEST_F(TortureTest, AChurnOfConnectionsLeavesNoMemoryBehind) {
  startDaemon();
  auto run = runCommand(torture({"--seconds", "6", "--only", "churn"}), 120s);
  std::cout << "[figures]\n" << run.out;
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();
  long baseline = -1;
  long after = -1;
  const std::size_t at = run.out.find(R"({"settled":{"rssKb":[)");
  ASSERT_NE(at, std::string::npos) << run.out;
  std::sscanf(run.out.c_str() + at, R"({"settled":{"rssKb":[%ld,%ld])", &baseline, &after);
  if (kMemoryMeasurable) {
    EXPECT_LE(after, baseline + 8 * 1024) << "kB resident after the churn";
  }
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
