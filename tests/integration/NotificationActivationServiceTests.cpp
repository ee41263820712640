// What the user does with the service's notification, across a restart of
// the service: larderd posts an updates available notification on a real
// notification server of the desktop (dunst on a virtual X display, both on
// the test's private bus), is stopped and started again, and the main button
// still starts the install it offers.
#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <optional>

#include <sdbus-c++/sdbus-c++.h>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

constexpr const char* kXvfb = "/usr/bin/Xvfb";
constexpr const char* kDunst = "/usr/bin/dunst";
constexpr const char* kServerInterface = "org.freedesktop.Notifications";
// dunst's own control interface, the one dunstctl uses.
constexpr const char* kDunstInterface = "org.dunstproject.cmd0";

// The run a notification's install starts, as the service logs it.
constexpr const char* kUserStartedRun =
    "Enqueuing UpdateOperation <UpdateOperation: client=com.orvane.quaymart flags=[userInitiated";

class NotificationActivationServiceTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {
    StoreAndServiceTest::SetUp();
    if (access(kXvfb, X_OK) != 0) GTEST_SKIP() << kXvfb << " is not installed (package xvfb)";
    if (access(kDunst, X_OK) != 0) GTEST_SKIP() << kDunst << " is not installed (package dunst)";
    // One OS update the user may not put off (it is not recommended): the
    // notification's main button is its install button.
    const std::string framework = platform_.root() + "/var/lib/larder-platform";
    fs::create_directories(framework);
    ASSERT_TRUE(FileIO::writeAtomically(
        framework + "/system-updates.plist",
        PropertyListSerialization::writeXml(
            PlistDictionary{{"catalog", PlistArray{PlistDictionary{{"productKey", "OPT-1"},
                                                                   {"title", "Optional Update"},
                                                                   {"isRecommended", false},
                                                                   {"installSeconds", 0.3}}}}})));

    // Xvfb picks a free display itself and writes its number to fd 3.
    const std::string displayFile = platform_.directory() + "/display";
    xvfb_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{"/bin/sh", "-c",
                                 std::string("exec ") + kXvfb +
                                     " -displayfd 3 -nolisten tcp -screen 0 800x600x24 3>" +
                                     displayFile},
        std::map<std::string, std::string>{}, "/dev/null", platform_.directory() + "/xvfb.log");
    std::string display;
    eventually(
        [&] {
          std::ifstream(displayFile) >> display;
          return !display.empty() || !xvfb_->isRunning();
        },
        std::chrono::seconds(10));
    if (display.empty())
      GTEST_SKIP() << "Xvfb did not start: " << readFile(platform_.directory() + "/xvfb.log");

    // The middle button and dunstctl's action invoke the main button of
    // the service's notifications, not the click on the contents.
    const std::string config = platform_.directory() + "/dunstrc";
    std::ofstream(config) << "[global]\n    font = Monospace 8\n"
                             "[larder]\n    appname = larder\n    action_name = action\n";
    dunst_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{kDunst, "-config", config},
        std::map<std::string, std::string>{{"DISPLAY", ":" + display},
                                           {"DBUS_SESSION_BUS_ADDRESS", bus_.address()}},
        "/dev/null", platform_.directory() + "/dunst.log");
    connection_ = bus_.connect();
    proxy_ = sdbus::createProxy(*connection_, kServerInterface, "/org/freedesktop/Notifications");
    std::optional<std::string> name;
    eventually([&] { return (name = serverName()).has_value() || !dunst_->isRunning(); },
               std::chrono::seconds(10));
    if (!name) GTEST_SKIP() << "dunst did not come on the bus: " << dunstLog();
    ASSERT_EQ(*name, "dunst");
    if (!displayedCount()) GTEST_SKIP() << "this dunst has no control interface";
  }
  void TearDown() override {
    // The service leaves the bus before the server, the server before X.
    service_.reset();
    proxy_.reset();
    connection_.reset();
    dunst_.reset();
    xvfb_.reset();
  }

  std::optional<std::string> serverName() {
    try {
      std::string name, vendor, version, protocol;
      proxy_->callMethod("GetServerInformation")
          .onInterface(kServerInterface)
          .withTimeout(std::chrono::seconds(2))
          .storeResultsTo(name, vendor, version, protocol);
      return name;
    } catch (const sdbus::Error&) {
      return std::nullopt;
    }
  }
  std::optional<std::uint32_t> displayedCount() {
    try {
      return proxy_->getProperty("displayedLength")
          .onInterface(kDunstInterface)
          .get<std::uint32_t>();
    } catch (const sdbus::Error&) {
      return std::nullopt;
    }
  }
  // As the user's middle click on the first notification on screen.
  void invokeFirstNotification() {
    proxy_->callMethod("NotificationAction").onInterface(kDunstInterface).withArguments(0u);
  }
  [[nodiscard]] std::string dunstLog() const {
    return readFile(platform_.directory() + "/dunst.log");
  }

  nlohmann::json delivered() {
    return nlohmann::json::parse(run({"--json", "notifications"}).output);
  }
  // Whether the service's list still holds it; the run may post others
  // (the automatic update offer) meanwhile.
  bool isListed(const std::string& identifier) {
    for (const nlohmann::json& notification : delivered()) {
      if (notification["identifier"] == identifier) return true;
    }
    return false;
  }

  std::unique_ptr<ChildProcess> xvfb_;
  std::unique_ptr<ChildProcess> dunst_;
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IProxy> proxy_;
};

// dunst tells of a used action only the connection that posted the
// notification, which ends with the first service: after the restart the
// main button is used through `larderctl notifications --activate`, which
// takes the path of the server's report. Before the restart the server's
// own invocation is shown to reach the service.
TEST_F(NotificationActivationServiceTest, TheMainButtonInstallsAfterARestartOfTheService) {
  start();
  run({"prefs", "delete", "com.orvane.larderd", "DidPostUpdatesAvailableNotificationDate"});
  backgroundRun();
  nlohmann::json list;
  ASSERT_TRUE(eventually([&] {
    list = delivered();
    return list.size() == 1 && list[0]["displayed"] == true;
  })) << service_->log()
      << dunstLog();
  EXPECT_EQ(list[0]["userInfo"]["Source"], "AppUpdate");
  EXPECT_EQ(list[0]["actionButtonTitle"], "Install");
  EXPECT_TRUE(list[0]["alternateActionButtonTitles"].empty()) << list.dump();
  EXPECT_TRUE(eventually([&] { return displayedCount() == 1u; })) << dunstLog();
  const std::string identifier = list[0]["identifier"];
  EXPECT_TRUE(service_->logLines(kUserStartedRun).empty());

  ASSERT_EQ(service_->stop(), 0);
  startService(store_->bagURL());
  // The list came back with the service; the server still shows it.
  list = delivered();
  ASSERT_EQ(list.size(), 1u) << list.dump();
  EXPECT_EQ(list[0]["identifier"], identifier);
  EXPECT_EQ(displayedCount(), 1u);

  const LarderctlRun activated =
      run({"notifications", "--activate", identifier, "--action", "action"});
  ASSERT_EQ(activated.status, 0) << activated.errors;
  ASSERT_TRUE(service_->waitForLog(kUserStartedRun, std::chrono::seconds(20))) << service_->log();
  EXPECT_EQ(service_->logLines(kUserStartedRun).size(), 1u) << service_->log();
  EXPECT_EQ(
      service_->logLines("Got didActivateNotification for notification: " + identifier).size(), 1u);
  // The delegate took it away: from the list and from the server's screen.
  EXPECT_TRUE(eventually([&] { return !isListed(identifier); })) << service_->log();
  // The server shows what the service's list has on screen, no more: the
  // removal closed it there (the install may have posted the automatic
  // update offer meanwhile).
  EXPECT_TRUE(eventually([&] {
    const nlohmann::json list = delivered();
    const auto shown = std::ranges::count_if(
        list, [](const nlohmann::json& notification) { return notification["displayed"] == true; });
    return displayedCount() == static_cast<std::uint32_t>(shown);
  })) << dunstLog();
}

// Every action key that larderctl takes reaches the delegate as its call.
TEST_F(NotificationActivationServiceTest, EveryActionKeyReachesTheDelegate) {
  // An update that may wait: the notification offers the later menu.
  ASSERT_TRUE(FileIO::writeAtomically(
      platform_.root() + "/var/lib/larder-platform/system-updates.plist",
      PropertyListSerialization::writeXml(
          PlistDictionary{{"catalog", PlistArray{PlistDictionary{{"productKey", "REC-1"},
                                                                 {"title", "Recommended Update"},
                                                                 {"isRecommended", true},
                                                                 {"installSeconds", 0.3}}}}})));
  start();
  run({"prefs", "delete", "com.orvane.larderd", "DidPostUpdatesAvailableNotificationDate"});
  backgroundRun();
  const nlohmann::json list = delivered();
  ASSERT_EQ(list.size(), 1u) << service_->log();
  ASSERT_GE(list[0]["alternateActionButtonTitles"].size(), 2u) << list.dump();
  const std::string identifier = list[0]["identifier"];
  const std::string activatedLine = "Got didActivateNotification for notification: " + identifier;

  struct Step {
    const char* key;
    std::string logged;
  } const steps[] = {
      {"default", activatedLine},
      {"snooze", "Got didSnoozeAlert for notification: " + identifier},
      {"alternate-1", "Got didActivateNotification for notification: " + identifier},
  };
  for (const Step& step : steps) {
    SCOPED_TRACE(step.key);
    const std::size_t before = service_->logLines(step.logged).size();
    const LarderctlRun activated =
        run({"notifications", "--activate", identifier, "--action", step.key});
    ASSERT_EQ(activated.status, 0) << activated.errors;
    EXPECT_TRUE(eventually([&] { return service_->logLines(step.logged).size() > before; }))
        << service_->log();
  }
  EXPECT_EQ(service_->logLines(activatedLine).size(), 2u) << service_->log();
  // The line ends after the user info, on a line of its own.
  EXPECT_EQ(service_->logLines("} and activation type 1").size(), 1u) << service_->log();
  EXPECT_EQ(service_->logLines("} and activation type 2").size(), 1u) << service_->log();
  // Entry 1 of the later menu is tonight: nothing installs now, and the
  // alert has left the list.
  EXPECT_TRUE(service_->logLines(kUserStartedRun).empty()) << service_->log();
  EXPECT_FALSE(isListed(identifier));
}

// Before any restart, the server's own invocation of the main button
// reaches the service and starts the install.
TEST_F(NotificationActivationServiceTest, TheServersMainButtonInstalls) {
  start();
  run({"prefs", "delete", "com.orvane.larderd", "DidPostUpdatesAvailableNotificationDate"});
  backgroundRun();
  ASSERT_TRUE(eventually([&] { return displayedCount() == 1u; })) << service_->log() << dunstLog();
  const std::string identifier = delivered().at(0)["identifier"];
  invokeFirstNotification();
  ASSERT_TRUE(service_->waitForLog(kUserStartedRun, std::chrono::seconds(20)))
      << service_->log() << dunstLog();
  EXPECT_TRUE(eventually([&] { return !isListed(identifier); })) << service_->log();
}

}  // namespace
}  // namespace larder::testing
