// Update runs against larder-store on loopback, with the store runtime in
// this process, a software map of the test's own, and sample applications
// that run as real processes from inside their bundles.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "running-apps/RunningApplication.h"
#include "software-map/SoftwareMap.h"
#include "software-map/VendSoftwareMapObserver.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tests/integration/InProcessRuntime.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/UpdateQueue.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::uint64_t kNotesID = 7001;
constexpr std::uint64_t kAtlasID = 7002;

bool eventually(const std::function<bool()>& condition,
                std::chrono::milliseconds limit = std::chrono::seconds(15)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return condition();
}

// Counts what the map tells its observers, so that a replacement can be
// told from a removal and an addition.
class MapChanges final : public VendSoftwareMapObserver {
 public:
  void softwareProductUpdatedState(const LedgerSoftwareProductRef&, std::int64_t state) override {
    if (state == kSoftwareProductAdded) ++added_;
    if (state == kSoftwareProductRemoved) ++removed_;
    if (state == kSoftwareProductChanged) ++updated_;
  }
  std::atomic<std::size_t> added_{0};
  std::atomic<std::size_t> removed_{0};
  std::atomic<std::size_t> updated_{0};
};

class UpdateRunTest : public InProcessRuntimeTest {
 protected:
  void SetUp() override {
    environment_.set("HOME", platform_.home());
    environment_.set("XDG_CACHE_HOME", platform_.cacheHome());
    environment_.set("XDG_STATE_HOME", platform_.stateHome());
    fs::create_directories(applications());
    fs::create_directories(VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID));
    catalogue_.addAccount(
        {.accountID = 1, .orvaneID = "ada@example.com", .password = "pw", .opaqueID = "account-1"});
    setPreference(kDefaultsAutoUpdateEnabledKey, true);
  }

  void TearDown() override {
    if (controller_) controller_->updateQueue()->finishPendingWrites();
    controller_.reset();
    map_.reset();
    for (pid_t pid : launched_) ::kill(pid, SIGKILL);
    InProcessRuntimeTest::TearDown();
  }

  [[nodiscard]] std::string applications() const { return platform_.root() + "/Applications"; }

  static void setPreference(std::string_view key, PlistValue value) {
    ASSERT_TRUE(PreferenceStore::setValue(key, std::move(value), kDaemonDefaultsID).has_value());
  }

  // An installed store application at version 1.0 whose program is a copy of
  // sleep, and the store's version 2.0 of it.
  std::string installWithUpdate(const std::string& name, const std::string& identifier,
                                std::uint64_t wareID, std::size_t payloadBytes = 4096) {
    const std::string path = platform_.installBundle({.folder = applications(),
                                                      .name = name,
                                                      .bundleIdentifier = identifier,
                                                      .version = "1.0",
                                                      .itemIdentifier = wareID});
    // The program runs sleep from inside the bundle, so that the process
    // belongs to the bundle as the running applications see it.
    fs::copy_file("/bin/sleep", path + "/bin/sleep");
    fs::copy_file("/bin/sh", path + "/bin/sh");
    std::ofstream(path + "/bin/" + name)
        << "#!" << path << "/bin/sh\nexec " << path << "/bin/sleep 600\n";
    fs::permissions(path + "/bin/" + name, fs::perms::owner_all);
    catalogue_.addItem({.wareID = wareID,
                        .bundleID = identifier,
                        .title = name,
                        .version = "2.0",
                        .payloadBytes = payloadBytes,
                        .actionParams = "productType=C&price=0&itemId=" + std::to_string(wareID)});
    return path;
  }

  pid_t launch(const std::string& bundlePath) {
    Result<pid_t> pid = RunningApplication::launchBundle(bundlePath);
    EXPECT_TRUE(pid) << pid.errorDescription();
    if (!pid) return -1;
    launched_.push_back(*pid);
    EXPECT_TRUE(eventually([&] { return RunningApplication::withPid(*pid) != nullptr; }));
    return *pid;
  }

  void startEverything() {
    startStore();
    VendStoreClient client =
        VendStoreClient::fromDictionary({{"identifier", "com.orvane.quaymart"}});
    VendServiceProxy proxy(client);
    ASSERT_TRUE(signInThrough(proxy, "ada@example.com", "pw"));
    SoftwareMap::Options options;
    options.persistedStorePath = platform_.persistedStorePath();
    options.liveQueries = false;
    options.periodicReload = false;
    map_.emplace(options);
    map_->waitUntilIdle();
    map_->addObserver(changes_);
    controller_ = UpdateController::make(client, *map_);
  }

  // A background run with the tasks that the time tests give it.
  std::shared_ptr<UpdateOperation> backgroundRun(bool stage, bool autoInstall) {
    auto run = std::make_shared<UpdateOperation>(
        controller_->storeClient(), std::weak_ptr<UpdateOperationController>(controller_));
    run->changeSettings([&](UpdateOperationSettings& s) {
      s.shouldCheckForAndStageAppUpdates = stage;
      s.shouldStartAutoInstallOfUpdates = autoInstall;
    });
    return run;
  }

  static void runToTheEnd(UpdateOperation& run) {
    OptionalError error;
    EXPECT_TRUE(run.runSyncReturningError(&error));
  }

  LedgerUpdateRef queued(std::uint64_t item) {
    return controller_->updateQueue()->availableUpdateWithItemIdentifier(item);
  }

  static std::string installedVersion(const std::string& path) {
    auto info = PropertyListSerialization::read(*FileIO::read(path + "/bundle.plist"));
    return *(*info)["HostBundleShortVersionString"].string();
  }

  static PlistDictionary auditEntry(const UpdateOperation& run, std::uint64_t item) {
    const PlistDictionary audit = run.auditInfo();
    auto apps = audit.find("appUpdates");
    if (apps == audit.end() || !apps->second.dictionary()) return {};
    const PlistValue& entry = apps->second[std::to_string(item)];
    return entry.dictionary() ? *entry.dictionary() : PlistDictionary{};
  }

  std::optional<SoftwareMap> map_;
  std::shared_ptr<MapChanges> changes_ = std::make_shared<MapChanges>();
  std::shared_ptr<UpdateController> controller_;
  std::vector<pid_t> launched_;
};

TEST_F(UpdateRunTest, ARunningAppIsStagedWithCode3AndInstalledByTheRunAfterItQuits) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  startEverything();
  const pid_t pid = launch(notes);

  auto first = backgroundRun(true, true);
  runToTheEnd(*first);
  LedgerUpdateRef update = queued(kNotesID);
  ASSERT_TRUE(update) << "the update left the queue although its app runs";
  EXPECT_TRUE(update->isStaged());
  EXPECT_EQ(update->autoUpdateAbortCode(), UpdateOperation::kAbortAppRunning);
  EXPECT_TRUE(update->firstAutoUpdateAttemptDate());
  EXPECT_EQ(installedVersion(notes), "1.0");
  EXPECT_NE(RunningApplication::withPid(pid), nullptr) << "the running app was touched";
  EXPECT_EQ(auditEntry(*first, kNotesID)["abortCode"].int64Value(), 3);
  EXPECT_EQ(*auditEntry(*first, kNotesID)["abortReason"].string(), "the app is running");

  // Nothing changed: the next run that only installs leaves it alone.
  auto unchanged = backgroundRun(false, true);
  runToTheEnd(*unchanged);
  EXPECT_EQ(installedVersion(notes), "1.0");
  EXPECT_EQ(queued(kNotesID)->autoUpdateAbortCode(), UpdateOperation::kAbortAppRunning);

  ::kill(pid, SIGKILL);
  ASSERT_TRUE(eventually([&] { return RunningApplication::withPid(pid) == nullptr; }));
  const std::size_t removedBefore = changes_->removed_;
  const std::size_t addedBefore = changes_->added_;
  auto second = backgroundRun(false, true);
  runToTheEnd(*second);
  EXPECT_EQ(installedVersion(notes), "2.0");
  EXPECT_EQ(queued(kNotesID), nullptr) << "an installed update stays listed";
  EXPECT_TRUE(auditEntry(*second, kNotesID)["shouldInstall"].boolValue());
  ASSERT_TRUE(eventually([&] {
    LedgerSoftwareProductRef product = map_->productForItemIdentifier(kNotesID);
    return product && product->bundleVersion() == "2.0";
  }));
  EXPECT_EQ(changes_->removed_, removedBefore);
  EXPECT_EQ(changes_->added_, addedBefore);
  EXPECT_TRUE(fs::exists(UpdateOperation::auditFilePath()));
}

TEST_F(UpdateRunTest, AnAppThatIsNotRunningIsStagedAndInstalledInOneRun) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  startEverything();
  auto run = backgroundRun(true, true);
  runToTheEnd(*run);
  EXPECT_EQ(installedVersion(notes), "2.0");
  EXPECT_EQ(installedVersion(atlas), "2.0");
  EXPECT_EQ(queued(kNotesID), nullptr);
  EXPECT_EQ(queued(kAtlasID), nullptr);
  EXPECT_EQ(run->runState().autoInstalledAppUpdates.size(), 2U);
}

}  // namespace
}  // namespace larder::testing
