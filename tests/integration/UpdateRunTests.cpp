// Update runs against larder-store on loopback, with the store runtime in
// this process, a software map of the test's own, and sample applications
// that run as real processes from inside their bundles.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <nlohmann/json.hpp>
#include <thread>

#include "notifications/center/UserNotificationCenter.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "running-apps/PlugInHost.h"
#include "running-apps/RunningApplication.h"
#include "running-apps/RunningApplicationFacts.h"
#include "software-map/SoftwareMap.h"
#include "software-map/VendSoftwareMapObserver.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/LedgerDockMessaging.h"
#include "store-runtime/host/LedgerFileProgress.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tests/integration/InProcessRuntime.h"
#include "tests/unit/AnsweringDialogPresenter.h"
#include "tests/unit/OSUpdateOffers.h"
#include "update-controller/UpdateController.h"
#include "update-controller/VendOSUpdateProgressObserver.h"
#include "update-operation/UpdateOperation.h"
#include "update-operation/VendUpdateDelegate.h"
#include "update-queue/UpdateQueue.h"
#include "update-queue/journal/UpdateJournal.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::uint64_t kNotesID = 7001;
constexpr std::uint64_t kAtlasID = 7002;

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
    environment_.set("XDG_DATA_HOME", platform_.home() + "/.local/share");
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
                                std::uint64_t wareID, bool runnableUpdate = false,
                                std::size_t payloadBytes = 4096) {
    const std::string path = platform_.installBundle({.folder = applications(),
                                                      .name = name,
                                                      .bundleIdentifier = identifier,
                                                      .version = "1.0",
                                                      .itemIdentifier = wareID});
    TemporaryPlatform::makeRunnable(path);
    catalogue_.addItem(
        {.wareID = wareID,
         .bundleID = identifier,
         .title = name,
         .version = "2.0",
         .bundlePath = runnableUpdate ? runnableBundle(name, identifier, wareID, path) : "",
         .payloadBytes = payloadBytes,
         .actionParams = "productType=C&price=0&itemId=" + std::to_string(wareID)});
    return path;
  }

  // Version 2.0 for the store, runnable where 1.0 is installed.
  std::string runnableBundle(const std::string& name, const std::string& identifier,
                             std::uint64_t wareID, const std::string& installedPath) {
    const std::string path = platform_.installBundle({.folder = catalogue_.scratchDirectory(),
                                                      .name = name,
                                                      .bundleIdentifier = identifier,
                                                      .version = "2.0",
                                                      .itemIdentifier = wareID});
    TemporaryPlatform::makeRunnable(path, installedPath);
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

  // Viewer, at `host`, runs a plug-in of Atlas, at `atlas`.
  static bool viewerUsesAPlugInOf(const std::string& atlas, const std::string& host) {
    return PlugInHost::addBusyPlugIn({{"containingIdentifier", "com.example.atlas"},
                                      {"containingPath", atlas},
                                      {"plugInIdentifier", "com.example.atlas.ext"},
                                      {"plugInPath", atlas + "/plugins/Ext.app"},
                                      {"hostIdentifier", "com.example.viewer"},
                                      {"hostPath", host},
                                      {"service-pid", 4242}});
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
    notifications_ = UserNotificationCenter::makeForTesting(
        "com.orvane.larderd", UserNotificationCenter::kSystemCenter,
        platform_.directory() + "/notifications.plist");
    controller_ = UpdateController::make(client, *map_, notifications_);
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
  std::shared_ptr<UserNotificationCenter> notifications_;
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
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "1.0");
  EXPECT_NE(RunningApplication::withPid(pid), nullptr) << "the running app was touched";
  EXPECT_EQ(auditEntry(*first, kNotesID)["abortCode"].int64Value(), 3);
  EXPECT_EQ(*auditEntry(*first, kNotesID)["abortReason"].string(), "the app is running");

  // Nothing changed: the next run that only installs leaves it alone.
  auto unchanged = backgroundRun(false, true);
  runToTheEnd(*unchanged);
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "1.0");
  EXPECT_EQ(queued(kNotesID)->autoUpdateAbortCode(), UpdateOperation::kAbortAppRunning);

  ::kill(pid, SIGKILL);
  ASSERT_TRUE(eventually([&] { return RunningApplication::withPid(pid) == nullptr; }));
  const std::size_t removedBefore = changes_->removed_;
  const std::size_t addedBefore = changes_->added_;
  auto second = backgroundRun(false, true);
  runToTheEnd(*second);
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "2.0");
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
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "2.0");
  EXPECT_EQ(TemporaryPlatform::bundleVersion(atlas), "2.0");
  EXPECT_EQ(queued(kNotesID), nullptr);
  EXPECT_EQ(queued(kAtlasID), nullptr);
  EXPECT_EQ(run->runState().autoInstalledAppUpdates.size(), 2U);
  // Each installed update is in the journal, with the version it brought.
  const UpdateJournal::Entries journal = UpdateJournal::sharedJournal().installedUpdatesJournal();
  ASSERT_EQ(journal.size(), 2U);
  for (const PlistDictionary& entry : journal) {
    EXPECT_EQ(PlistValue(entry)["version"], PlistValue("2.0"));
  }
  // The run tells the user what it updated.
  const std::vector<UserNotification> told = notifications_->deliveredNotifications();
  ASSERT_EQ(told.size(), 1U);
  EXPECT_EQ(told[0].source(), "autoInstalledUpdates");
  EXPECT_EQ(told[0].title, "2 Apps Updated");
  EXPECT_NE(told[0].informativeText.find("were updated automatically."), std::string::npos);
}

// Traces name the vendor's own applications only: another vendor's app is
// "Third Party App" with item 0, also when it is held back.
TEST_F(UpdateRunTest, TracesOfHeldBackAppsNameOnlyTheVendorsOwn) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  const std::string atlas = installWithUpdate("Atlas", "com.orvane.atlas", kAtlasID);
  startEverything();
  launch(notes);
  launch(atlas);
  auto run = backgroundRun(true, true);
  runToTheEnd(*run);
  LedgerTraceMessageWaitUntilWritten();
  std::map<std::string, nlohmann::json> traced;
  std::ifstream log(LedgerTraceMessageLogPath());
  for (std::string line; std::getline(log, line);) {
    nlohmann::json record = nlohmann::json::parse(line);
    if (record["domain"] == "com.orvane.Quaymart.autoupdate.app") {
      traced[record["message"]["bundle_id"]] = record["message"];
    }
  }
  ASSERT_EQ(traced.size(), 2U) << "one trace per held-back app";
  EXPECT_EQ(traced["com.orvane.atlas"]["ware_id"], kAtlasID);
  EXPECT_EQ(traced["com.orvane.atlas"]["abort_code"], UpdateOperation::kAbortAppRunning);
  EXPECT_EQ(traced["com.orvane.atlas"]["result"], "fail");
  EXPECT_EQ(traced["Third Party App"]["ware_id"], 0);
  EXPECT_EQ(traced["Third Party App"]["abort_code"], UpdateOperation::kAbortAppRunning);
  for (const auto& [name, message] : traced) {
    EXPECT_EQ(message.dump().find("com.example"), std::string::npos) << message.dump();
  }
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
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "1.0");
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
  EXPECT_EQ(TemporaryPlatform::bundleVersion(atlas), "1.0");
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

// An OS update that brings an application shows, in a run the user
// started, as that application being downloaded: a launcher placeholder and
// a published progress item, gone at the end; a cancel asked for through
// the published item stops the install.
TEST_F(UpdateRunTest, AnOSUpdateThatBringsAnAppIsShownAsItsDownloadAndCanBeCancelledThere) {
  const PlistDictionary mapMaker{{"productKey", "MAPS-1"},
                                 {"title", "Map Maker"},
                                 {"isRecommended", true},
                                 {"installSeconds", 3.0},
                                 {"tags", PlistArray{"SYSUPBUNDLE:com.example.mapmaker"}}};
  offerOSUpdates(PlistArray{mapMaker});
  startEverything();
  const std::string item = "/Applications/Map Maker.appdownload";
  auto userRun = [&] {
    auto run = std::make_shared<UpdateOperation>(
        controller_->storeClient(), std::weak_ptr<UpdateOperationController>(controller_));
    run->changeSettings([&](UpdateOperationSettings& s) {
      s.userInitiated = true;
      s.appUpdatesToInstall = std::vector<LedgerUpdateRef>{};
      s.osUpdatesToInstall =
          SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
      s.osUpdateCancelTokens = controller_->osUpdateCancelTokens();
    });
    return run;
  };
  auto published = [&] {
    return PlatformStateFile(LedgerFileProgress::stateFilePath()).readDictionary();
  };
  auto placeholders = [] {
    return PlistValue(
        PlatformStateFile(LedgerDockMessaging::stateFilePath()).readDictionary())["placeholders"];
  };

  auto cancelled = userRun();
  auto running = std::async(std::launch::async, [&] { runToTheEnd(*cancelled); });
  ASSERT_TRUE(eventually([&] { return PlistValue(published())["items"][item].isDictionary(); }));
  const PlistValue shown = PlistValue(published())["items"][item];
  EXPECT_EQ(shown["operation"], PlistValue("downloading"));
  EXPECT_EQ(shown["totalUnitCount"].int64Value(), 100);
  EXPECT_FALSE(shown["pausable"].boolValue());
  EXPECT_TRUE(placeholders()["Map Maker"].isDictionary());
  // What a file manager does: ask for the cancel in the published entry.
  ASSERT_TRUE(PlatformStateFile(LedgerFileProgress::stateFilePath())
                  .updateDictionary([&](PlistDictionary& state) {
                    PlistValue& entry = (*state["items"].dictionary())[item];
                    (*entry.dictionary())["cancelRequested"] = true;
                  }));
  running.get();
  EXPECT_EQ(SysupQuaymartUpdateController::sharedUpdateController().availableUpdates().size(), 1U)
      << "the cancelled update was installed";
  EXPECT_FALSE(PlistValue(published())["items"][item].isDictionary());
  EXPECT_FALSE(placeholders()["Map Maker"].isDictionary());

  // Left alone, the item follows the install to its end and goes.
  auto installed = userRun();
  runToTheEnd(*installed);
  EXPECT_TRUE(SysupQuaymartUpdateController::sharedUpdateController().availableUpdates().empty());
  EXPECT_FALSE(PlistValue(published())["items"][item].isDictionary());
  EXPECT_FALSE(placeholders()["Map Maker"].isDictionary());
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
  EXPECT_EQ(TemporaryPlatform::bundleVersion(platform_.root() + "/Applications/Notes.app"), "1.0");
  other->updateQueue()->finishPendingWrites();
}

class RecordingUpdateDelegate final : public VendUpdateDelegate {
 public:
  void appUpdateFinishedPurchase(const LedgerUpdateRef& update, bool success,
                                 const OptionalError& error,
                                 const std::optional<TillPurchaseResponse>&) override {
    std::lock_guard lock(mutex_);
    finished_.emplace_back(update->itemIdentifierValue(), success ? 0 : (error ? error->code : 1));
  }
  std::vector<std::pair<std::uint64_t, std::int64_t>> finished() {
    std::lock_guard lock(mutex_);
    return finished_;
  }

 private:
  std::mutex mutex_;
  std::vector<std::pair<std::uint64_t, std::int64_t>> finished_;
};

// A run the user started stops when a plug-in of the app is in use by
// another application, and tells the user which one.
TEST_F(UpdateRunTest, AUserStartedRunStopsAtABusyPlugInAndNamesItsHost) {
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  const std::string host = platform_.installBundle(
      {.folder = applications(), .name = "Viewer", .bundleIdentifier = "com.example.viewer"});
  startEverything();
  auto dialogs = std::make_shared<AnsweringDialogPresenter>();
  runtime_->setDialogPresenter(dialogs);
  DispatchSemaphore checked;
  controller_->updateQueue()->checkForUpdatesWithCompletionHandler(
      [&](bool, const auto&, const auto&, const auto&) { checked.signal(); });
  checked.wait();
  launch(atlas);
  ASSERT_TRUE(viewerUsesAPlugInOf(atlas, host));
  auto delegate = std::make_shared<RecordingUpdateDelegate>();
  auto run = std::make_shared<UpdateOperation>(
      controller_->storeClient(), std::weak_ptr<UpdateOperationController>(controller_));
  run->changeSettings([&](UpdateOperationSettings& s) {
    s.userInitiated = true;
    s.appUpdatesToInstall = std::vector<LedgerUpdateRef>{queued(kAtlasID)};
    s.osUpdatesToInstall = std::vector<SysupQuaymartUpdate>{};
    s.updateDelegate = delegate;
  });
  runToTheEnd(*run);
  EXPECT_EQ(TemporaryPlatform::bundleVersion(atlas), "1.0");
  EXPECT_EQ(delegate->finished(),
            (std::vector<std::pair<std::uint64_t, std::int64_t>>{{kAtlasID, -128}}));
  ASSERT_TRUE(eventually([&] { return !dialogs->shown().empty(); }));
  const PlistValue dialog(dialogs->shown().front());
  EXPECT_EQ(*dialog["message"].string(),
            LedgerLocalizedStringWithArguments("CANNOT_UPDATE_TITLE", nullptr, {"Atlas"}));
  EXPECT_EQ(*dialog["explanation"].string(),
            LedgerLocalizedStringWithArguments("CANNOT_UPDATE_BODY", nullptr, {"Atlas", "Viewer"}));
}

// The decisions over one update, each case set up as the machine would be.
TEST_F(UpdateRunTest, EveryAbortCodeOfTheDecisionsIsReachedWithItsReason) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  installWithUpdate("Fresh", "com.example.fresh", 7003);
  catalogue_.addItem(
      {.wareID = 7003,
       .bundleID = "com.example.fresh",
       .title = "Fresh",
       .version = "2.0",
       .actionParams = "itemId=7003",
       .extraEntries = {{"release-date", UpdatePolicy::plistDateOf(UpdatePolicy::Clock::now())}}});
  const std::string host = platform_.installBundle(
      {.folder = applications(), .name = "Viewer", .bundleIdentifier = "com.example.viewer"});
  startEverything();
  DispatchSemaphore checked;
  controller_->updateQueue()->checkForUpdatesWithCompletionHandler(
      [&](bool, const auto&, const auto&, const auto&) { checked.signal(); });
  checked.wait();
  launch(notes);
  RunningApplicationFacts::setQuittingLosesData("com.example.notes", "unsaved work");
  ASSERT_TRUE(viewerUsesAPlugInOf(atlas, host));
  struct Case {
    std::string name;
    std::optional<std::string> bundleID;
    std::function<void(UpdateOperationSettings&)> settings;
    std::function<void()> machine;
    std::int64_t code;
    std::optional<std::string> reason;
  };
  auto laterRun = [](UpdateOperationSettings& s) { s.nowIsLater = true; };
  const std::vector<Case> cases = {
      {"preference",
       "com.example.notes",
       {},
       [] { setPreference(kDefaultsAlwaysAbortUpdatesCodeKey, 42); },
       42,
       "Aborted by preference for code 42"},
      {"user", "com.example.notes", [](auto& s) { s.userInitiated = true; }, {}, 0, std::nullopt},
      {"no bundle", std::nullopt, {}, {}, 4, "nil bundleID specified"},
      {"switched off",
       "com.example.notes",
       {},
       [] { setPreference(kDefaultsAutoUpdateEnabledKey, false); },
       1,
       "auto-update is disabled by preference"},
      {"unknown", "com.example.unknown", {}, {}, 501, "update is too recent"},
      {"young", "com.example.fresh", {}, {}, 501, "update is too recent"},
      {"first try too soon",
       "com.example.atlas",
       [](auto& s) { s.shouldStartAutoInstallOfUpdates = false; },
       {},
       502,
       "too soon to start auto-update"},
      {"running", "com.example.notes", {}, {}, 3, "the app is running"},
      {"plug-in in use",
       "com.example.atlas",
       {},
       {},
       105,
       "com.example.atlas containing plugIns used by Viewer"},
      {"later, cannot quit safely",
       "com.example.notes",
       laterRun,
       {},
       100,
       "the app can not be quit safely (unsaved work)"},
      {"later, foremost", "com.example.notes", laterRun,
       [] {
         setPreference(kDefaultsAutoUpdateImmortalAppsKey, true);
         RunningApplicationFacts::setForemost("com.example.notes");
       },
       101, "the app is foremost (active)"},
      {"later, may go", "com.example.notes", laterRun,
       [] {
         setPreference(kDefaultsAutoUpdateImmortalAppsKey, true);
         setPreference(kDefaultsAutoUpdateForegroundAppsKey, true);
       },
       0, std::nullopt},
  };
  setPreference(kDefaultsAppUpdatesToInstallLaterKey, PlistArray{"com.example.notes"});
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.machine) c.machine();
    auto run = backgroundRun(false, true);
    if (c.settings) run->changeSettings(c.settings);
    UpdateAbort abort{.code = -1};
    EXPECT_EQ(run->shouldAutoInstallAppUpdate(c.bundleID, nullptr, &abort), c.code == 0);
    EXPECT_EQ(abort.code, c.code);
    EXPECT_EQ(abort.reason, c.reason);
    for (std::string_view key :
         {kDefaultsAlwaysAbortUpdatesCodeKey, kDefaultsAutoUpdateImmortalAppsKey,
          kDefaultsAutoUpdateForegroundAppsKey}) {
      ASSERT_TRUE(PreferenceStore::removeValue(key, kDaemonDefaultsID).has_value());
    }
    setPreference(kDefaultsAutoUpdateEnabledKey, true);
    RunningApplicationFacts::setForemost(std::nullopt);
  }
}

TEST_F(UpdateRunTest, EveryAbortCodeOfTheOSUpdateDecisionIsReachedWithItsReason) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID);
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  startEverything();
  launch(notes);
  launch(atlas);
  RunningApplicationFacts::setQuittingLosesData("com.example.notes", "unsaved work");
  RunningApplicationFacts::setForemost("com.example.atlas");
  auto update = [](PlistDictionary fields) {
    fields.emplace("productKey", "OS-1");
    fields.emplace("isRecommended", true);
    return *SysupQuaymartUpdate::fromDictionary(fields);
  };
  struct Case {
    std::string name;
    SysupQuaymartUpdate update;
    bool later = false;
    std::int64_t code;
    std::optional<std::string> reason;
    std::optional<std::string> bundleID;
  };
  const std::vector<Case> cases = {
      {"firmware", update({{"firmwareWarning", "Keep it plugged in."}}), false, 201,
       "the update specifies a firmware warning"},
      {"licence", update({{"licenseAgreement", "Terms."}}), false, 202,
       "the update requires a license agreement"},
      {"not recommended", update({{"isRecommended", false}}), false, 200,
       "the Update is not recommended"},
      {"immortal app", update({{"applicationIdentifiersToClose", PlistArray{"com.example.notes"}}}),
       false, 100,
       "the Update requires com.example.notes to be quit but it is immortal (unsaved work)",
       "com.example.notes"},
      {"foremost app", update({{"applicationIdentifiersToClose", PlistArray{"com.example.atlas"}}}),
       false, 101, "the Update requires com.example.atlas to be quit but it is foremost",
       "com.example.atlas"},
      {"nothing in the way", update({}), false, 0, std::nullopt},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    auto run = backgroundRun(false, true);
    UpdateAbort abort{.code = -1};
    EXPECT_EQ(run->shouldInstallOSUpdate(c.update, &abort), c.code == 0);
    EXPECT_EQ(abort.code, c.code);
    EXPECT_EQ(abort.reason, c.reason);
    EXPECT_EQ(abort.bundleID, c.bundleID);
  }

  // A restart update that the user put off passes the texts, and meets the
  // other users of the machine.
  ASSERT_TRUE(PlatformStateFile::named("sessions.plist").updateValue([](PlistValue& value) {
    value = PlistArray{PlistDictionary{{"user", "ada"}, {"state", "active"}},
                       PlistDictionary{{"user", "bob"}, {"state", "online"}}};
  }));
  offerOSUpdates(PlistArray{PlistDictionary{{"productKey", "KERNEL-1"},
                                            {"restartRequired", true},
                                            {"firmwareWarning", "Keep it plugged in."}}});
  const SysupQuaymartUpdate kernel =
      SysupQuaymartUpdateController::sharedUpdateController().availableUpdates().front();
  auto later = backgroundRun(false, true);
  later->changeSettings(
      [&](UpdateOperationSettings& s) { s.osUpdatesToInstallLater = {{kernel}}; });
  UpdateAbort abort;
  EXPECT_FALSE(later->shouldInstallOSUpdate(kernel, &abort));
  EXPECT_EQ(abort.code, 104);
  EXPECT_EQ(abort.reason, "the update requires restart but other users are logged in");

  setPreference(kDefaultsAlwaysAbortUpdatesCodeKey, 0);
  EXPECT_FALSE(later->shouldInstallOSUpdate(update({}), &abort));
  EXPECT_EQ(abort.code, 0);
}

// A run at the moment the user chose quits the app in the way, installs the
// new version and starts it again; an app that will not quit holds its
// update back with 103, and so does one that an OS update has to close.
TEST_F(UpdateRunTest, AtTheChosenMomentTheAppIsQuitInstalledAndStartedAgain) {
  const std::string notes = installWithUpdate("Notes", "com.example.notes", kNotesID, true);
  const std::string atlas = installWithUpdate("Atlas", "com.example.atlas", kAtlasID);
  // Atlas's program ignores the quit request.
  std::ofstream(atlas + "/bin/Atlas")
      << "#!" << atlas << "/bin/sh\ntrap '' TERM\nexec " << atlas << "/bin/sleep 600\n";
  offerOSUpdates(PlistArray{
      PlistDictionary{{"productKey", "ATLAS-FIX"},
                      {"isRecommended", true},
                      {"applicationIdentifiersToClose", PlistArray{"com.example.atlas"}}}});
  setPreference(kDefaultsAppUpdatesToInstallLaterKey,
                PlistArray{"com.example.notes", "com.example.atlas"});
  startEverything();
  const pid_t notesPid = launch(notes);
  const pid_t atlasPid = launch(atlas);

  auto run = backgroundRun(true, true);
  run->changeSettings([](UpdateOperationSettings& s) {
    s.nowIsLater = true;
    s.doItLaterMode = 1;
    s.appHelperTiming = {.settle = std::chrono::milliseconds(10),
                         .quitTimeout = std::chrono::milliseconds(500),
                         .dimWakeQuitTimeout = std::chrono::milliseconds(500)};
  });
  runToTheEnd(*run);
  EXPECT_EQ(TemporaryPlatform::bundleVersion(notes), "2.0");
  EXPECT_EQ(RunningApplication::withPid(notesPid), nullptr);
  ASSERT_TRUE(eventually([&] {
    return RunningApplication::runningApplicationsWithBundleIdentifier("com.example.notes")
               .size() == 1;
  })) << "the quit app was not started again";
  for (const auto& app :
       RunningApplication::runningApplicationsWithBundleIdentifier("com.example.notes")) {
    launched_.push_back(app->pid());
  }

  EXPECT_EQ(TemporaryPlatform::bundleVersion(atlas), "1.0");
  EXPECT_NE(RunningApplication::withPid(atlasPid), nullptr);
  EXPECT_EQ(queued(kAtlasID)->autoUpdateAbortCode(), UpdateOperation::kAbortDidNotTerminate);
  EXPECT_EQ(*auditEntry(*run, kAtlasID)["abortReason"].string(), "running app did not terminate");
  const PlistValue osEntry = PlistValue(run->auditInfo())["osUpdates"]["ATLAS-FIX"];
  EXPECT_EQ(osEntry["abortCode"].int64Value(), UpdateOperation::kAbortDidNotTerminate);
  EXPECT_EQ(*osEntry["abortReason"].string(), "app com.example.atlas did not terminate");
  EXPECT_EQ(SysupQuaymartUpdateController::sharedUpdateController().availableUpdates().size(), 1U);

  // What was put off and is still undone is a failure the user hears of,
  // with the run's audit; the later lists are emptied.
  const std::vector<UserNotification> told = notifications_->deliveredNotifications();
  ASSERT_EQ(told.size(), 1U);
  const PlistValue userInfo(told[0].userInfo);
  EXPECT_TRUE(userInfo["isDoItLaterFailure"].boolValue());
  ASSERT_NE(userInfo["auditInfoCacheKey"].string(), nullptr);
  const std::optional<PlistDictionary> audit =
      controller_->cachedUpdateAuditInfoWithKey(*userInfo["auditInfoCacheKey"].string());
  ASSERT_TRUE(audit.has_value());
  EXPECT_TRUE(PlistValue(*audit)["appUpdates"][std::to_string(kAtlasID)].dictionary());
  EXPECT_TRUE(controller_->appUpdatesToInstallLater().empty());
}

// A restart-required OS update put off to later: each way through the
// preparation, the countdown and the request to install after logout.
TEST_F(UpdateRunTest, ADoItLaterRestartIsPreparedCountedDownAndHandedToTheFramework) {
  struct Case {
    const char* name;
    std::int64_t mode;
    bool deferred;
    int users;
    bool displayAsleep;
    std::optional<std::int64_t> countdownAnswer;
    bool restartRequested;
    std::int64_t countdowns;
    bool logoutFailed;
    std::optional<std::int64_t> armedAfter;
  } const cases[] = {
      {"in an hour, alone", 2, false, 1, false, std::nullopt, true, 1, false, 2},
      {"in an hour, others logged in", 2, false, 2, false, std::nullopt, false, 0, true,
       std::nullopt},
      {"tonight, countdown deferred, display asleep", 1, true, 1, true, std::nullopt, true, 1,
       false, 1},
      // The choice is stored by a new later request, and the same run's end
      // empties the lists again, as the end of every Do It Later run
      // without restart does.
      {"tonight, the user stops the countdown for tonight", 1, true, 1, false, 3, false, 1, true,
       std::nullopt},
  };
  startEverything();
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    offerOSUpdates(PlistArray{PlistDictionary{{"productKey", "KERNEL-3"},
                                              {"isRecommended", true},
                                              {"restartRequired", true},
                                              {"allowedToUseInstallLater", true}}});
    ASSERT_TRUE(PlatformStateFile::named("sessions.plist").updateValue([&](PlistValue& value) {
      PlistArray sessions;
      for (int user = 0; user < c.users; ++user) {
        sessions.emplace_back(
            PlistDictionary{{"user", "u" + std::to_string(user)}, {"state", "active"}});
      }
      value = sessions;
    }));
    ASSERT_TRUE(PlatformStateFile::named("system-state.plist")
                    .updateDictionary(
                        [&](PlistDictionary& state) { state["displayAsleep"] = c.displayAsleep; }));
    ASSERT_TRUE(
        PlatformStateFile::named("twilight.plist").updateDictionary([&](PlistDictionary& state) {
          state = {};
          if (c.countdownAnswer) state["countdownAnswer"] = *c.countdownAnswer;
        }));
    ASSERT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                    .updateDictionary([](PlistDictionary& state) { state.erase("postLogout"); }));
    UpdatePolicy::setLastDoItLaterLogoutFailed(false);
    controller_->installAvailableUpdatesLaterWithMode(c.mode);

    auto restartRequests = [] {
      const PlistValue requests(PlatformStateFile::named("restart-requests.plist").read());
      return requests.array() ? requests.array()->size() : 0;
    };
    const std::size_t requestsBefore = restartRequests();
    std::shared_ptr<UpdateOperation> run = controller_->nowIsLaterWithMode(c.mode, c.deferred);
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();

    const PlistValue postLogout(
        PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName).readDictionary());
    EXPECT_EQ(postLogout["postLogout"]["KERNEL-3"]["restartingNow"].boolValue(),
              c.restartRequested);
    EXPECT_EQ(restartRequests(), requestsBefore + (c.restartRequested ? 1 : 0));
    const PlistValue agent(PlatformStateFile::named("twilight.plist").readDictionary());
    EXPECT_EQ(agent["countdownCount"].int64Value(), c.countdowns);
    EXPECT_EQ(UpdatePolicy::lastDoItLaterLogoutFailed(), c.logoutFailed);
    EXPECT_EQ(LedgerTwilightAgent::armedMode(), c.armedAfter);
    // Only a night restart takes the snapshot, and keeps it for the restart.
    EXPECT_EQ(run->runState().didSnapshotTAL, c.restartRequested && c.mode == 1);
    controller_->cancelUpdatesToBeInstalledLater();
  }
}

}  // namespace
}  // namespace larder::testing
