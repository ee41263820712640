// The update machinery end to end: larder-store, larderd on a private bus,
// the software update agent's report sent by `larderctl background-scan`,
// and a sample application that runs as a real process.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <nlohmann/json.hpp>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "running-apps/RunningApplication.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::uint64_t kNotesID = 7101;

class UpdateRunServiceTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {
    StoreAndServiceTest::SetUp();
    notes_ = platform_.installBundle({.folder = applications(),
                                      .name = "Notes",
                                      .bundleIdentifier = "com.example.e2e.notes",
                                      .version = "1.0",
                                      .itemIdentifier = kNotesID});
    TemporaryPlatform::makeRunnable(notes_);
    catalogue_.addAccount(
        {.accountID = 1, .orvaneID = "ada@example.org", .password = "pw", .opaqueID = "account-1"});
    catalogue_.addItem({.wareID = kNotesID,
                        .bundleID = "com.example.e2e.notes",
                        .title = "Notes",
                        .version = "2.0",
                        .actionParams = "itemId=" + std::to_string(kNotesID)});
    // An OS update that needs no restart, which the run installs too.
    const std::string framework = platform_.root() + "/var/lib/larder-platform";
    fs::create_directories(framework);
    ASSERT_TRUE(FileIO::writeAtomically(
        framework + "/system-updates.plist",
        PropertyListSerialization::writeXml(PlistDictionary{
            {"catalog",
             PlistArray{PlistDictionary{
                 {"productKey", "SEC-1"}, {"isRecommended", true}, {"installSeconds", 0.3}}}}})));
    const std::string preferences = platform_.home() + "/.config/larder";
    fs::create_directories(preferences);
    ASSERT_TRUE(FileIO::writeAtomically(
        preferences + "/com.orvane.larderd.plist",
        PropertyListSerialization::writeXml(PlistDictionary{{"AutoUpdateEnabled", true}})));
  }
  void TearDown() override {
    if (pid_ > 0) ::kill(pid_, SIGKILL);
  }

  nlohmann::json listedUpdates() {
    const LarderctlRun listed = run({"--json", "updates"});
    return nlohmann::json::parse(listed.output)["updates"];
  }

  std::string notes_;
  pid_t pid_ = -1;
};

TEST_F(UpdateRunServiceTest, AReportStagesTheUpdateOfARunningAppAndTheNextInstallsItOnceItQuit) {
  start();
  ASSERT_EQ(run({"signin", "ada@example.org", "--password", "pw"}).status, 0);
  Result<pid_t> pid = RunningApplication::launchBundle(notes_);
  ASSERT_TRUE(pid);
  pid_ = *pid;
  ASSERT_TRUE(eventually([&] { return RunningApplication::withPid(pid_) != nullptr; }));
  auto observer = client();
  std::mutex mutex;
  std::vector<double> percents;
  observer->exportCallbackObject(
      "/test/progress", "VendOSUpdateProgressObserver", "OsUpdatesChangedProgress", "aa{sv}a{sv}",
      [&](const PlistArray& arguments) {
        std::lock_guard lock(mutex);
        const PlistArray* updates = arguments.at(0).array();
        if (updates && !updates->empty() && updates->front()["productKey"] == PlistValue("SEC-1")) {
          percents.push_back(arguments.at(1)["percentComplete"].doubleValue());
        }
      });
  observer->call("AddOSUpdateProgressObserver", {"/test/progress"});

  backgroundRun();
  // The OS update went in through the framework, its progress told on the bus.
  EXPECT_TRUE(eventually([&] {
    std::lock_guard lock(mutex);
    return !percents.empty() && percents.back() == 100.0;
  })) << service_->log();
  nlohmann::json updates = listedUpdates();
  ASSERT_EQ(updates.size(), 1U) << service_->log();
  EXPECT_EQ(updates[0]["isStaged"], true);
  EXPECT_EQ(updates[0]["autoUpdateAbortCode"], 3);
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes_), "1.0");
  EXPECT_NE(RunningApplication::withPid(pid_), nullptr) << "the running app was touched";
  const LarderctlRun runs = run({"runs"});
  EXPECT_EQ(runs.status, 0) << runs.errors;
  EXPECT_NE(runs.output.find("Notes (7101)"), std::string::npos) << runs.output;
  EXPECT_NE(runs.output.find("staged, held back: the app is running (code 3)"), std::string::npos)
      << runs.output;
  // Asked by bundle identifier, the audit's item entry is found through the
  // listed update.
  const LarderctlRun why = run({"why", "com.example.e2e.notes"});
  EXPECT_EQ(why.status, 0) << why.errors;
  EXPECT_TRUE(why.output.starts_with("Notes (7101): held back: the application was running;"))
      << why.output;
  EXPECT_NE(why.output.find("(code 3)"), std::string::npos) << why.output;
  EXPECT_NE(why.output.find("it is downloaded and ready to install"), std::string::npos)
      << why.output;
  EXPECT_EQ(run({"why", "NO-SUCH-UPDATE"}).status, 3);

  ::kill(pid_, SIGKILL);
  ASSERT_TRUE(eventually([&] { return RunningApplication::withPid(pid_) == nullptr; }));
  backgroundRun();
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes_), "2.0") << service_->log();
  EXPECT_TRUE(listedUpdates().empty());
  const LarderctlRun product = run({"--json", "product", "--bundle-id", "com.example.e2e.notes"});
  EXPECT_EQ(nlohmann::json::parse(product.output)["bundleVersion"], "2.0") << product.output;
  const std::string after = run({"runs"}).output;
  EXPECT_NE(after.find("(7101)"), std::string::npos) << after;
  EXPECT_NE(after.find("installed"), std::string::npos) << after;
  const LarderctlRun installed = run({"why", "7101"});
  // Gone from the offered updates, it is named from the journal.
  EXPECT_TRUE(installed.output.starts_with("Notes (7101): installed by the last background run"))
      << installed.output << installed.errors;
  EXPECT_NE(installed.output.find("installed on "), std::string::npos) << installed.output;
}

}  // namespace
}  // namespace larder::testing
