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
#include "update-controller/VendOSUpdateProgressObserver.h"
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

  // The OS updates the system offers, found by a scan.
  static void offerOSUpdates(const PlistArray& catalog) {
    ASSERT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                    .updateDictionary([&](PlistDictionary& state) { state["catalog"] = catalog; }));
    std::promise<OptionalError> finished;
    SysupQuaymartUpdateController::sharedUpdateController()
        .startScanningForUpdatesIncludingPrerelease(
            true, true, true, nullptr, [](double) {},
            [&](const OptionalError& error) { finished.set_value(error); });
    ASSERT_FALSE(finished.get_future().get());
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
    startSignedIn();
  }

  void startSignedIn() {
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

// Each way an automatic update can fail leaves the old version installed
// and able to run, and the update listed with what went wrong.
struct Failure {
  std::string name;
  std::vector<std::string> faults;
  bool packageNamesAnotherBundle = false;
  std::int64_t abortCode = 0;
  bool didFailToAutoInstall = false;
};

class UpdateRunFailureTest : public UpdateRunTest, public ::testing::WithParamInterface<Failure> {};

TEST_P(UpdateRunFailureTest, LeavesTheOldVersionAndTheUpdateListedWithItsFailure) {
  const Failure& failure = GetParam();
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  if (failure.packageNamesAnotherBundle) {
    // The store's package carries a bundle of another identifier: the
    // installer refuses to put it in the place of this one.
    const std::string other = platform_.installBundle({.folder = catalogue_.scratchDirectory(),
                                                       .name = "Notes",
                                                       .bundleIdentifier = "com.example.other",
                                                       .version = "2.0"});
    catalogue_.addItem({.wareID = kNotesID,
                        .bundleID = "com.example.notes",
                        .title = "Notes",
                        .version = "2.0",
                        .bundlePath = other,
                        .actionParams = "itemId=" + std::to_string(kNotesID)});
  }
  store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), failure.faults);
  useBag(store_->bagURL());
  startSignedIn();
  auto run = backgroundRun(true, true);
  runToTheEnd(*run);
  EXPECT_EQ(installedVersion(notes), "1.0");
  launch(notes);
  LedgerUpdateRef update = queued(kNotesID);
  ASSERT_TRUE(update);
  EXPECT_EQ(update->autoUpdateAbortCode(), failure.abortCode);
  EXPECT_EQ(update->didFailToAutoInstall(), failure.didFailToAutoInstall);
}

INSTANTIATE_TEST_SUITE_P(
    Failures, UpdateRunFailureTest,
    ::testing::Values(
        Failure{.name = "Purchase",
                .faults = {"buy-product=not-plist"},
                .abortCode = UpdateOperation::kAbortPurchaseFailed},
        Failure{.name = "Digest", .faults = {"assets=corrupt"}, .didFailToAutoInstall = true},
        Failure{
            .name = "Install", .packageNamesAnotherBundle = true, .didFailToAutoInstall = true}),
    [](const ::testing::TestParamInfo<Failure>& info) { return info.param.name; });

TEST_F(UpdateRunTest, APreflightRefusalBeforeStagingIs7AndOneAtInstallIs5) {
  installWithUpdate("Notes", "com.example.notes", kNotesID);
  catalogue_.addItem({.wareID = kNotesID,
                      .bundleID = "com.example.notes",
                      .title = "Notes",
                      .version = "2.0",
                      .actionParams = "itemId=" + std::to_string(kNotesID),
                      .preflight = PlistDictionary{{"allowed", false}}});
  // Atlas needs an OS version that only the offered OS update brings: its
  // preflight passes against that version while staging, and fails against
  // this machine's when it is to be installed.
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  catalogue_.addItem({.wareID = kAtlasID,
                      .bundleID = "com.example.atlas",
                      .title = "Atlas",
                      .version = "2.0",
                      .actionParams = "itemId=" + std::to_string(kAtlasID),
                      .preflight = PlistDictionary{{"minimumSystemVersion", "9999"}}});
  offerOSUpdates(PlistArray{
      PlistDictionary{{"productKey", "OS-9999"},
                      {"isRecommended", true},
                      {"restartRequired", true},
                      {"downloadMetadata", PlistDictionary{{"SystemVersion", "9999"}}}}});
  startEverything();
  auto run = backgroundRun(true, true);
  runToTheEnd(*run);
  EXPECT_EQ(queued(kNotesID)->autoUpdateAbortCode(), UpdateOperation::kAbortPreflightBeforeStaging);
  EXPECT_FALSE(queued(kNotesID)->isStaged());
  LedgerUpdateRef staged = queued(kAtlasID);
  EXPECT_TRUE(staged->isStaged());
  EXPECT_EQ(staged->autoUpdateAbortCode(), UpdateOperation::kAbortPreflight);
  EXPECT_EQ(installedVersion(atlas), "1.0");
  EXPECT_EQ(*auditEntry(*run, kAtlasID)["abortReason"].string(),
            "preflight returned warning or error");
  // The audit of the refusal before staging keeps the preflight's own code.
  EXPECT_NE(auditEntry(*run, kNotesID)["abortCode"].int64Value(), 7);
  EXPECT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                  .readDictionary()["installed"]
                  .isNull())
      << "a background run installed an OS update that needs a restart";
}

class RecordingProgress final : public VendOSUpdateProgressObserver {
 public:
  void osUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& updates,
                                const LedgerSoftwareUpdateStatus& progress) override {
    std::lock_guard lock(mutex_);
    for (const SysupQuaymartUpdate& update : updates) keys_.push_back(update.productKey());
    percents_.push_back(progress.percentComplete());
    ended_ = ended_ || progress.hasEnded();
  }
  std::vector<double> percents() const {
    std::lock_guard lock(mutex_);
    return percents_;
  }
  std::vector<std::string> keys() const {
    std::lock_guard lock(mutex_);
    return keys_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<double> percents_;
  std::vector<std::string> keys_;
  bool ended_ = false;
};

TEST_F(UpdateRunTest, AnOSUpdateWithoutRestartIsInstalledWithProgressAndOneWithRestartIsNot) {
  offerOSUpdates(PlistArray{
      PlistDictionary{{"productKey", "SEC-1"}, {"isRecommended", true}, {"installSeconds", 0.2}},
      PlistDictionary{
          {"productKey", "KERNEL-2"}, {"isRecommended", true}, {"restartRequired", true}}});
  startEverything();
  auto progress = std::make_shared<RecordingProgress>();
  controller_->addOSUpdateProgressObserver(progress);
  auto run = backgroundRun(true, true);
  runToTheEnd(*run);
  const auto available = SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
  ASSERT_EQ(available.size(), 1U);
  EXPECT_EQ(available.front().productKey(), "KERNEL-2");
  ASSERT_TRUE(eventually([&] {
    auto percents = progress->percents();
    return !percents.empty() && percents.back() == 100.0;
  }));
  for (const std::string& key : progress->keys()) EXPECT_EQ(key, "SEC-1");
  EXPECT_TRUE(controller_->osUpdatesInProgress().empty());
  EXPECT_FALSE(run->runState().shouldRestartToInstallUpdates);
}

TEST_F(UpdateRunTest, TheLockOfAllRunsIsNotHeldWhileARunDownloads) {
  installWithUpdate("Notes", "com.example.notes", kNotesID);
  store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(),
                                                std::vector<std::string>{"assets=stall"});
  useBag(store_->bagURL(), 60);
  startSignedIn();
  auto downloading = backgroundRun(true, true);
  std::atomic<bool> firstEnded{false};
  std::thread first([&] {
    runToTheEnd(*downloading);
    firstEnded = true;
  });
  ASSERT_TRUE(eventually([&] { return requests("assets") > 0; }));

  // A second client's run qualifies, and ends, while the first waits for
  // its download.
  auto other = UpdateController::make(
      VendStoreClient::fromDictionary({{"identifier", "com.example.other-client"}}), *map_);
  auto second = std::make_shared<UpdateOperation>(other->storeClient(),
                                                  std::weak_ptr<UpdateOperationController>(other));
  runToTheEnd(*second);
  EXPECT_FALSE(firstEnded);

  store_.reset();  // the stalled download fails, and the first run ends
  first.join();
  EXPECT_EQ(installedVersion(platform_.root() + "/Applications/Notes.app"), "1.0");
  other->updateQueue()->finishPendingWrites();
}

}  // namespace
}  // namespace larder::testing
