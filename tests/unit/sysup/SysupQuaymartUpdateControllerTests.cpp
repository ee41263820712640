#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <variant>

#include "tests/unit/sysup/SysupTestSupport.h"

namespace larder {
namespace {

using testing::catalogEntry;
using testing::Collector;
using testing::keys;
using testing::productKeysOf;
using UpdateList = SysupQuaymartUpdateController::UpdateList;
using Strings = std::vector<std::string>;

class SysupControllerTest : public testing::SysupTest {
 protected:
  // Runs a scan and returns the progress and finish calls in the order they came.
  struct ScanRecord {
    std::vector<double> progress;
    OptionalError error;
  };
  static ScanRecord scan(bool includingPrerelease) {
    Collector<std::variant<double, OptionalError>> calls;
    controller().startScanningForUpdatesIncludingPrerelease(
        includingPrerelease, false, false, nullptr,
        [&calls](double percent) { calls.add(percent); },
        [&calls](const OptionalError& error) { calls.add(error); });
    using Call = std::variant<double, OptionalError>;
    const auto isFinish = [](const Call& call) {
      return std::holds_alternative<OptionalError>(call);
    };
    std::vector<Call> all = calls.waitUntil(
        [&](const std::vector<Call>& values) { return std::ranges::any_of(values, isFinish); });
    ScanRecord record;
    bool finished = false;
    for (const Call& call : all) {
      EXPECT_FALSE(finished) << "a call after the finish";
      finished = isFinish(call);
      if (finished) record.error = std::get<OptionalError>(call);
      if (!finished) record.progress.push_back(std::get<double>(call));
    }
    return record;
  }

  static PlistArray mixedCatalog() {
    return PlistArray{
        catalogEntry("A", {{"isCritical", true}}),
        catalogEntry("Hidden"),
        catalogEntry("Installed"),
        catalogEntry("Beta", {{"isPrerelease", true}}),
        PlistDictionary{{"title", "no product key"}},
        PlistDictionary{{"productKey", 5}},
        catalogEntry("WrongType", {{"restartRequired", "yes"}}),
        PlistValue("not a dictionary"),
        catalogEntry("A", {{"title", "repeated"}}),
    };
  }
};

struct ScanCase {
  bool includingPrerelease;
  Strings expected;
};

class SysupScanTest : public SysupControllerTest, public ::testing::WithParamInterface<ScanCase> {};

TEST_P(SysupScanTest, FindsTheCatalogueLessHiddenInstalledAndDamagedEntries) {
  merge({{"catalog", mixedCatalog()},
         {"hidden", keys({"Hidden"})},
         {"installed", PlistDictionary{{"Installed", PlistDate{1}}}}});
  ScanRecord record = scan(GetParam().includingPrerelease);
  EXPECT_FALSE(record.error);
  ASSERT_FALSE(record.progress.empty());
  for (double percent : record.progress) {
    EXPECT_GE(percent, 0);
    EXPECT_LE(percent, 100);
  }
  EXPECT_EQ(productKeysOf(controller().availableUpdates()), GetParam().expected);
  PlistArray stored;
  for (const std::string& key : GetParam().expected) stored.emplace_back(key);
  EXPECT_EQ(SysupTest::stored("available"), PlistValue(stored));
  Collector<Strings> critical;
  controller().availableUpdatesMatchingPredicate(
      [](const SysupQuaymartUpdate& update) { return update.isCritical(); },
      [&critical](const UpdateList& updates) { critical.add(productKeysOf(updates)); });
  EXPECT_EQ(critical.waitFor(1).front(), Strings{"A"});
}

INSTANTIATE_TEST_SUITE_P(Prerelease, SysupScanTest,
                         ::testing::Values(ScanCase{false, {"A"}}, ScanCase{true, {"A", "Beta"}}));

TEST_F(SysupControllerTest, ScanProgressIsSpreadOverScanSecondsAndScansAtOnceKeepTheFileWhole) {
  merge({{"catalog", PlistArray{catalogEntry("A"), catalogEntry("B")}}, {"scanSeconds", 0.2}});
  Collector<OptionalError> finishes;
  for (int index = 0; index < 4; ++index) {
    controller().startScanningForUpdatesIncludingPrerelease(
        false, false, false, nullptr, nullptr,
        [&finishes](const OptionalError& error) { finishes.add(error); });
  }
  const auto started = std::chrono::steady_clock::now();
  ScanRecord record = scan(false);
  EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(200));
  EXPECT_GT(record.progress.size(), 2u);
  EXPECT_EQ(record.progress.back(), 100);
  for (const OptionalError& error : finishes.waitFor(4)) EXPECT_FALSE(error);
  EXPECT_EQ(productKeysOf(controller().availableUpdates()), (Strings{"A", "B"}));
}

TEST_F(SysupControllerTest, ObserversHearChangesOfThisProcessAndOfOtherWritersOnce) {
  merge({{"catalog", PlistArray{catalogEntry("A"), catalogEntry("B")}},
         {"available", keys({"A", "B"})}});
  Collector<Strings> heard;
  auto token = controller().addAvailableUpdatesObserver(
      [&heard](const UpdateList& updates) { heard.add(productKeysOf(updates)); });

  controller().ignoreUpdate(updatesNamed({"A"}).front());
  EXPECT_EQ(heard.waitFor(1).back(), Strings{"B"});

  // Another writer: first a change that leaves the list as it is, then one
  // that does not. Only the second is told.
  merge({{"scanSeconds", 3}});
  merge({{"hidden", PlistArray{}}});
  std::vector<Strings> lists = heard.waitFor(2);
  EXPECT_EQ(lists.back(), (Strings{"A", "B"}));

  controller().installUpdatesLater(updatesNamed({"A"}));  // not a change of the list
  merge({{"available", keys({"B"})}});
  lists = heard.waitFor(3);
  EXPECT_EQ(lists, (std::vector<Strings>{{"B"}, {"A", "B"}, {"B"}}));
  controller().removeAvailableUpdatesObserver(token);
}

TEST_F(SysupControllerTest, AnObserverMayRemoveItselfInItsCallback) {
  merge({{"catalog", PlistArray{catalogEntry("A"), catalogEntry("B")}},
         {"available", keys({"A", "B"})}});
  Collector<Strings> once;
  Collector<Strings> always;
  auto token = std::make_shared<SysupQuaymartUpdateController::ObserverToken>();
  *token = controller().addAvailableUpdatesObserver([&once, token](const UpdateList& updates) {
    once.add(productKeysOf(updates));
    controller().removeAvailableUpdatesObserver(*token);
  });
  auto keeper = controller().addAvailableUpdatesObserver(
      [&always](const UpdateList& updates) { always.add(productKeysOf(updates)); });

  controller().ignoreUpdate(updatesNamed({"A"}).front());
  always.waitFor(1);
  controller().resetIgnoredUpdates();
  EXPECT_EQ(always.waitFor(2).back(), (Strings{"A", "B"}));
  EXPECT_EQ(once.waitFor(1), std::vector<Strings>{{"B"}});
  controller().removeAvailableUpdatesObserver(keeper);
}

struct InstallRecord {
  std::vector<PlistDictionary> statuses;
  OptionalError error;
};

InstallRecord install(const UpdateList& updates) {
  InstallRecord record;
  Collector<OptionalError> finished;
  auto token = SysupQuaymartUpdateController::sharedUpdateController().startInstallingUpdates(
      updates, nullptr, false,
      [&record](const PlistDictionary& status, bool, double) { record.statuses.push_back(status); },
      [&finished](const OptionalError& error) { finished.add(error); });
  EXPECT_TRUE(token);
  record.error = finished.waitFor(1).front();
  return record;
}

TEST_F(SysupControllerTest, AnInstallMovesTheUpdateToInstalled) {
  merge({{"catalog", PlistArray{catalogEntry("A"), catalogEntry("B")}},
         {"available", keys({"A", "B"})},
         {"later", keys({"A", "B"})}});
  InstallRecord record = install(updatesNamed({"A"}));
  EXPECT_FALSE(record.error);
  ASSERT_FALSE(record.statuses.empty());
  EXPECT_EQ(PlistValue(record.statuses.back())["state"], PlistValue("installing"));
  EXPECT_TRUE(stored("installed")["A"].isDate());
  EXPECT_EQ(stored("available"), PlistValue(keys({"B"})));
  EXPECT_EQ(stored("later"), PlistValue(keys({"B"})));
  EXPECT_EQ(productKeysOf(controller().availableUpdates()), Strings{"B"});
  EXPECT_FALSE(controller().startInstallingUpdates({}, nullptr, false, nullptr, nullptr));
}

TEST_F(SysupControllerTest, AnInstallMarkedToFailFinishesWithAnErrorNamingTheUpdate) {
  merge({{"catalog", PlistArray{catalogEntry("A", {{"installFails", true}})}},
         {"available", keys({"A"})}});
  InstallRecord record = install(updatesNamed({"A"}));
  ASSERT_TRUE(record.error);
  EXPECT_EQ(record.error->domain, VendErrorDomain);
  EXPECT_NE(record.error->description.find("Update A"), std::string::npos);
  EXPECT_TRUE(stored("installed").isNull());
  EXPECT_EQ(stored("available"), PlistValue(keys({"A"})));
}

TEST_F(SysupControllerTest, CancellingALongInstallEndsItAtOnce) {
  merge({{"catalog", PlistArray{catalogEntry("A", {{"installSeconds", 3600}})}},
         {"available", keys({"A"})}});
  Collector<double> progress;
  Collector<OptionalError> finished;
  auto token = controller().startInstallingUpdates(
      updatesNamed({"A"}), nullptr, true,
      [&progress](const PlistDictionary&, bool, double percent) { progress.add(percent); },
      [&finished](const OptionalError& error) { finished.add(error); });
  ASSERT_TRUE(token);
  progress.waitFor(1);
  const auto cancelled = std::chrono::steady_clock::now();
  controller().cancelOperation(*token);
  OptionalError error = finished.waitFor(1).front();
  EXPECT_LT(std::chrono::steady_clock::now() - cancelled, std::chrono::seconds(2));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, VendError::kCancelledCode);
  EXPECT_TRUE(stored("installed").isNull());
  controller().cancelOperation(*token);  // spent: ignored
}

TEST_F(SysupControllerTest, LaterListRestartAndDiskSpaceFollowTheCatalogue) {
  merge({{"catalog",
          PlistArray{catalogEntry("A", {{"downloadSize", 100}}),
                     catalogEntry("B", {{"downloadSize", 20}, {"restartRequired", true}})}},
         {"available", keys({"A", "B"})}});
  controller().installUpdatesLater(updatesNamed({"B", "A"}));
  EXPECT_EQ(productKeysOf(controller().updatesToBeInstalledLater()), (Strings{"A", "B"}));
  controller().removeAllUpdatesFromInstallLater();
  EXPECT_TRUE(controller().updatesToBeInstalledLater().empty());

  EXPECT_EQ(controller().actionRequiredForUpdates(updatesNamed({"A"})), 0);
  EXPECT_EQ(controller().actionRequiredForUpdates(updatesNamed({"A", "B"})), 1);
  EXPECT_EQ(controller().diskSpaceRequiredForUpdates(updatesNamed({"A", "B"})), 120u);
  EXPECT_TRUE(controller().restartRequiredForProductKey("B"));
  EXPECT_FALSE(controller().restartRequiredForProductKey("Unknown"));
}

TEST_F(SysupControllerTest, PostLogoutInstallsAreRecordedDownloadedAndTheirResultsTakenOnce) {
  merge(
      {{"catalog", PlistArray{catalogEntry("A"), catalogEntry("B")}}, {"available", keys({"A"})}});
  EXPECT_FALSE(controller().installUpdatesAfterNextLogout(updatesNamed({"A", "B"}), true, false));
  EXPECT_TRUE(stored("postLogout").isNull());
  EXPECT_TRUE(controller().installUpdatesAfterNextLogout(updatesNamed({"A"}), true, false));
  EXPECT_EQ(stored("postLogout")["A"]["restartingNow"], PlistValue(true));
  EXPECT_EQ(stored("postLogout")["A"]["nowIsLater"], PlistValue(false));

  EXPECT_TRUE(controller().isDownloadRequiredForPostLogoutUpdates(updatesNamed({"A"})));
  Collector<OptionalError> finished;
  ASSERT_TRUE(controller().startDownloadingPostLogoutUpdates(
      updatesNamed({"A"}), nullptr, nullptr,
      [&finished](const OptionalError& error) { finished.add(error); }));
  EXPECT_FALSE(finished.waitFor(1).front());
  EXPECT_FALSE(controller().isDownloadRequiredForPostLogoutUpdates(updatesNamed({"A"})));
  EXPECT_TRUE(controller().isDownloadRequiredForPostLogoutUpdates(updatesNamed({"A", "B"})));

  const PlistDictionary results{{"A", PlistDictionary{{"State", 2}, {"InstalledLater", true}}}};
  merge({{"postLogoutResults", results}});
  EXPECT_EQ(controller().takePostLogoutResults(), results);
  EXPECT_TRUE(controller().takePostLogoutResults().empty());
}

}  // namespace
}  // namespace larder
