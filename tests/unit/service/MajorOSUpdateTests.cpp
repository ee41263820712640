// The major OS update: the announcement, the evaluation at each report and
// its reminders and retries, the managed install, the user's answers to
// its notifications, and the in-process install service.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <nlohmann/json.hpp>

#include "ServiceTestSupport.h"
#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/RunLoop.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerMajorOSInstallService.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "tests/unit/OSUpdateOffers.h"
#include "update-controller/UpdateController.h"

namespace larder::testing {
namespace {

constexpr std::string_view kSH = "com.example.setupherald";
constexpr std::string_view kAutoDownloaded =
    UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded;
constexpr std::string_view kAvailable =
    UpdateNotificationCatalogue::kMajorOSUpdateAvailableForDownload;
constexpr std::string_view kPending = UpdateNotificationCatalogue::kMajorOSUpdatePending;

double nowSeconds() {
  using Seconds = std::chrono::duration<double>;
  return Seconds(std::chrono::system_clock::now().time_since_epoch()).count();
}

PlistDictionary majorState() {
  PlistValue stored = PreferenceStore::valueForKey(kDefaultsMajorOSUpdateKey, kDaemonDefaultsID,
                                                   PreferenceScope::System);
  return stored.dictionary() ? *stored.dictionary() : PlistDictionary{};
}

void setMajorState(const PlistDictionary& state) {
  ASSERT_TRUE(PreferenceStore::setValue(kDefaultsMajorOSUpdateKey, PlistValue(state),
                                        kDaemonDefaultsID, PreferenceScope::System));
}

// The trace records of `domain` written so far, as their messages.
std::vector<nlohmann::json> traces(std::string_view domain) {
  LedgerTraceMessageWaitUntilWritten();
  std::ifstream log(LedgerTraceMessageLogPath());
  std::vector<nlohmann::json> messages;
  std::string line;
  while (std::getline(log, line)) {
    nlohmann::json record = nlohmann::json::parse(line, nullptr, false);
    if (!record.is_discarded() && record["domain"] == domain) messages.push_back(record["message"]);
  }
  return messages;
}

std::vector<nlohmann::json> receivedTraces() {
  return traces("com.orvane.Quaymart.received_SH_notification.v1");
}

std::vector<nlohmann::json> activatedTraces() {
  return traces("com.orvane.Quaymart.activated_OS_notification.v1");
}

class MainLoopThread {
 public:
  MainLoopThread() : thread_([] { RunLoop::main().run(); }) {}
  ~MainLoopThread() {
    RunLoop::main().stop();
    thread_.join();
  }
  MainLoopThread(const MainLoopThread&) = delete;
  MainLoopThread& operator=(const MainLoopThread&) = delete;

 private:
  std::thread thread_;
};

class MajorOSUpdateTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    bundlePath_ = temporary() + "/Notification.bundle";
  }
  void TearDown() override {
    for (auto& controller : controllers_) controller->majorOSInstallQueue()->sync([] {});
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();
    controllers_.clear();
    DispatchQueue::globalQueue().barrierSync([] {});
    maps_.clear();
    ServiceTest::TearDown();
  }

  // A controller over a map that holds the installer (at `installerPath`)
  // or nothing.
  UpdateController& controller(bool installerInstalled) {
    std::vector<LedgerSoftwareProductFields> records;
    if (installerInstalled) {
      installerPath_ = makeInstaller();
      records.push_back(storedRecord(installerPath_, std::string(kSH), "1.0", 4242));
    }
    const std::string name = "map-" + std::to_string(maps_.size());
    writeBytes(storePath(name), archivedStore(records));
    maps_.push_back(std::make_unique<SoftwareMap>(options(storePath(name), false)));
    maps_.back()->waitUntilIdle();
    VendStoreClient client = VendStoreClient::fromDictionary(
        {{"identifier", "major-client-" + std::to_string(maps_.size())}, {"clientType", 0}});
    center_ = UserNotificationCenter::makeForTesting(
        "com.orvane.larderd", UserNotificationCenter::kSystemCenter,
        temporary() + "/notifications-" + std::to_string(maps_.size()) + ".plist");
    controllers_.push_back(UpdateController::make(client, *maps_.back(), center_));
    controllers_.back()->setAvailableDiskSpaceForTesting([this] { return freeSpace_.load(); });
    return *controllers_.back();
  }

  // An installer application whose program writes its arguments to a file.
  std::string makeInstaller() {
    const std::string path = rootApplications() + "/Install Next OS.app";
    fs::create_directories(path + "/bin");
    writePlist(path + "/bundle.plist", PlistDictionary{{"HostBundleIdentifier", std::string(kSH)},
                                                       {"HostBundleExecutable", "installer"}});
    writeText(path + "/bin/installer", "#!/bin/sh\necho \"$@\" > \"" + argumentsFile() +
                                           ".part\" && mv \"" + argumentsFile() + ".part\" \"" +
                                           argumentsFile() + "\"\n");
    ::chmod((path + "/bin/installer").c_str(), 0755);
    return path;
  }
  [[nodiscard]] std::string argumentsFile() const { return temporary() + "/installer-arguments"; }

  // The notification bundle, with texts for the two kinds of
  // notification unless told otherwise.
  void writeNotificationBundle(const PlistDictionary& info, bool withStrings = true) {
    fs::create_directories(bundlePath_ + "/resources");
    writePlist(bundlePath_ + "/bundle.plist", info);
    if (!withStrings) return;
    PlistDictionary strings;
    for (std::string_view type : {kAutoDownloaded, kAvailable}) {
      const std::string prefix = std::string(type) + ".";
      strings[prefix + "Title"] = "Title of " + std::string(type);
      strings[prefix + "InformativeText"] = "Text";
      strings[prefix + "OtherButtonText"] = "Other";
    }
    strings[std::string(kAutoDownloaded) + ".ActionButtonText"] = "Details";
    strings[std::string(kAutoDownloaded) + ".BadgeKey"] = "NextOS";
    writePlist(bundlePath_ + "/resources/Localizable.strings", strings);
    writeText(bundlePath_ + "/resources/NextOS.icns", "icon");
  }

  static PlistDictionary fullInfo(PlistDictionary extra = {}) {
    PlistDictionary info{{"SHBundleIdentifier", std::string(kSH)},
                         {"SysupTags", PlistArray{"next-os"}},
                         {"FreeSpaceRequired", std::uint64_t{1000}},
                         {"ItemID", std::uint64_t{4242}}};
    for (auto& [key, value] : extra) info[key] = value;
    return info;
  }

  // A state whose evaluation is due.
  PlistDictionary dueState(PlistDictionary extra = {}) const {
    PlistDictionary state{{"BundlePath", bundlePath_}, {"EvaluationDate", PlistDate{1000}}};
    for (auto& [key, value] : extra) state[key] = value;
    return state;
  }

  // Runs `work` on the install queue and waits until it and what it
  // submitted in turn (posts, starts) have run.
  static void onQueue(UpdateController& updates, const std::function<void()>& work) {
    updates.majorOSInstallQueue()->sync(work);
    for (int i = 0; i < 3; ++i) updates.majorOSInstallQueue()->sync([] {});
  }
  static void evaluate(UpdateController& updates) {
    onQueue(updates, [&] { updates.checkMajorOSUpdateStatus(); });
  }
  void announce(UpdateController& updates) {
    onQueue(updates, [&] { updates.majorOSUpdateAvailableWithInfoBundlePath(bundlePath_); });
  }

  [[nodiscard]] std::vector<std::string> postedTypes() const {
    std::vector<std::string> types;
    for (const UserNotification& n : center_->deliveredNotifications()) {
      auto type = n.userInfo.find("Type");
      if (type != n.userInfo.end() && type->second.string())
        types.push_back(*type->second.string());
    }
    return types;
  }

  static void setPreference(std::string_view key, PlistValue value, std::string_view domain,
                            PreferenceScope scope) {
    ASSERT_TRUE(PreferenceStore::setValue(key, std::move(value), domain, scope));
  }

  std::string bundlePath_;
  std::string installerPath_;
  std::atomic<std::uint64_t> freeSpace_{1u << 30u};
  std::shared_ptr<UserNotificationCenter> center_;
  std::vector<std::unique_ptr<SoftwareMap>> maps_;
  std::vector<std::shared_ptr<UpdateController>> controllers_;
};

// A delay of 0 or less evaluates at once, without a report: the bundle
// without tags makes that first evaluation fail, which counts a retry.
TEST_F(MajorOSUpdateTest, TheDelayComesFromThePreferenceThenTheBundleThenAWeek) {
  struct Case {
    const char* name;
    PlistValue preference;
    PlistValue maximum;
    bool atOnce;
    double longestWait;
  } const cases[] = {
      {"preference 0", std::int64_t{0}, std::int64_t{1000}, true, 0},
      {"bundle -1", PlistValue(), std::int64_t{-1}, true, 0},
      {"bundle 100", PlistValue(), std::int64_t{100}, false, 100},
      {"none", PlistValue(), PlistValue(), false, 604800},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    setPreference(kDefaultsMajorOSUpdateNotificationDelayKey, c.preference, kDaemonDefaultsID,
                  PreferenceScope::User);
    PlistDictionary info{{"SHBundleIdentifier", std::string(kSH)},
                         {"ReminderIntervals", PlistArray{60.0}}};
    if (!c.maximum.isNull()) info["MaximumNotificationDelay"] = c.maximum;
    writeNotificationBundle(info);
    UpdateController& updates = controller(false);
    LogCapture log;
    const double before = nowSeconds();
    announce(updates);
    const PlistDictionary state = majorState();
    ASSERT_TRUE(PlistValue(state)["EvaluationDate"].date()) << log.dump();
    const double date = PlistValue(state)["EvaluationDate"].date()->secondsSince1970;
    EXPECT_EQ(*PlistValue(state)["BundlePath"].string(), bundlePath_);
    EXPECT_EQ(PlistValue(state)["RemainingReminders"], PlistValue(PlistArray{60.0}));
    EXPECT_GE(date, before - 1);
    EXPECT_LT(date, nowSeconds() + c.longestWait);
    EXPECT_EQ(PlistValue(state)["EvaluationRetryCount"].int64Value(), c.atOnce ? 1 : 0);
    EXPECT_EQ(log.countContaining("Delay was set to 0. Triggering evaluation now."),
              c.atOnce ? 1U : 0U);
    EXPECT_EQ(log.countContaining("Setting date to evaluate major OS update to"),
              c.atOnce ? 0U : 1U);
  }
}

// What an announcement ignores leaves the old state as it was; one it
// takes starts over and keeps nothing of it.
TEST_F(MajorOSUpdateTest, AnAnnouncementIsIgnoredOrStartsOver) {
  const PlistDictionary old{{"BundlePath", "/old"},
                            {"DownloadState", "Finished"},
                            {"EvaluationRetryCount", std::int64_t{2}},
                            {"DaemonDownload", PlistDictionary{{"ItemID", std::uint64_t{9}}}}};
  struct Case {
    const char* name;
    std::optional<PlistDictionary> info;  // no bundle folder when absent
    bool installerInstalled;
    const char* logged;
  } const cases[] = {
      {"no bundle", std::nullopt, false, "ERROR: Bundle not found for major OS update at path"},
      {"nothing essential", PlistDictionary{{"ItemID", std::uint64_t{1}}}, false,
       "ERROR: Bundle for major OS update is missing essential information. Ignoring. "},
      {"already installed", fullInfo(), true,
       "specified a bundleID that is already in SoftwareMap (com.example.setupherald)"},
      {"only tags", PlistDictionary{{"SysupTags", PlistArray{"next-os"}}}, false,
       "Setting date to evaluate major OS update to"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    fs::remove_all(bundlePath_);
    if (c.info) writeNotificationBundle(*c.info);
    setMajorState(old);
    UpdateController& updates = controller(c.installerInstalled);
    LogCapture log;
    announce(updates);
    EXPECT_EQ(log.countContaining(c.logged), 1U) << log.dump();
    const bool taken = std::string_view(c.name) == "only tags";
    if (taken) {
      PlistDictionary state = majorState();
      EXPECT_EQ(state.size(), 2U) << PropertyListSerialization::writeXml(PlistValue(state));
      EXPECT_TRUE(state.contains("EvaluationDate"));
      EXPECT_EQ(*PlistValue(state)["BundlePath"].string(), bundlePath_);
    } else {
      EXPECT_EQ(majorState(), old);
    }
  }
  LogCapture log;
  onQueue(*controllers_.back(),
          [&] { controllers_.back()->majorOSUpdateAvailableWithInfoBundlePath(std::nullopt); });
  EXPECT_EQ(log.countContaining("ERROR: BundlePath not specified for major OS update. Ignoring."),
            1U);
}

// Each row of the evaluation, with automatic downloads switched off so that
// the decision to download shows as the notification it falls back to.
TEST_F(MajorOSUpdateTest, TheEvaluationTakesTheFirstRowThatFits) {
  setPreference(kDefaultsAutomaticDownloadKey, false, kSoftwareUpdateDefaultsID,
                PreferenceScope::App);
  writeNotificationBundle(fullInfo());
  struct Case {
    const char* name;
    bool installed;
    std::optional<std::string> downloadState;
    bool token;
    bool cleared;
    std::optional<std::string> posted;
    std::optional<std::pair<std::string, std::string>> trace;
  } const cases[] = {
      {"installed finished", true, "Finished", true, false, std::string(kAutoDownloaded),
       std::pair{"Notify", "Re-notify update is downloaded"}},
      {"installed started", true, "Started", false, false, std::string(kAutoDownloaded),
       std::pair{"Notify", "Notify update is downloaded"}},
      {"installed started with token", true, "Started", true, true, std::nullopt,
       std::pair{"None", "Manually downloaded"}},
      {"installed by hand", true, std::nullopt, false, true, std::nullopt,
       std::pair{"None", "Manually downloaded"}},
      {"deleted", false, "Finished", false, true, std::nullopt,
       std::pair{"None", "Automatically downloaded and moved"}},
      {"still downloading", false, "Started", true, false, std::nullopt, std::nullopt},
      {"interrupted", false, "Started", false, false, std::string(kAvailable),
       std::pair{"Notify", "Opted out"}},
      {"failed", false, "Failed", true, false, std::string(kAvailable),
       std::pair{"Notify", "Opted out"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    PlistDictionary extra;
    if (c.downloadState) extra["DownloadState"] = *c.downloadState;
    const PlistDictionary before = dueState(extra);
    setMajorState(before);
    UpdateController& updates = controller(c.installed);
    if (c.token) updates.setMajorOSInstallCancelToken("token");
    const std::size_t tracesBefore = receivedTraces().size();
    LogCapture log;
    evaluate(updates);
    const PlistDictionary state = majorState();
    if (c.cleared) {
      EXPECT_TRUE(state.empty()) << PropertyListSerialization::writeXml(PlistValue(state));
    } else if (c.posted) {
      // Without reminders the date goes: evaluation ends.
      EXPECT_FALSE(state.contains("EvaluationDate"));
      EXPECT_EQ(*PlistValue(state)["BundlePath"].string(), bundlePath_);
    } else {
      EXPECT_EQ(state, before);
      EXPECT_EQ(log.countContaining("the update is still downloading. Letting it continue."), 1U);
    }
    EXPECT_EQ(postedTypes(),
              c.posted ? std::vector<std::string>{*c.posted} : std::vector<std::string>{});
    const std::vector<nlohmann::json> written = receivedTraces();
    ASSERT_EQ(written.size(), tracesBefore + (c.trace ? 1 : 0));
    if (c.trace) {
      EXPECT_EQ(written.back()["action"], c.trace->first);
      EXPECT_EQ(written.back()["reason"], c.trace->second);
      EXPECT_EQ(written.back()["item_id"], std::string(kSH));
    }
  }
  // The posted notification carries the bundle's texts and icon.
  const std::vector<UserNotification> shown = center_->deliveredNotifications();
  ASSERT_EQ(shown.size(), 1U);
  EXPECT_EQ(shown[0].title, "Title of UpdateAvailableForDownloadNotification");
  EXPECT_FALSE(shown[0].hasActionButton);
  EXPECT_EQ(shown[0].otherButtonTitle, "Other");
  EXPECT_EQ(shown[0].source(), "MajorOSUpdate");
}

// The automatic download end to end: the notification at the finish, one
// after each of two intervals, then the date is gone and evaluation stops.
TEST_F(MajorOSUpdateTest, ADownloadedUpdateRemindsOncePerIntervalThenStops) {
  offerOSUpdates({PlistDictionary{{"productKey", "NEXT-OS"},
                                  {"title", "Next OS"},
                                  {"versionString", "2"},
                                  {"tags", PlistArray{"next-os", "installer"}}},
                  PlistDictionary{{"productKey", "OTHER"}, {"title", "Other"}}});
  writeNotificationBundle(fullInfo({{"ReminderIntervals", PlistArray{0.05, 0.05}}}));
  setPreference(kDefaultsMajorOSUpdateNotificationDelayKey, std::int64_t{0}, kDaemonDefaultsID,
                PreferenceScope::User);
  // The installer is not there when the download starts.
  UpdateController& downloader = controller(false);
  LogCapture log;
  announce(downloader);
  ASSERT_TRUE(eventually([] { return PlistValue(majorState())["DownloadState"] == "Finished"; }))
      << log.dump();
  EXPECT_EQ(log.countContaining("Finished installing automatic Major OS Update NEXT-OS"), 1U);
  EXPECT_FALSE(downloader.majorOSInstallCancelToken());
  ASSERT_TRUE(eventually([&] { return postedTypes().size() == 1; }));
  EXPECT_EQ(postedTypes()[0], kAutoDownloaded);
  EXPECT_EQ(PlistValue(majorState())["RemainingReminders"], PlistValue(PlistArray{0.05}));
  const std::vector<nlohmann::json> downloadTraces = receivedTraces();
  ASSERT_EQ(downloadTraces.size(), 1U);
  EXPECT_EQ(downloadTraces[0]["reason"], "Automatically downloading");

  // Now it is installed; each report evaluates once its date has passed.
  UpdateController& reporter = controller(true);
  for (const char* reminder : {"first", "second"}) {
    SCOPED_TRACE(reminder);
    ASSERT_TRUE(eventually([&] {
      reporter.majorOSInstallQueue()->async([&] { reporter.checkMajorOSUpdateStatus(); });
      for (int i = 0; i < 3; ++i) reporter.majorOSInstallQueue()->sync([] {});
      return receivedTraces().size() == (std::string_view(reminder) == "first" ? 2U : 3U);
    }));
    EXPECT_EQ(receivedTraces().back()["reason"], "Re-notify update is downloaded");
    EXPECT_EQ(postedTypes(), std::vector<std::string>{std::string(kAutoDownloaded)});
  }
  EXPECT_FALSE(majorState().contains("EvaluationDate"));
  EXPECT_FALSE(majorState().contains("RemainingReminders"));
  evaluate(reporter);
  EXPECT_EQ(receivedTraces().size(), 3U);
  EXPECT_EQ(PlistValue(majorState())["DownloadState"], "Finished");
}

// Two updates match the tags: five failed evaluations are counted, the
// sixth clears the state. A framework that does not answer in time fails
// an evaluation the same way.
TEST_F(MajorOSUpdateTest, FailedTagLookupsAreRetriedFiveTimes) {
  offerOSUpdates({PlistDictionary{{"productKey", "A"}, {"tags", PlistArray{"next-os"}}},
                  PlistDictionary{{"productKey", "B"}, {"tags", PlistArray{"next-os"}}}});
  writeNotificationBundle(fullInfo());
  setMajorState(dueState());
  UpdateController& updates = controller(false);
  LogCapture log;
  for (std::int64_t retry = 1; retry <= 5; ++retry) {
    evaluate(updates);
    EXPECT_EQ(PlistValue(majorState())["EvaluationRetryCount"].int64Value(), retry);
  }
  EXPECT_EQ(log.countContaining("Sysup matched more than one update for the tags supplied for a "
                                "major OS update automatic download. Will retry later. Updates: "),
            5U)
      << log.dump();
  evaluate(updates);
  EXPECT_TRUE(majorState().empty());
  EXPECT_TRUE(
      log.hasOnce("UpdateController: Major OS Update: Too many evaluation retries. "
                  "Disabling."));
  EXPECT_TRUE(receivedTraces().empty());

  setMajorState(dueState());
  updates.setMajorOSUpdateWaitsForTesting(std::chrono::milliseconds(50),
                                          std::chrono::milliseconds(0));
  // A barrier holds the global queue, where the framework answers.
  auto release = std::make_shared<std::promise<void>>();
  DispatchQueue::globalQueue().barrierAsync(
      [held = release->get_future().share()] { held.wait(); });
  evaluate(updates);
  release->set_value();
  EXPECT_EQ(log.countContaining("Tags supplied for Major OS Update were not evaluated by Sysup in "
                                "time. Will retry later."),
            1U);
  EXPECT_EQ(PlistValue(majorState())["EvaluationRetryCount"].int64Value(), 1);
}

// "FreeSpaceRequired" absent counts as 0, and room equal to it is enough:
// both go on to the tag lookup (no match here, a retry). More than the room
// notifies instead.
TEST_F(MajorOSUpdateTest, TheDiskTestLetsEqualRoomThrough) {
  struct Case {
    const char* name;
    PlistValue required;
    std::uint64_t free;
    bool enough;
  } const cases[] = {{"absent", PlistValue(), 0, true},
                     {"equal", std::uint64_t{5000}, 5000, true},
                     {"one more", std::uint64_t{5001}, 5000, false}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    PlistDictionary info = fullInfo();
    info.erase("FreeSpaceRequired");
    if (!c.required.isNull()) info["FreeSpaceRequired"] = c.required;
    writeNotificationBundle(info);
    setMajorState(dueState());
    UpdateController& updates = controller(false);
    freeSpace_ = c.free;
    LogCapture log;
    evaluate(updates);
    EXPECT_EQ(log.countContaining("Sysup couldn't match an update for the tags supplied"),
              c.enough ? 1U : 0U);
    EXPECT_EQ(PlistValue(majorState())["EvaluationRetryCount"].int64Value(), c.enough ? 1 : 0);
    if (!c.enough) {
      EXPECT_TRUE(
          log.hasOnce("UpdateController: Insufficient disk space (5000) to automatically "
                      "download and install major OS update (5001 required; 1 more "
                      "needed). Notifying instead.",
                      1));
      EXPECT_EQ(postedTypes(), std::vector<std::string>{std::string(kAvailable)});
      EXPECT_EQ(receivedTraces().back()["reason"], "Low disk space");
    }
  }
}

// The managed path: an installer that is there goes straight to the
// install service; one that is not is fetched first, and the status shows
// the install's progress and end.
TEST_F(MajorOSUpdateTest, TheManagedPathFetchesTheInstallerAndHandsItOver) {
  MainLoopThread mainLoop;
  auto requests = [] {
    return PlistValue(PlatformStateFile(LedgerMajorOSInstallService::stateFilePath())
                          .read())["installationRequests"];
  };
  UpdateController& present = controller(true);
  present.downloadSetupHeraldForTags(std::vector<std::string>{"next-os"}, std::string(kSH));
  ASSERT_TRUE(eventually([&] { return requests().array() && requests().array()->size() == 1; }));
  EXPECT_EQ(*requests().array()->at(0)["setupHerald"].string(), installerPath_);
  EXPECT_EQ(*requests().array()->at(0)["targetMountPoint"].string(), "/");
  EXPECT_FALSE(requests().array()->at(0)["authorized"].boolValue());
  EXPECT_EQ(present.statusForSetupHeraldDownload(),
            (PlistDictionary{{"bundleIdentifier", std::string(kSH)}}));

  offerOSUpdates(
      {PlistDictionary{
           {"productKey", "NEXT-OS"}, {"tags", PlistArray{"next-os"}}, {"installSeconds", 0.5}},
       PlistDictionary{
           {"productKey", "BROKEN"}, {"tags", PlistArray{"broken-os"}}, {"installFails", true}}});
  UpdateController& absent = controller(false);
  absent.setMajorOSUpdateWaitsForTesting(UpdateController::kMajorOSTagLookupTimeout,
                                         std::chrono::milliseconds(20));
  LogCapture log;
  absent.downloadSetupHeraldForTags(std::vector<std::string>{"next-os"}, std::string(kSH));
  auto stateIs = [&](std::string_view expected) {
    return eventually(
        [&] { return PlistValue(absent.statusForSetupHeraldDownload())["state"] == expected; });
  };
  ASSERT_TRUE(stateIs("installing")) << log.dump();
  ASSERT_TRUE(stateIs("installed")) << log.dump();
  EXPECT_EQ(PlistValue(absent.statusForSetupHeraldDownload())["progress"].doubleValue(), 100.0);
  // The installed installer is not among this map's products.
  ASSERT_TRUE(eventually([&] {
    return log.countContaining(
               "ERROR: Could not find path for SetupHerald that we should have just installed") ==
           1;
  })) << log.dump();
  EXPECT_EQ(requests().array()->size(), 1U);

  absent.downloadSetupHeraldForTags(std::vector<std::string>{"broken-os"}, std::string(kSH));
  ASSERT_TRUE(stateIs("failed"));
  EXPECT_FALSE(PlistValue(absent.statusForSetupHeraldDownload())["error"].string()->empty());

  absent.downloadSetupHeraldForTags(std::nullopt, std::string(kSH));
  EXPECT_EQ(log.countContaining("MDM Major OS Update Install: Parameters not specified"), 1U);
}

// Which button means what depends on the kind of notification.
TEST_F(MajorOSUpdateTest, TheAnswersToTheNotificationsOpenTheStoreOrTheInstaller) {
  writeNotificationBundle(fullInfo());
  setMajorState({{"BundlePath", bundlePath_}});
  UpdateController& updates = controller(true);
  auto launches = [] {
    const PlistValue list =
        PlistValue(PlatformStateFile(LedgerQuaymartLauncher::stateFilePath()).read())["launches"];
    std::vector<std::string> urls;
    if (list.array()) {
      for (const PlistValue& launch : *list.array()) urls.push_back(*launch["url"].string());
    }
    return urls;
  };
  auto allowed = [] {
    const PlistValue list =
        PlistValue(PlatformStateFile(LedgerMajorOSInstallService::stateFilePath())
                       .read())["installAllowedDates"];
    return list.array() ? list.array()->size() : 0U;
  };
  auto notification = [](std::string_view type) {
    UserNotification n;
    n.userInfo = {{"Source", "MajorOSUpdate"}, {"Type", std::string(type)}};
    return n;
  };
  const std::string storePage = "quaymart://apps.quaymart.larder/app/id4242?mt=12";
  struct Case {
    const char* name;
    bool dismiss;
    std::string_view type;
    std::vector<std::string> launchesAfter;
    std::size_t allowedAfter;
    std::optional<std::pair<std::string, std::string>> trace;
  } const cases[] = {
      {"details", false, kAutoDownloaded, {storePage}, 0, std::pair{"Details", "4242"}},
      {"available dismissed", false, kAvailable, {storePage}, 0, std::nullopt},
      {"available details", true, kAvailable, {storePage, storePage}, 0, std::nullopt},
      {"install",
       true,
       kAutoDownloaded,
       {storePage, storePage},
       0,
       std::pair{"Install", std::string(kSH)}},
      {"pending activated", false, kPending, {storePage, storePage}, 1, std::nullopt},
      {"pending dismissed", true, kPending, {storePage, storePage}, 2, std::nullopt},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::size_t tracesBefore = activatedTraces().size();
    if (c.dismiss) {
      updates.didDismissMajorOSUpdateNotification(notification(c.type));
    } else {
      updates.didActivateMajorOSUpdateNotification(notification(c.type));
    }
    EXPECT_EQ(launches(), c.launchesAfter);
    EXPECT_EQ(allowed(), c.allowedAfter);
    const std::vector<nlohmann::json> written = activatedTraces();
    ASSERT_EQ(written.size(), tracesBefore + (c.trace ? 1 : 0));
    if (c.trace) {
      EXPECT_EQ(written.back()["action"], c.trace->first);
      EXPECT_EQ(written.back()["item_id"], c.trace->second);
    }
  }
  ASSERT_TRUE(eventually([&] { return fs::exists(argumentsFile()); }));
  std::ifstream arguments(argumentsFile());
  std::string line;
  std::getline(arguments, line);
  EXPECT_EQ(line, "--streamlined");
}

// A purchase by hand of the item we meant to download takes it over; any
// other item is none of our business.
TEST_F(MajorOSUpdateTest, APurchaseByHandTakesOverOnlyTheSameItem) {
  UpdateController& updates = controller(false);
  LogCapture log;
  setMajorState({{"ScheduledAutomaticDownload", PlistDictionary{{"ItemID", std::uint64_t{7}}}}});
  EXPECT_FALSE(updates.willInteractivelyPurchaseItemIdentifier(8));
  EXPECT_TRUE(updates.willInteractivelyPurchaseItemIdentifier(7));
  EXPECT_EQ(log.countContaining("manually purchasing the Major OS Update we had scheduled"), 1U);

  setMajorState({{"CurrentAutomaticDownload", PlistDictionary{{"ItemID", std::uint64_t{7}}}},
                 {"PastDownloads", PlistDictionary{{"8", true}, {"9", true}}}});
  EXPECT_FALSE(updates.willInteractivelyPurchaseItemIdentifier(8));
  EXPECT_EQ(log.countContaining("Pausing it so that the user's purchase"), 0U);
  EXPECT_TRUE(updates.willInteractivelyPurchaseItemIdentifier(7));
  EXPECT_EQ(log.countContaining("Pausing it so that the user's purchase"), 1U);

  onQueue(updates, [&] { updates.didInteractivelyPurchaseItemIdentifier(7, false); });
  EXPECT_TRUE(majorState().contains("CurrentAutomaticDownload"));
  onQueue(updates, [&] { updates.didInteractivelyPurchaseItemIdentifier(8, false); });
  EXPECT_EQ(PlistValue(majorState())["PastDownloads"], PlistValue(PlistDictionary{{"9", true}}));
  onQueue(updates, [&] { updates.didInteractivelyPurchaseItemIdentifier(7, true); });
  EXPECT_FALSE(majorState().contains("CurrentAutomaticDownload"));
}

// As root (the daemon mode) a downloaded installer is handed to the install
// service; a user process is told to leave its launch alone only while an
// automatic download is ours. The tests run as whichever they are.
TEST_F(MajorOSUpdateTest, ADownloadedInstallerIsHandedOverByTheDaemonOnly) {
  UpdateController& updates = controller(false);
  const PlistDictionary daemonDownload{{"ItemID", std::uint64_t{7}}};
  setMajorState({{"DaemonDownload", daemonDownload}});
  const bool root = ::geteuid() == 0;
  EXPECT_EQ(updates.majorOSUpdateHasDownloadedToPath("/Applications/Install.app"), root);
  const PlistValue requests =
      PlistValue(PlatformStateFile(LedgerMajorOSInstallService::stateFilePath())
                     .read())["installationRequests"];
  if (root) {
    EXPECT_TRUE(majorState().empty());
    ASSERT_TRUE(requests.array());
    EXPECT_EQ(*requests.array()->at(0)["setupHerald"].string(), "/Applications/Install.app");
  } else {
    EXPECT_TRUE(majorState().contains("DaemonDownload"));
    EXPECT_FALSE(requests.array());
    setMajorState({{"CurrentAutomaticDownload", daemonDownload}});
    EXPECT_TRUE(updates.majorOSUpdateHasDownloadedToPath("/Applications/Install.app"));
  }
}

// The install service keeps the state where the controller reads it, and
// answers for the agent from its file; an invalidated connection is made
// anew at the next use.
TEST_F(MajorOSUpdateTest, TheInstallServiceStoresTheStateAndSpeaksForTheAgent) {
  UpdateController& updates = controller(false);
  onQueue(updates, [&] {
    updates.majorOSUpdateWillBeDownloadedByDaemonWithItemIdentifier(77, PlistValue("v3"));
  });
  const PlistValue download = PlistValue(majorState())["DaemonDownload"];
  EXPECT_EQ(download["ItemID"].uint64Value(), 77U);
  EXPECT_EQ(download["VersionID"], "v3");
  EXPECT_TRUE(download["StartDate"].date());
  LogCapture log;
  updates.daemonDownloadHeartbeat();
  EXPECT_TRUE(log.hasOnce("UpdateController: Heartbeat for MDM-pushed download with itemID: 77"));

  // An app updates notification on screen gives way to the warning.
  UserNotification appUpdates;
  appUpdates.userInfo = {{"Source", "AppUpdate"}};
  center_->deliverNotification(appUpdates);
  updates.managedOSInstallWakeUpReceived();
  EXPECT_EQ(center_->deliveredNotifications().size(), 1U) << "no agent, no warning";
  ASSERT_TRUE(PlatformStateFile(LedgerMajorOSInstallService::stateFilePath())
                  .updateDictionary([](PlistDictionary& state) { state["agentIsActive"] = true; }));
  updates.managedOSInstallWakeUpReceived();
  ASSERT_EQ(center_->deliveredNotifications().size(), 1U);
  const UserNotification warning = center_->deliveredNotifications()[0];
  EXPECT_EQ(*PlistValue(warning.userInfo)["Type"].string(), kPending);
  EXPECT_FALSE(warning.hasActionButton);
  EXPECT_EQ(warning.otherButtonTitle, "Restart");

  auto first = updates.installDaemonConnection();
  EXPECT_EQ(updates.installDaemonConnection(), first);
  auto service = std::dynamic_pointer_cast<LedgerMajorOSInstallService>(first);
  ASSERT_TRUE(service);
  EXPECT_EQ(service->serviceName(), "com.orvane.cellard");
  EXPECT_EQ(service->options(), 4096U);
  service->invalidate();
  EXPECT_TRUE(log.hasOnce("UpdateController: Connection to Install Service was invalidated"));
  EXPECT_FALSE(first->writeMajorOSUpdatePrefs({}));
  auto second = updates.installDaemonConnection();
  EXPECT_NE(second, first);
  EXPECT_TRUE(second->writeMajorOSUpdatePrefs({{"BundlePath", "/b"}}));
  EXPECT_EQ(majorState(), (PlistDictionary{{"BundlePath", "/b"}}));
}

// Without a text of the three it needs, the notification is not posted.
TEST_F(MajorOSUpdateTest, ANotificationWithoutItsTextsIsNotPosted) {
  writeNotificationBundle(fullInfo(), false);
  setPreference(kDefaultsAutomaticDownloadKey, false, kSoftwareUpdateDefaultsID,
                PreferenceScope::App);
  setMajorState(dueState());
  UpdateController& updates = controller(false);
  LogCapture log;
  evaluate(updates);
  EXPECT_TRUE(center_->deliveredNotifications().empty());
  EXPECT_TRUE(
      log.hasOnce("UpdateController: ERROR: Unable to show major OS update notification "
                  "due to missing strings: (null) : (null) : (null) : (null)",
                  1));
  // With the texts, the icon comes from the badge's resource.
  writeNotificationBundle(fullInfo());
  setMajorState(dueState({{"DownloadState", "Finished"}}));
  UpdateController& installed = controller(true);
  evaluate(installed);
  ASSERT_EQ(center_->deliveredNotifications().size(), 1U);
  EXPECT_EQ(center_->deliveredNotifications()[0].imageURL, bundlePath_ + "/resources/NextOS.icns");
  EXPECT_EQ(center_->deliveredNotifications()[0].actionButtonTitle, "Details");
}

}  // namespace
}  // namespace larder::testing
