// A user-started install end to end: larder-store, larderd on a private
// bus, the quit dialog answered by `larderctl agent`, and a sample
// application that runs as a real process while it is updated.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <mutex>
#include <nlohmann/json.hpp>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "running-apps/RunningApplication.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

constexpr std::uint64_t kNotesID = 7201;
// One identifier per test: the tests run side by side in processes of
// their own, and running applications are found machine-wide by identifier.
std::string notesBundleID() {
  return std::string("com.example.e2e.install.") +
         ::testing::UnitTest::GetInstance()->current_test_info()->name();
}

class InstallCommandTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {
    StoreAndServiceTest::SetUp();
    notes_ = platform_.installBundle({.folder = applications(),
                                      .name = "Notes",
                                      .bundleIdentifier = notesBundleID(),
                                      .version = "1.0",
                                      .itemIdentifier = kNotesID});
    TemporaryPlatform::makeRunnable(notes_);
    catalogue_.addAccount(
        {.accountID = 1, .orvaneID = "ada@example.org", .password = "pw", .opaqueID = "account-1"});
    // The 2.0 package holds a program that runs where it will be
    // installed, so that the relaunch can be seen.
    const std::string packed = platform_.directory() + "/packed";
    std::filesystem::create_directories(packed);
    const std::string notes2 = platform_.installBundle({.folder = packed,
                                                        .name = "Notes",
                                                        .bundleIdentifier = notesBundleID(),
                                                        .version = "2.0",
                                                        .itemIdentifier = kNotesID});
    TemporaryPlatform::makeRunnable(notes2, notes_);
    catalogue_.addItem({.wareID = kNotesID,
                        .bundleID = notesBundleID(),
                        .title = "Notes",
                        .version = "2.0",
                        .bundlePath = notes2,
                        .actionParams = "itemId=" + std::to_string(kNotesID)});
  }
  void TearDown() override {
    for (const auto& app :
         RunningApplication::runningApplicationsWithBundleIdentifier(notesBundleID())) {
      ::kill(app->pid(), SIGKILL);
    }
  }

  // Signed in, the update known to the service, Notes running and an agent
  // that answers every dialog with `answer`.
  void prepare(const std::string& answer) {
    start();
    ASSERT_EQ(run({"signin", "ada@example.org", "--password", "pw"}).status, 0);
    const LarderctlRun checked = run({"updates", "--check"});
    ASSERT_EQ(checked.status, 0) << checked.errors << service_->log();
    Result<pid_t> pid = RunningApplication::launchBundle(notes_);
    ASSERT_TRUE(pid);
    pid_ = *pid;
    ASSERT_TRUE(eventually([&] { return RunningApplication::withPid(pid_) != nullptr; }));
    agent_ = std::make_unique<Larderctl>(
        platform_, bus_, std::vector<std::string>{"agent", "--answer", answer}, "agent");
    ASSERT_TRUE(agent_->waitForError("registered")) << agent_->errors() << service_->log();
  }

  std::size_t listedUpdates() {
    const LarderctlRun listed = run({"--json", "updates"});
    return nlohmann::json::parse(listed.output)["updates"].size();
  }

  std::string notes_;
  pid_t pid_ = -1;
  std::unique_ptr<Larderctl> agent_;
};

TEST_F(InstallCommandTest, AnAgreedQuitUpdatesTheRunningAppAndRelaunchesIt) {
  prepare("ok");
  const LarderctlRun installed = run({"install", std::to_string(kNotesID)});
  EXPECT_EQ(installed.status, 0) << installed.errors << service_->log();
  EXPECT_NE(installed.output.find("updated Notes to 2.0"), std::string::npos) << installed.output;
  // The agent prints its answer after sending it.
  EXPECT_TRUE(eventually([&] { return agent_->output().find("answered 1") != std::string::npos; }))
      << agent_->output();
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes_), "2.0") << service_->log();
  EXPECT_TRUE(eventually([&] { return RunningApplication::withPid(pid_) == nullptr; }));
  EXPECT_TRUE(eventually([&] {
    return !RunningApplication::runningApplicationsWithBundleIdentifier(notesBundleID()).empty();
  })) << "not relaunched\n"
      << service_->log();
  EXPECT_EQ(listedUpdates(), 0U);
}

// A client of its own, with its own delegate on the bus: a cancelled quit
// leaves the app, its version and the queue as they were, and the delegate
// hears the cancellation.
TEST_F(InstallCommandTest, ACancelledQuitChangesNothingAndTheDelegateHearsIt) {
  prepare("cancel");
  auto shopper = client();
  std::mutex mutex;
  std::vector<PlistArray> heard;
  shopper->exportCallbackObject("/test/delegate", "VendUpdateDelegate",
                                "AppUpdateFinishedPurchaseWithSuccessErrorResponse",
                                "a{sv}ba{sv}a{sv}", [&](const PlistArray& arguments) {
                                  std::lock_guard lock(mutex);
                                  heard.push_back(arguments);
                                });
  const PlistValue available = shopper->call("AvailableUpdates", {}).at(0);
  ASSERT_EQ(available.array()->size(), 1U);
  shopper->call("StartAppUpdatesAndOSUpdatesWithDelegate",
                {PlistArray{available.array()->front()}, PlistArray{}, "/test/delegate"},
                120'000'000ULL);
  ASSERT_TRUE(eventually([&] {
    std::lock_guard lock(mutex);
    return !heard.empty();
  })) << service_->log();
  {
    std::lock_guard lock(mutex);
    ASSERT_EQ(heard.size(), 1U);
    EXPECT_EQ(heard[0].at(0)["itemIdentifier"].uint64Value(), kNotesID);
    EXPECT_FALSE(heard[0].at(1).boolValue());
    EXPECT_EQ(heard[0].at(2)["code"].int64Value(), -128) << service_->log();
  }
  EXPECT_TRUE(eventually([&] { return agent_->output().find("answered 0") != std::string::npos; }))
      << agent_->output();
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes_), "1.0");
  EXPECT_NE(RunningApplication::withPid(pid_), nullptr) << "the app was quit";
  EXPECT_EQ(listedUpdates(), 1U);
}

// A cancel names product keys; one without a running install is passed
// over, and the command still succeeds.
TEST_F(InstallCommandTest, ACancelOfAKeyWithoutInstallIsLoggedAndPassedOver) {
  start();
  const LarderctlRun cancelled = run({"cancel", "NOT-RUNNING"});
  EXPECT_EQ(cancelled.status, 0) << cancelled.errors;
  EXPECT_TRUE(service_->waitForLog("No cancelToken for update NOT-RUNNING")) << service_->log();
  const LarderctlRun nothing = run({"install", "--critical"});
  EXPECT_EQ(nothing.status, 3) << nothing.errors;
  const LarderctlRun unknown = run({"install", "424242"});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_NE(unknown.errors.find("item 424242 is not an available update"), std::string::npos)
      << unknown.errors;
}

// The one OS update that carries the tags is installed; with none, the
// fallback purchase is made, and without one the command fails with the
// service's code 27.
TEST_F(InstallCommandTest, ATagInstallStartsTheOneTaggedOSUpdateElseThePurchaseOrFails) {
  const std::string framework = platform_.root() + "/var/lib/larder-platform";
  std::filesystem::create_directories(framework);
  ASSERT_TRUE(FileIO::writeAtomically(
      framework + "/system-updates.plist",
      PropertyListSerialization::writeXml(
          PlistDictionary{{"catalog", PlistArray{PlistDictionary{{"productKey", "MAPS-1"},
                                                                 {"title", "Maps Data"},
                                                                 {"tags", PlistArray{"maps"}},
                                                                 {"installSeconds", 0.1}}}}})));
  start();
  const LarderctlRun tagged = run({"install", "--tags", "maps"});
  EXPECT_EQ(tagged.status, 0) << tagged.errors << service_->log();
  EXPECT_NE(tagged.output.find("installing MAPS-1"), std::string::npos) << tagged.output;
  EXPECT_TRUE(eventually([&] {
    const auto state =
        PropertyListSerialization::read(*FileIO::read(framework + "/system-updates.plist"));
    return state && !(*state)["installed"]["MAPS-1"].isNull();
  })) << service_->log();

  const LarderctlRun untagged = run({"install", "--tags", "nowhere"});
  EXPECT_EQ(untagged.status, 1);
  EXPECT_NE(untagged.errors.find("(code 27)"), std::string::npos) << untagged.errors;

  // With a fallback the item is purchased instead, and its download installed.
  ASSERT_EQ(run({"signin", "ada@example.org", "--password", "pw"}).status, 0);
  const LarderctlRun purchased =
      run({"install", "--tags", "nowhere", "--fallback-item", std::to_string(kNotesID)});
  EXPECT_EQ(purchased.status, 0) << purchased.errors << service_->log();
  EXPECT_NE(purchased.output.find("installing " + std::to_string(kNotesID)), std::string::npos)
      << purchased.output;
  EXPECT_TRUE(eventually([&] { return TemporaryPlatform::bundleVersion(notes_) == "2.0"; }))
      << service_->log();
}

// --all picks every available app and OS update; with the app not running
// no dialog is needed, and a line tells of each.
TEST_F(InstallCommandTest, AllInstallsEveryAvailableAppAndOSUpdate) {
  const std::string framework = platform_.root() + "/var/lib/larder-platform";
  std::filesystem::create_directories(framework);
  ASSERT_TRUE(FileIO::writeAtomically(
      framework + "/system-updates.plist",
      PropertyListSerialization::writeXml(PlistDictionary{
          {"catalog",
           PlistArray{PlistDictionary{
               {"productKey", "SEC-2"}, {"title", "Security"}, {"installSeconds", 0.1}}}},
          {"available", PlistArray{"SEC-2"}}})));
  start();
  ASSERT_EQ(run({"signin", "ada@example.org", "--password", "pw"}).status, 0);
  ASSERT_EQ(run({"updates", "--check"}).status, 0);
  const LarderctlRun all = run({"install", "--all"});
  EXPECT_EQ(all.status, 0) << all.errors << service_->log();
  EXPECT_NE(all.output.find("updated Notes to 2.0"), std::string::npos) << all.output;
  EXPECT_NE(all.output.find("installed OS update SEC-2 (Security)"), std::string::npos)
      << all.output;
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes_), "2.0");
  EXPECT_EQ(run({"install", "--all"}).status, 3) << "nothing is left to install";
}

}  // namespace
}  // namespace larder::testing
