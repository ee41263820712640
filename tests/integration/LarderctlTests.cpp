// larderctl as a person at a terminal meets it: no service, a service
// whose store is away or broken, bad command lines. Each case checks the
// exit status and the first line of what was said.
#include <gtest/gtest.h>

#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

using namespace std::chrono_literals;

std::string firstLine(const std::string& text) {
  return text.substr(0, text.find('\n'));
}

using LarderctlTest = StoreAndServiceTest;

TEST_F(LarderctlTest, BadCommandLinesAreUsageErrorsThatNameWhatIsWrong) {
  struct Row {
    std::vector<std::string> arguments;
    std::string firstLine;
  };
  const std::string kTimeout = "larderctl: --timeout: seconds to wait are a number above 0";
  const std::vector<Row> rows{
      {{"purchase", "-5"},
       "larderctl: item: a store item identifier is a whole number from 1 to "
       "18446744073709551615, not '-5'; see `larderctl purchase --help`"},
      {{"product", "--item-id", "0"}, "larderctl: --item-id: a store item identifier"},
      {{"--client-type", "9", "products"}, "larderctl: --client-type: Value 9 not in range 0 to 4"},
      {{"--timeout", "-1", "products"}, kTimeout},
      {{"--timeout", "0", "products"}, kTimeout},
      {{"downloads", "--mask", "4"}, "larderctl: --mask: Value 4 not in range 1 to 3"},
      {{"call", "ProductForItemIdentifier", "notanumber"},
       "larderctl: argument 1 of ProductForItemIdentifier (t) must be a whole number from 0 to "
       "18446744073709551615, not 'notanumber'"},
      {{"call", "ProductForItemIdentifier"},
       "larderctl: ProductForItemIdentifier takes 1 argument(s) of signature 't', not 0"},
      {{"call", "NoSuchRequest"}, "larderctl: larderd has no request named 'NoSuchRequest'"},
      {{"bogus"}, "larderctl: no command named 'bogus'; see `larderctl --help`"},
      {{}, "larderctl: no command given; see `larderctl --help`"},
      {{"products", "--bogus"}, "larderctl: The following argument was not expected: --bogus"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::PrintToString(row.arguments));
    const LarderctlRun ran = run(row.arguments);
    EXPECT_EQ(ran.status, 2) << ran.errors;
    EXPECT_TRUE(firstLine(ran.errors).starts_with(row.firstLine)) << ran.errors;
    EXPECT_EQ(ran.output, "");
  }
  const LarderctlRun version = run({"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_EQ(firstLine(version.output), LARDER_VERSION);
}

TEST_F(LarderctlTest, WithoutServiceOrBusTheErrorSaysWhatToLookAt) {
  for (const auto& command : std::vector<std::vector<std::string>>{
           {"products"}, {"updates"}, {"account"}, {"purchase", "901"}, {"watch"}}) {
    SCOPED_TRACE(command.front());
    const LarderctlRun ran = run(command);
    EXPECT_EQ(ran.status, 1);
    EXPECT_EQ(firstLine(ran.errors),
              "larderctl: larderd is not running: nothing owns com.orvane.larderd on the session "
              "bus. Is larderd running? `systemctl --user status larderd`");
  }
  const LarderctlRun ran = run(
      {"products"}, {{"DBUS_SESSION_BUS_ADDRESS", "unix:path=" + platform_.directory() + "/none"}});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(firstLine(ran.errors).starts_with("larderctl: cannot connect to the session bus: "))
      << ran.errors;
}

TEST_F(LarderctlTest, AStoreThatIsAwayOrFailsIsNamedAndAFailedCheckClaimsNothing) {
  for (const bool away : {true, false}) {
    SCOPED_TRACE(away ? "away" : "failing");
    if (away) {
      startService(kNoStoreURL);
    } else {
      start({"available-software-updates=500"});
    }
    const LarderctlRun ran = run({"updates", "--check"});
    EXPECT_EQ(ran.status, 1);
    EXPECT_TRUE(firstLine(ran.errors).starts_with("larderctl: the update check failed: "))
        << ran.errors;
    if (away) {
      EXPECT_NE(firstLine(ran.errors).find(std::string("(") + kNoStoreURL + ")"), std::string::npos)
          << ran.errors;
    }
    EXPECT_EQ(ran.output.find("No updates available"), std::string::npos) << ran.output;
  }
}

TEST_F(LarderctlTest, NothingToUpdateHasItsOwnExitStatus) {
  start();
  const LarderctlRun ran = run({"updates", "--check"});
  EXPECT_EQ(ran.status, 3) << ran.errors << service_->log();
  EXPECT_EQ(firstLine(ran.output), "No updates available.");
  EXPECT_EQ(run({"account"}).status, 1);
  const LarderctlRun nobodyAsJSON = run({"--json", "account"});
  EXPECT_EQ(nobodyAsJSON.status, 1);
  EXPECT_EQ(firstLine(nobodyAsJSON.output), "null");
}

TEST_F(LarderctlTest, WatchRegistersAgainWhenTheServiceRestarts) {
  startService(kNoStoreURL);
  Larderctl watch(platform_, bus_, std::vector<std::string>{"watch"}, "watch");
  ASSERT_TRUE(watch.waitForError("watching the software map")) << watch.errors();
  startService(kNoStoreURL);
  ASSERT_TRUE(watch.waitForError("larderd restarted; watching again", 20s)) << watch.errors();
  platform_.installBundle({applications(), "Birch", "com.example.birch", "1.0", 102});
  EXPECT_TRUE(eventually(
      [&] { return watch.output().find("com.example.birch") != std::string::npos; }, 20s))
      << watch.output() << watch.errors() << service_->log();
}

}  // namespace
}  // namespace larder::testing
