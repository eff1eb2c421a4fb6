// The real daemon against hostile local clients: crowds, pipelines, oversized frames, borrowed
// identities, hoarded descriptors and memory. Each attack runs as its own process; the daemon
// must refuse it, stay bounded, and keep answering everyone else. Figures go to stdout.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <iostream>
#include <sstream>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using Clock = std::chrono::steady_clock;

const std::string kHostile = std::string(TYPHORA_BINARY_DIR) + "/tests/hostile_peer";

// A figure of /proc/PID/status, in kB (VmRSS, VmHWM).
long statusKb(pid_t pid, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(field + ":", 0) == 0) return std::stol(line.substr(field.size() + 1));
  }
  return -1;
}

long descriptorCount(pid_t pid) {
  long n = 0;
  for ([[maybe_unused]] auto& entry :
       fs::directory_iterator("/proc/" + std::to_string(pid) + "/fd")) {
    ++n;
  }
  return n;
}

// The daemon's descriptor count once it is at most `bound`, or the last count after 30 s: closing
// hundreds of connections takes a while on a loaded machine.
long descriptorsSettledTo(pid_t pid, long bound) {
  long count = descriptorCount(pid);
  for (int i = 0; i < 1200 && count > bound; ++i) {
    std::this_thread::sleep_for(25ms);
    count = descriptorCount(pid);
  }
  return count;
}

// The daemon's resident kB once it has given back what a burst left free (within 20 s).
long rssSettledTo(pid_t pid, long boundKb) {
  long rss = statusKb(pid, "VmRSS");
  for (int i = 0; i < 200 && rss > boundKb; ++i) {
    std::this_thread::sleep_for(100ms);
    rss = statusKb(pid, "VmRSS");
  }
  return rss;
}

class HostilePeerTest : public DaemonTestBase {
 protected:
  std::string socket() const { return (runtime_ / kService).string(); }

  std::vector<std::string> hostile(const std::string& mode, int n = 0) const {
    return {kHostile, mode, socket(), std::to_string(n)};
  }

  // A fresh client's call: answered, and how long it took (ms).
  double freshCall() {
    const auto start = Clock::now();
    auto r = ctl({"call", "updatingUserFonts:"});
    EXPECT_EQ(r.status, 0) << r.all;
    return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
  }

  // A copy of typhoractl signed as an application allowed to enumerate fonts, which other users
  // may run too.
  std::string installEnumeratingApp() {
    const std::string program =
        installApp("reader", "com.example.reader",
                   R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})", false);
    for (const fs::path& p : {dir_, dir_ / "apps", runtime_}) chmod(p.c_str(), 0755);
    return program;
  }
};

TEST_F(HostilePeerTest, AThousandSimultaneousCheckinsAreAllAnsweredAndAFreshClientMeanwhile) {
  const std::string app = installEnumeratingApp();
  startDaemon();
  // Four processes at once. As root, each runs as its own user with 250 connections (a user may
  // hold 256): a thousand check-ins in flight together. Otherwise 60 connections of 4 calls each.
  const bool root = geteuid() == 0;
  std::vector<std::unique_ptr<ChildProcess>> loads;
  const auto start = Clock::now();
  for (int i = 0; i < 4; ++i) {
    std::vector<std::string> argv;
    if (root) {
      const std::string id = std::to_string(61000 + i);
      argv = {"/usr/bin/setpriv", "--reuid=" + id, "--regid=" + id, "--clear-groups"};
    }
    for (const std::string& a :
         {app, std::string("--runtime-dir"), runtime_.string(), std::string("load"),
          std::string("--connections"), std::string(root ? "250" : "60"), std::string("--calls"),
          std::string(root ? "1" : "4"), std::string("checkin:")}) {
      argv.push_back(a);
    }
    loads.push_back(std::make_unique<ChildProcess>(argv));
  }
  double worstFresh = 0;
  for (int i = 0; i < 5; ++i) worstFresh = std::max(worstFresh, freshCall());
  for (auto& load : loads) {
    ASSERT_EQ(load->waitFor(120s), 0) << load->output() << daemon_->output();
    load->finishOutput();
    EXPECT_THAT(load->standardOutput(), HasSubstr(R"("errors":0)"));
  }
  const double all = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
  std::cout << "[figures] 1000 check-ins answered in " << all << " ms; worst fresh client "
            << worstFresh << " ms; per process: " << loads[0]->standardOutput();
  freshCall();
}

TEST_F(HostilePeerTest, APipeliningClientDoesNotStarveOthersAndItsCallsDieWithIt) {
  startDaemon();
  ChildProcess pipeline(hostile("pipeline", 15));
  std::this_thread::sleep_for(300ms);
  double worst = 0;
  for (int i = 0; i < 10; ++i) worst = std::max(worst, freshCall());
  // Every fresh call was answered while the pipeline still wrote.
  EXPECT_EQ(pipeline.waitFor(0ms), -1) << "fresh calls waited for the pipeline to end";
  ASSERT_EQ(pipeline.waitFor(60s), 0) << pipeline.output();
  std::cout << "[figures] fresh client worst " << worst << " ms while pipelining; "
            << pipeline.standardOutput();
  // Calls still queued when the pipeliner went away are dropped, not run and failed one by one.
  std::this_thread::sleep_for(500ms);
  EXPECT_LT(daemon_->countLines("the connection is not open"), 5u);
}

TEST_F(HostilePeerTest, OversizedFramesAreRefusedWithoutDecodingThem) {
  startDaemon();
  freshCall();
  const long before = statusKb(daemon_->pid(), "VmHWM");
  auto big = runCommand(hostile("big-frame"), 60s);
  EXPECT_EQ(big.out, "closed\n") << big.all;
  EXPECT_TRUE(daemon_->waitForLine("frame larger than the size limit", 30s));
  const long after = statusKb(daemon_->pid(), "VmHWM");
  if (kMemoryMeasurable) {
    EXPECT_LT(after - before, 16 * 1024) << "kB of peak for one refused frame";
  }
  std::cout << "[figures] peak RSS " << before << " kB before a 4 MB frame, " << after
            << " kB after\n";
  freshCall();
}

TEST_F(HostilePeerTest, NoFrameCountsUnlessThePinnedPeerWroteItAfterTheHello) {
  installEnumeratingApp();
  startDaemon();
  // Written before the hello: what the daemon read of the writer says nothing about it.
  auto early = runCommand(hostile("before-hello"), 30s);
  EXPECT_EQ(early.out, "refused\n") << early.all;
  // Written before the daemon even accepted, it carries no credentials at all.
  for (int i = 0;
       i < 500 && daemon_->countLines("a frame written before the hello") +
                          daemon_->countLines("a read without its writer's credentials") ==
                      0;
       ++i) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(daemon_->countLines("a frame written before the hello") +
                daemon_->countLines("a read without its writer's credentials"),
            1u)
      << daemon_->output();
  // A forked child speaking on its parent's connection.
  auto forked = runCommand(hostile("fork-writer"), 30s);
  EXPECT_EQ(forked.out, "refused\n") << forked.all;
  EXPECT_TRUE(daemon_->waitForLine("not by the peer", 30s)) << daemon_->output();
  freshCall();
}

TEST_F(HostilePeerTest, DescriptorsAndMemoryStayBoundedAndComeBackAfterTheAttack) {
  startDaemon();
  // The count to come back to is the started daemon's: its event socket opens after the service
  // socket, and a count taken in between reads low.
  ASSERT_TRUE(daemon_->waitForLine("typhorad ready", 30s)) << daemon_->output();
  freshCall();
  const pid_t pid = daemon_->pid();
  const long fdsBefore = descriptorCount(pid);
  const long rssBefore = statusKb(pid, "VmRSS");

  auto fds = runCommand(hostile("hold-fds"), 30s);
  EXPECT_THAT(fds.out, HasSubstr("closed")) << fds.all;

  // Forty connections each holding an unfinished frame just under the size limit.
  ChildProcess partial(hostile("partial", 40));
  ASSERT_TRUE(partial.waitForLine("holding", 30s)) << partial.output();
  freshCall();
  const long rssPartial = statusKb(pid, "VmRSS");
  if (kMemoryMeasurable) {
    EXPECT_LT(rssPartial - rssBefore, 80 * 1024);
  }

  // More connections than one user may hold, and connections that never say hello.
  ChildProcess crowd(hostile("connections", 300));
  ASSERT_TRUE(crowd.waitForLine("opened", 60s)) << crowd.output();
  EXPECT_TRUE(daemon_->waitForLine("holds too many connections", 30s));
  const long fdsPeak = descriptorCount(pid);
  crowd.kill(SIGKILL);
  crowd.wait();
  // The crowd's connections must be gone before the silent ones come, or the user's cap refuses
  // them before they could owe a hello.
  descriptorsSettledTo(pid, fdsBefore + 50);
  ChildProcess silent(hostile("silent", 150));
  ASSERT_TRUE(silent.waitForLine("opened", 60s)) << silent.output();
  EXPECT_TRUE(daemon_->waitForLine("too many connections without a hello", 30s));
  freshCall();
  const long rssPeak = std::max(rssPartial, statusKb(pid, "VmRSS"));
  partial.kill(SIGKILL);
  silent.kill(SIGKILL);
  partial.wait();
  silent.wait();

  const long fdsAfter = descriptorsSettledTo(pid, fdsBefore + 2);
  EXPECT_LE(fdsAfter, fdsBefore + 2);
  freshCall();
  const long rssAfter = rssSettledTo(pid, rssBefore + 8 * 1024);
  if (kMemoryMeasurable) {
    EXPECT_LE(rssAfter, rssBefore + 8 * 1024) << "kB resident after the attack";
  }
  std::cout << "[figures] descriptors " << fdsBefore << " -> peak " << fdsPeak << " -> " << fdsAfter
            << "; RSS " << rssBefore << " kB -> peak " << rssPeak << " kB -> " << rssAfter
            << " kB\n";
}

TEST_F(HostilePeerTest, OutOfDescriptorsTheAcceptLoopBacksOffAndRecovers) {
  std::vector<std::string> argv = {"/usr/bin/prlimit", "--nofile=96:96"};
  for (const std::string& a : daemonArgs()) argv.push_back(a);
  daemon_ = std::make_unique<ChildProcess>(argv);
  waitForSocket();
  freshCall();
  ChildProcess crowd(hostile("connections", 120));
  ASSERT_TRUE(crowd.waitForLine("opened", 60s)) << crowd.output();
  std::this_thread::sleep_for(1s);
  EXPECT_TRUE(daemon_->waitForLine("backing off", 30s)) << daemon_->output();
  EXPECT_LT(daemon_->countLines("Too many open files"), 5u);
  crowd.kill(SIGKILL);
  crowd.wait();
  // Recovered once the crowd's connections are closed: before that, a new one may still meet a
  // full descriptor table.
  descriptorsSettledTo(daemon_->pid(), 48);
  freshCall();
}

}  // namespace
}  // namespace typhora::testing
