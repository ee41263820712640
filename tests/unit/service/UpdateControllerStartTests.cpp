// Starting updates: the rights, power and disk checks in their order, the
// power dialog that plugging in closes, the wait on the free space request,
// installs by tags and their fallback purchase, and cancelling OS updates.
#include <gtest/gtest.h>

#include <cstdio>
#include <future>

#include "ServiceTestSupport.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/FreeSpaceRequest.h"
#include "store-runtime/host/LedgerAuthorizationService.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "tests/unit/AnsweringDialogPresenter.h"
#include "tests/unit/OSUpdateOffers.h"
#include "update-controller/UpdateController.h"

namespace larder::testing {
namespace {

using namespace std::chrono_literals;
constexpr auto kGenerous = 20s;

// Keeps each dialog up until the service dismisses it, as a person who
// never answers would.
class HoldingDialogPresenter final : public VendDialogPresenter {
 public:
  void present(const VendDialog& dialog, Reply reply) override {
    std::lock_guard lock(mutex_);
    shown_.push_back(dialog.toDictionary());
    waiting_.emplace_back(std::string(dialog.identifier()), std::move(reply));
  }
  void dismiss(std::string_view identifier, std::int64_t exitCode) override {
    Reply reply;
    {
      std::lock_guard lock(mutex_);
      for (auto it = waiting_.begin(); it != waiting_.end(); ++it) {
        if (it->first != identifier) continue;
        reply = std::move(it->second);
        waiting_.erase(it);
        dismissedWith_.push_back(exitCode);
        break;
      }
    }
    if (reply) reply(VendDialogAnswer{exitCode, {}});
  }
  std::size_t shownCount() {
    std::lock_guard lock(mutex_);
    return shown_.size();
  }
  std::vector<std::int64_t> dismissedWith() {
    std::lock_guard lock(mutex_);
    return dismissedWith_;
  }

 private:
  std::mutex mutex_;
  std::vector<PlistDictionary> shown_;
  std::vector<std::pair<std::string, Reply>> waiting_;
  std::vector<std::int64_t> dismissedWith_;
};

// The process's main run loop, served by a thread for the test's length:
// the power observation polls on it.
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

class RecordingDelegate final : public VendUpdateDelegate {
 public:
  void appUpdateFinishedPurchase(const LedgerUpdateRef& update, bool success,
                                 const OptionalError& error,
                                 const std::optional<TillPurchaseResponse>&) override {
    std::lock_guard lock(mutex_);
    calls.push_back({update->itemIdentifierValue(), success, error});
  }
  struct Call {
    std::uint64_t item;
    bool success;
    OptionalError error;
  };
  std::mutex mutex_;
  std::vector<Call> calls;
};

class RecordingProgressObserver final : public VendOSUpdateProgressObserver {
 public:
  void osUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& osUpdates,
                                const LedgerSoftwareUpdateStatus& progress) override {
    std::lock_guard lock(mutex_);
    for (const auto& update : osUpdates) keys.push_back(update.productKey());
    errors.push_back(progress.error());
  }
  std::mutex mutex_;
  std::vector<std::string> keys;
  std::vector<std::optional<VendError>> errors;
};

class UpdateControllerStartTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    map_.emplace(options(storePath(), false));
    map_->waitUntilIdle();
    controller_ = UpdateController::make(
        VendStoreClient::fromDictionary({{"identifier", "test-start-client"}}), *map_);
  }
  void TearDown() override {
    VendRuntime::shared()->setDialogPresenter(nullptr);
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();
    controller_.reset();
    DispatchQueue::globalQueue().barrierSync([] {});
    map_.reset();
    ServiceTest::TearDown();
  }

  void writeSupply(const std::string& supply, const std::string& attribute,
                   const std::string& text) const {
    ASSERT_TRUE(FileIO::writeAtomically(
        temporary() + "/root/sys/class/power_supply/" + supply + "/" + attribute, text + "\n"));
  }
  // A machine with an adapter and one battery at `capacityLevel`.
  void setPower(bool onMains, const std::string& capacityLevel) const {
    writeSupply("AC", "type", "Mains");
    writeSupply("AC", "online", onMains ? "1" : "0");
    writeSupply("BAT0", "type", "Battery");
    writeSupply("BAT0", "capacity_level", capacityLevel);
  }
  static void setFreeSpace(std::uint64_t freeBytes, double timeoutSeconds = 0.3) {
    ASSERT_TRUE(PlatformStateFile::named(FreeSpaceRequest::kStateFileName)
                    .updateDictionary([&](PlistDictionary& state) {
                      state = {{"freeBytes", freeBytes}, {"timeoutSeconds", timeoutSeconds}};
                    }));
  }
  // Two OS updates of 1000 bytes each, offered and found by a scan; both
  // carry the tag "notes", and each its own product key as a tag.
  static UpdateController::OSUpdateList offeredOSUpdates(PlistDictionary extra = {}) {
    PlistArray catalog;
    for (const char* key : {"A", "B"}) {
      PlistDictionary entry{{"productKey", key},
                            {"title", std::string("Update ") + key},
                            {"versionString", "1"},
                            {"downloadSize", 1000},
                            {"tags", PlistArray{"notes", key}}};
      for (const auto& [name, value] : extra) entry[name] = value;
      catalog.emplace_back(std::move(entry));
    }
    offerOSUpdates(catalog);
    return SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
  }
  static LedgerUpdateRef appUpdate(std::uint64_t item) {
    return LedgerUpdate::initWithDictionary({{"ware-id", item},
                                             {"bundle-id", "com.example.app"},
                                             {"version", "2.0"},
                                             {"release-date", PlistDate{1700000000}}});
  }

  std::optional<SoftwareMap> map_;
  std::shared_ptr<UpdateController> controller_;
};

TEST_F(UpdateControllerStartTest, PowerThenDiskAreCheckedOnlyForOSUpdates) {
  struct Case {
    const char* name;
    bool onMains;
    const char* capacityLevel;
    std::uint64_t freeBytes;
    bool doNotCheckDisk;
    bool osUpdates;
    std::int64_t dialogAnswer;
    std::int64_t expectedCode;  // 0: the checks pass
    const char* expectedTitle;
    bool dialogShown;
    bool roomAskedFor;
  };
  const Case cases[] = {
      {"app updates alone on low battery and a full disk", false, "Critical", 0, false, false, 0, 0,
       nullptr, false, false},
      {"OS updates on mains still ask for room", true, "Critical", 0, false, true, 0, 11,
       "Disk check failed", false, true},
      {"OS updates on mains with room", true, "Critical", 5000, false, true, 0, 0, nullptr, false,
       true},
      {"plain battery without warning is adequate", false, "Normal", 5000, false, true, 0, 0,
       nullptr, false, true},
      {"low battery and the user declines", false, "Low", 5000, false, true, 2, -128,
       "AC check failed", true, false},
      {"low battery, the user continues, no room", false, "Critical", 0, false, true, 1, 11,
       "Disk check failed", true, true},
      {"the preference skips the platform", true, "Normal", 0, true, true, 0, 0, nullptr, false,
       false},
  };
  const UpdateController::OSUpdateList osUpdates = offeredOSUpdates();
  ASSERT_EQ(osUpdates.size(), 2U);
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    setPower(c.onMains, c.capacityLevel);
    setFreeSpace(c.freeBytes);
    ASSERT_TRUE(PreferenceStore::setValue(kDefaultsDoNotCheckDiskSpaceKey, c.doNotCheckDisk,
                                          kQuaymartDefaultsID, PreferenceScope::User));
    auto dialogs = std::make_shared<AnsweringDialogPresenter>(c.dialogAnswer);
    VendRuntime::shared()->setDialogPresenter(dialogs);
    LogCapture log;

    const Result<void> checked = controller_->canInstallAppUpdates(
        {appUpdate(7001)}, c.osUpdates ? osUpdates : UpdateController::OSUpdateList{}, true);

    EXPECT_EQ(checked ? 0 : checked.error().code, c.expectedCode);
    if (!checked) EXPECT_EQ(checked.error().title(), c.expectedTitle);
    EXPECT_EQ(dialogs->shown().size(), c.dialogShown ? 1U : 0U);
    if (c.dialogShown) {
      EXPECT_EQ(*PlistValue(dialogs->shown()[0])["okButtonString"].string(), "Continue");
    }
    EXPECT_EQ(log.countContaining("FreeSpaceRequest: 2000 bytes wanted") > 0, c.roomAskedFor);
    EXPECT_EQ(log.countContaining("Not checking disk space due to DoNotCheckDiskSpace"),
              c.doNotCheckDisk ? 1U : 0U);
  }
}

// The rights come first: refused, neither the power dialog nor the free
// space request happens. The authorization, once granted, stays for the
// life of the process, so the refusal is tried in a process of its own.
TEST_F(UpdateControllerStartTest, RefusedRightsStopBeforePowerAndDisk) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        ASSERT_TRUE(PlatformStateFile(LedgerAuthorizationService::stateFilePath())
                        .updateDictionary([](PlistDictionary& state) {
                          state = {{"grantedRights", PlistArray{}}, {"interactiveGrant", false}};
                        }));
        const UpdateController::OSUpdateList osUpdates = offeredOSUpdates();
        setPower(false, "Critical");
        setFreeSpace(0);
        auto dialogs = std::make_shared<AnsweringDialogPresenter>(1);
        VendRuntime::shared()->setDialogPresenter(dialogs);
        LogCapture log;
        const Result<void> checked = controller_->canInstallAppUpdates({}, osUpdates, true);
        std::fprintf(stderr, "code=%lld title=%s dialogs=%zu room=%zu\n",
                     static_cast<long long>(checked ? 0 : checked.error().code),
                     checked ? "" : checked.error().title().value_or("").c_str(),
                     dialogs->shown().size(), log.countContaining("FreeSpaceRequest:"));
        std::fflush(stderr);
        // The child ends here, so it tears its own fixture down first.
        TearDown();
        std::_Exit(0);
      },
      ::testing::ExitedWithCode(0), "code=4 title=Authorization failed dialogs=0 room=0");
}

TEST_F(UpdateControllerStartTest, PluggingInClosesThePowerDialogAsContinue) {
  MainLoopThread mainLoop;
  setPower(false, "Critical");
  auto dialogs = std::make_shared<HoldingDialogPresenter>();
  VendRuntime::shared()->setDialogPresenter(dialogs);
  auto answer = std::async(std::launch::async, [&] {
    return controller_->hasAdequatePowerOrUserConfirmsWithCriticalUpdates(false);
  });
  ASSERT_TRUE(eventually([&] { return dialogs->shownCount() == 1; }));
  EXPECT_TRUE(controller_->isObservingPowerSource());
  writeSupply("AC", "online", "1");
  // The observation polls every few seconds.
  ASSERT_EQ(answer.wait_for(LedgerPowerSource::kPollInterval * 3), std::future_status::ready);
  EXPECT_TRUE(answer.get());
  EXPECT_EQ(dialogs->dismissedWith(), std::vector<std::int64_t>{1});
  EXPECT_FALSE(controller_->isObservingPowerSource());
}

// Statuses 2, 3 and 9 are the request under way: only a final status ends
// the wait, and a late 1 still lets the updates through.
TEST_F(UpdateControllerStartTest, TheDiskCheckWaitsThroughStatusesUnderWayForRoom) {
  const UpdateController::OSUpdateList osUpdates = offeredOSUpdates();
  setFreeSpace(10, 60);
  LogCapture log;
  auto checked = std::async(std::launch::async, [&] {
    return controller_->checkAndReclaimFreeDiskSpaceForUpdates(osUpdates);
  });
  ASSERT_TRUE(eventually([&] { return log.countContaining("bytes wanted, status 9") >= 2; }));
  EXPECT_GE(log.countContaining("bytes wanted, status 2"), 2U);
  EXPECT_EQ(log.countContaining("bytes wanted, status 3"), 1U);
  EXPECT_EQ(checked.wait_for(0s), std::future_status::timeout);
  setFreeSpace(5000, 60);
  ASSERT_EQ(checked.wait_for(kGenerous), std::future_status::ready);
  EXPECT_TRUE(checked.get());
}

// A refused start: each app update hears it through the delegate, the OS
// updates through the progress observers, and the handler last, each with
// a cancellation that keeps the check's title.
TEST_F(UpdateControllerStartTest, ARefusedStartReachesDelegateObserversAndHandler) {
  const UpdateController::OSUpdateList osUpdates = offeredOSUpdates();
  setPower(true, "Normal");
  setFreeSpace(0);
  auto delegate = std::make_shared<RecordingDelegate>();
  auto observer = std::make_shared<RecordingProgressObserver>();
  controller_->addOSUpdateProgressObserver(observer);
  std::vector<std::pair<bool, OptionalError>> handled;
  LogCapture log;
  controller_->startAppUpdates(
      std::vector<LedgerUpdateRef>{appUpdate(7001), appUpdate(7002)}, osUpdates, delegate,
      [&](bool success, const OptionalError& error) { handled.emplace_back(success, error); });
  ASSERT_EQ(handled.size(), 1U);
  EXPECT_FALSE(handled[0].first);
  ASSERT_TRUE(handled[0].second);
  EXPECT_EQ(handled[0].second->code, -128);
  EXPECT_EQ(handled[0].second->title(), "Disk check failed");
  ASSERT_EQ(delegate->calls.size(), 2U);
  EXPECT_EQ(delegate->calls[1].item, 7002U);
  EXPECT_FALSE(delegate->calls[1].success);
  EXPECT_EQ(delegate->calls[1].error->code, -128);
  EXPECT_EQ(observer->keys, (std::vector<std::string>{"A", "B"}));
  ASSERT_EQ(observer->errors.size(), 1U);
  EXPECT_EQ(observer->errors[0]->title(), "Disk check failed");
  EXPECT_EQ(log.countContaining("Can not proceed with updates based on pre-install checks"), 1U);
}

TEST_F(UpdateControllerStartTest, TagInstallsFallBackToThePurchaseUnlessOneUpdateMatches) {
  offeredOSUpdates();
  setPower(true, "Normal");
  setFreeSpace(1'000'000);
  TillPurchase fallback = TillPurchase::purchaseWithBuyParameters("itemId=7001");
  struct Outcome {
    bool success;
    std::optional<std::string> identifier;
    OptionalError error;
  };
  struct Case {
    const char* name;
    std::vector<std::string> tags;
    bool withFallback;
    std::int64_t expectedCode;  // 0 when the purchase was made, -1 when the update installs
    const char* expectedLog;
  };
  const Case cases[] = {
      {"two matches with a fallback",
       {"notes"},
       true,
       0,
       "UpdateController: Falling back to purchase since update count 2 != 1"},
      {"two matches without", {"notes"}, false, 27, nullptr},
      {"nothing matches, even after a scan",
       {"unknown"},
       true,
       0,
       "UpdateController: Falling back to purchase since update count 0 != 1"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    std::mutex mutex;
    std::vector<Outcome> outcomes;
    DispatchSemaphore first;
    controller_->startAppInstallWithTags(
        c.tags, c.withFallback ? std::optional(fallback) : std::nullopt,
        [&](bool success, const std::optional<std::string>& identifier,
            const std::optional<TillPurchaseResponse>&, const OptionalError& error) {
          std::lock_guard lock(mutex);
          outcomes.push_back({success, identifier, error});
          first.signal();
        });
    ASSERT_TRUE(first.waitFor(kGenerous));
    DispatchQueue::globalQueue().barrierSync([] {});
    std::lock_guard lock(mutex);
    ASSERT_EQ(outcomes.size(), 1U);
    // The fallback's line exactly once; the run's line starts with its text.
    if (c.expectedCode == -1) {
      EXPECT_EQ(log.countContaining(c.expectedLog), 1U) << log.dump();
    } else if (c.expectedLog) {
      EXPECT_TRUE(log.hasOnce(c.expectedLog));
    }
    if (c.expectedCode == -1) {
      EXPECT_TRUE(outcomes[0].success);
      EXPECT_EQ(outcomes[0].identifier, "B");
      EXPECT_FALSE(outcomes[0].error);
      EXPECT_EQ(log.countContaining("Falling back to purchase"), 0U);
    } else if (c.expectedCode != 0) {
      EXPECT_FALSE(outcomes[0].success);
      ASSERT_TRUE(outcomes[0].error);
      EXPECT_EQ(outcomes[0].error->code, c.expectedCode);
    } else {
      // The purchase was made: without a store it fails with its own error.
      EXPECT_FALSE(outcomes[0].error && outcomes[0].error->code == 27);
      EXPECT_EQ(log.countContaining("Falling back to purchase"), 1U);
    }
  }
}

TEST_F(UpdateControllerStartTest, ACancelSkipsKeysWithoutTokenAndCancelsEachTokenOnce) {
  const UpdateController::OSUpdateList slow = offeredOSUpdates({{"installSeconds", 60}});
  auto& framework = SysupQuaymartUpdateController::sharedUpdateController();
  std::promise<OptionalError> finished;
  const std::optional<std::string> token = framework.startInstallingUpdates(
      slow, nullptr, false, [](const PlistDictionary&, bool, double) {},
      [&](const OptionalError& error) { finished.set_value(error); });
  ASSERT_TRUE(token);
  {
    MutexLock lock(controller_->osUpdateCancelTokens()->mutex);
    controller_->osUpdateCancelTokens()->tokens["A"] = *token;
    controller_->osUpdateCancelTokens()->tokens["B"] = *token;
  }
  LogCapture log;
  controller_->cancelOSUpdatesWithProductKeys({"X", "A", "B"});
  EXPECT_TRUE(
      log.hasOnce("UpdateController cancelOSUpdatesWithProductKeys: No cancelToken for update X"));
  EXPECT_TRUE(log.hasOnce("UpdateController cancelOperation with token " + *token));
  auto outcome = finished.get_future();
  ASSERT_EQ(outcome.wait_for(kGenerous), std::future_status::ready);
  const OptionalError error = outcome.get();
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isCancellation());
}

}  // namespace
}  // namespace larder::testing
