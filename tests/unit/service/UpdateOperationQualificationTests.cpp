// Which app updates a stage run takes on: the switch for automatic updates
// holds back the updates that are not staged yet, and only those.
#include <gtest/gtest.h>

#include "ServiceTestSupport.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"

namespace larder::testing {
namespace {

PlistDictionary queuedUpdate(std::uint64_t item, bool staged) {
  PlistDictionary update{{"ware-id", item},
                         {"bundle-id", "com.example.app" + std::to_string(item)},
                         {"version", "2.0"},
                         {"release-date", PlistDate{1700000000}}};
  if (staged) update[std::string(LedgerUpdate::kIsStagedKey)] = true;
  return update;
}

class UpdateOperationQualificationTest : public ServiceTest {
 protected:
  void TearDown() override {
    if (controller_) controller_->updateQueue()->finishPendingWrites();
    controller_.reset();
    map_.reset();
    ServiceTest::TearDown();
  }

  // The items a stage run qualifies from a queue of items 1 and 3 (staged)
  // and 2 and 4 (not staged).
  std::vector<std::uint64_t> qualifiedByStageRun(bool autoUpdateEnabled, bool userInitiated) {
    EXPECT_TRUE(PreferenceStore::setValue(kDefaultsAutoUpdateEnabledKey, autoUpdateEnabled,
                                          kDaemonDefaultsID));
    const std::string folder = VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID);
    fs::create_directories(folder);
    writeBytes(folder + "/updates.plist",
               PropertyListSerialization::writeBinary(PlistDictionary{
                   {"updates", PlistArray{queuedUpdate(1, true), queuedUpdate(2, false),
                                          queuedUpdate(3, true), queuedUpdate(4, false)}},
                   {"incompatibleUpdates", PlistArray{}}}));
    map_.emplace(options(storePath(), false));
    controller_ = UpdateController::make(
        VendStoreClient::fromDictionary({{"identifier", "test-client"}, {"clientType", 0}}), *map_);
    auto run = std::make_shared<UpdateOperation>(
        controller_->storeClient(), std::weak_ptr<UpdateOperationController>(controller_));
    run->changeSettings([&](UpdateOperationSettings& s) {
      s.shouldCheckForAndStageAppUpdates = true;
      s.userInitiated = userInitiated;
    });
    std::vector<std::uint64_t> items;
    MutexLock lock(UpdateOperation::synchronizationLock());
    for (const LedgerUpdateRef& update : run->appUpdatesToStageOrInstallNow()) {
      items.push_back(update->itemIdentifierValue());
    }
    return items;
  }

  std::optional<SoftwareMap> map_;
  std::shared_ptr<UpdateController> controller_;
};

TEST_F(UpdateOperationQualificationTest, TheAutoUpdateSwitchHoldsBackOnlyUnstagedUpdates) {
  struct Case {
    bool autoUpdateEnabled;
    bool userInitiated;
    std::vector<std::uint64_t> expected;
  };
  const Case cases[] = {
      {true, false, {1, 2, 3, 4}},
      {false, false, {1, 3}},
      {false, true, {1, 2, 3, 4}},  // the user asked: the switch does not apply
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::Message()
                 << "autoUpdate=" << c.autoUpdateEnabled << " userInitiated=" << c.userInitiated);
    EXPECT_EQ(qualifiedByStageRun(c.autoUpdateEnabled, c.userInitiated), c.expected);
    controller_->updateQueue()->finishPendingWrites();
    controller_.reset();
    map_.reset();
  }
}

}  // namespace
}  // namespace larder::testing
