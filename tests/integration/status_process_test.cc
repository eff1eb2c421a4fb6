// The daemon's status and grants, asked on the event socket by typhoractl while real clients are
// connected.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <regex>
#include <sstream>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class StatusProcessTest : public DaemonTestBase {};

TEST_F(StatusProcessTest, StatusAndGrantsShowCheckedInClientsAndWhatTheyWereIssued) {
  const std::string browser =
      installApp("browser", "com.example.browser",
                 R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
  startDaemon();
  ChildProcess client({browser, "--runtime-dir", runtime_, "client", "--watch"});
  ASSERT_TRUE(client.waitForLine(R"("event":"checkin")", 20s)) << client.output();

  auto status = ctl({"status"});
  ASSERT_EQ(status.status, 0) << status.all << daemon_->output();
  EXPECT_THAT(status.out, HasSubstr(R"("identifier":"com.example.browser")"));
  EXPECT_THAT(status.out, HasSubstr(R"("pid":)" + std::to_string(client.pid())));
  EXPECT_THAT(status.out, HasSubstr(R"("checkedInClients":1)"));
  EXPECT_THAT(status.out, HasSubstr(R"("enumeration":true)"));
  EXPECT_THAT(status.out, HasSubstr(R"("label":"com.zorvane.typhorad"})"));

  auto table = ctl({"status", "--table"});
  ASSERT_EQ(table.status, 0) << table.all;
  EXPECT_THAT(table.out, HasSubstr("com.example.browser"));
  EXPECT_THAT(table.out, HasSubstr("enumeration"));

  // Every line of the metrics text is a comment or `name{labels} value`.
  auto metrics = ctl({"status", "--metrics"});
  ASSERT_EQ(metrics.status, 0) << metrics.all;
  EXPECT_THAT(metrics.out, HasSubstr("typhora_checked_in_clients 1\n"));
  EXPECT_THAT(metrics.out, HasSubstr("# TYPE typhora_queue_depth gauge\n"));
  const std::regex line(R"((# (HELP|TYPE) [a-z_]+ .+)|([a-z_]+(\{[a-z]+="[^"]*"\})? -?[0-9.e+]+))");
  std::istringstream lines(metrics.out);
  for (std::string text; std::getline(lines, text);)
    EXPECT_TRUE(std::regex_match(text, line)) << text;

  // A font request issues the family's file to the application; the ledger shows it expanded.
  const std::string reader = installApp("reader", "com.example.reader",
                                        R"({"com.zorvane.developer.user-fonts": ["app-usage"]})");
  auto requested =
      runCommand({reader, "--runtime-dir", runtime_, "request-fonts", "--family", "A"}, 20s);
  ASSERT_EQ(requested.status, 0) << requested.all;
  auto grants = ctl({"grants"});
  ASSERT_EQ(grants.status, 0) << grants.all;
  EXPECT_THAT(grants.out,
              HasSubstr(R"({"com.example.reader":["/var/mobile/Library/UserFonts/FontFiles/)"
                        R"(com.example.shop/A.otf"]})"));
  auto one = ctl({"grants", "com.example.reader", "--table"});
  EXPECT_THAT(one.out, HasSubstr("com.example.reader"));
  EXPECT_THAT(one.out, HasSubstr("com.example.shop/A.otf"));
  auto other = ctl({"grants", "com.example.other", "--table"});
  ASSERT_EQ(other.status, 0) << other.all;
  EXPECT_THAT(other.out, Not(HasSubstr("A.otf")));

  // A connection that ended is no longer listed.
  client.kill(SIGTERM);
  client.wait();
  bool gone = false;
  for (int i = 0; i < 200 && !gone; ++i) {
    gone = ctl({"status"}).out.find("com.example.browser") == std::string::npos;
    if (!gone) std::this_thread::sleep_for(25ms);
  }
  EXPECT_TRUE(gone);
}

// The event socket is private to root and the daemon's user: nobody else can ask.
TEST_F(StatusProcessTest, OtherUsersCannotAsk) {
  startDaemon();
  fs::permissions(dir_, fs::perms::others_exec, fs::perm_options::add);
  fs::permissions(runtime_, fs::perms::others_exec | fs::perms::others_read, fs::perm_options::add);
  auto refused = runCommand({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                             kCtl, "--runtime-dir", runtime_, "status"},
                            20s);
  EXPECT_NE(refused.status, 0) << refused.all;
  EXPECT_THAT(refused.out, Not(HasSubstr("uptimeSeconds")));
}

}  // namespace
}  // namespace typhora::testing
