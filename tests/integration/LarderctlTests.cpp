// larderctl as a person at a terminal meets it: no service, a service
// whose store is away or broken, bad command lines. Each case checks the
// exit status and the first line of what was said.
#include <gtest/gtest.h>

#include <filesystem>
#include <memory>

#include "tests/integration/LarderctlProcess.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr char kShopper[] = "shopper@example.org";
constexpr char kPassword[] = "open sesame";

std::string firstLine(const std::string& text) {
  return text.substr(0, text.find('\n'));
}

// A port on loopback with nobody behind it.
std::string closedStoreURL() {
  return "http://127.0.0.1:9/bag";
}

class LarderctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    catalogue_.addAccount({.accountID = 8123, .orvaneID = kShopper, .password = kPassword});
    catalogue_.addItem(
        {.wareID = 901, .bundleID = "com.example.Atlas", .title = "Atlas", .version = "3.1"});
  }

  void startService(const std::string& storeURL, std::vector<std::string> arguments = {}) {
    service_.reset();
    service_ = std::make_unique<ServiceProcess>(
        platform_, bus_, std::move(arguments),
        std::map<std::string, std::string>{{"LARDER_STORE_URL", storeURL},
                                           {"LARDER_STORE_TIMEOUT", "5"}});
    ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
  }

  void startStoreAndService(const std::vector<std::string>& faults = {}) {
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), faults);
    startService(store_->bagURL());
  }

  LarderctlRun run(const std::vector<std::string>& arguments,
                   std::map<std::string, std::string> environment = {}) {
    auto merged = platform_.environment(bus_);
    for (auto& [name, value] : environment) merged[name] = std::move(value);
    return runLarderctl(platform_.directory() + "/larderctl-" + std::to_string(++runs_), arguments,
                        merged);
  }

  StoreCatalogueBuilder catalogue_;
  std::unique_ptr<StoreServerProcess> store_;
  TemporaryPlatform platform_;
  PrivateBus bus_;
  std::unique_ptr<ServiceProcess> service_;
  int runs_ = 0;
};

TEST_F(LarderctlTest, BadCommandLinesAreUsageErrorsThatNameWhatIsWrong) {
  struct Row {
    std::vector<std::string> arguments;
    std::string firstLine;
  };
  const std::vector<Row> rows{
      {{"purchase", "-5"},
       "larderctl: item: a store item identifier is a whole number from 1 to "
       "18446744073709551615, not '-5'; see `larderctl purchase --help`"},
      {{"product", "--item-id", "0"}, "larderctl: --item-id: a store item identifier"},
      {{"--client-type", "9", "products"}, "larderctl: --client-type: Value 9 not in range 0 to 4"},
      {{"--timeout", "-1", "products"},
       "larderctl: --timeout: seconds to wait are a number above 0"},
      {{"--timeout", "0", "products"},
       "larderctl: --timeout: seconds to wait are a number above 0"},
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
  startService(closedStoreURL());
  LarderctlRun ran = run({"updates", "--check"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(firstLine(ran.errors).starts_with("larderctl: the update check failed: "))
      << ran.errors;
  EXPECT_NE(firstLine(ran.errors).find("(" + closedStoreURL() + ")"), std::string::npos)
      << ran.errors;
  EXPECT_EQ(ran.output.find("No updates available"), std::string::npos) << ran.output;

  startStoreAndService({"available-software-updates=500"});
  ran = run({"updates", "--check"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(firstLine(ran.errors).starts_with("larderctl: the update check failed: "))
      << ran.errors;
  EXPECT_EQ(ran.output.find("No updates available"), std::string::npos) << ran.output;
}

TEST_F(LarderctlTest, NothingToUpdateHasItsOwnExitStatus) {
  startStoreAndService();
  const LarderctlRun ran = run({"updates", "--check"});
  EXPECT_EQ(ran.status, 3) << ran.errors << service_->log();
  EXPECT_EQ(firstLine(ran.output), "No updates available.");
  const LarderctlRun nobody = run({"account"});
  const LarderctlRun nobodyAsJSON = run({"--json", "account"});
  EXPECT_EQ(nobody.status, 1);
  EXPECT_EQ(nobodyAsJSON.status, 1);
  EXPECT_EQ(firstLine(nobodyAsJSON.output), "null");
}

TEST_F(LarderctlTest, ASignInThatNobodyWasAskedForSaysHowToRunAnAgent) {
  startStoreAndService();
  const LarderctlRun ran = run({"purchase", "901"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(firstLine(ran.errors)
                  .starts_with("larderctl: the purchase of item 901 failed: No one was asked to "
                               "sign in: no dialog agent "
                               "is registered with the service. Run `larderctl agent`"))
      << ran.errors;
}

// An older copy of the item stays installed when the new download fails its
// digests: success must come from the download, not from finding a bundle of
// the item on disk.
TEST_F(LarderctlTest, APurchaseWhoseDownloadFailsIsAFailureEvenWithAnOlderCopyInstalled) {
  const std::string applications = platform_.root() + "/Applications";
  const std::string installed =
      platform_.installBundle({applications, "Atlas", "com.example.Atlas", "2.0", 901});
  startStoreAndService({"assets=corrupt"});
  ASSERT_EQ(run({"signin", kShopper, "--password", kPassword}).status, 0) << service_->log();
  const LarderctlRun ran = run({"purchase", "901"});
  EXPECT_EQ(ran.status, 1) << ran.output << ran.errors;
  EXPECT_TRUE(firstLine(ran.errors)
                  .starts_with("larderctl: the download of Atlas (item 901) "
                               "failed: "))
      << ran.errors;
  EXPECT_EQ(ran.output.find("installed Atlas"), std::string::npos) << ran.output;
  EXPECT_NE(readFile(installed + "/bundle.plist").find("2.0"), std::string::npos);
}

TEST_F(LarderctlTest, WatchRegistersAgainWhenTheServiceRestarts) {
  startService(closedStoreURL());
  Larderctl watch(platform_, bus_, std::vector<std::string>{"watch"}, "watch");
  ASSERT_TRUE(watch.waitForError("watching the software map")) << watch.errors();
  startService(closedStoreURL());
  ASSERT_TRUE(watch.waitForError("larderd restarted; watching again", 20s)) << watch.errors();
  platform_.installBundle(
      {platform_.root() + "/Applications", "Birch", "com.example.birch", "1.0", 102});
  EXPECT_TRUE(eventually(
      [&] { return watch.output().find("com.example.birch") != std::string::npos; }, 20s))
      << watch.output() << watch.errors() << service_->log();
}

TEST_F(LarderctlTest, LarderdSaysWhichArgumentItIgnoresAndServesAllTheSame) {
  startService(closedStoreURL(), {"--help"});
  EXPECT_TRUE(
      service_->waitForLog("larderd " LARDER_VERSION
                           ": ignoring \"--help\" (the only argument is \"daemon\"); serving "
                           "as com.orvane.larderd."))
      << service_->log();
}

}  // namespace
}  // namespace larder::testing
