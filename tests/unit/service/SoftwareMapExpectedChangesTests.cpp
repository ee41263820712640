// The update machinery's notices around replacing a bundle.
#include <gtest/gtest.h>

#include <string>

#include "ServiceTestSupport.h"
#include "software-map/SoftwareMap.h"

namespace larder::testing {
namespace {

class SoftwareMapExpectedChangesTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    if (HasFatalFailure()) return;
    path_ = makeStoreBundle(rootApplications(), "Updating", "com.example.updating", "1.0", 61, 610);
    map_.emplace(options(storePath(), true));
    map_->waitUntilIdle();
    record_ = map_->productForBundleIdentifier("com.example.updating");
    ASSERT_NE(record_, nullptr);
    observer_ = std::make_shared<RecordingObserver>();
    map_->addObserver(observer_);
  }

  void TearDown() override {
    map_.reset();
    ServiceTest::TearDown();
  }

  // What the installer leaves behind: the new purchase record.
  void replaceBundleWith(const std::string& version, std::int64_t installerVersion) {
    writePlist(path_ + "/purchase.plist",
               Purchase{"com.example.updating", version, PlistValue(61),
                        PlistValue(installerVersion), "account-Updating", 1600000000.0}
                   .toDictionary());
  }

  static void expectNoExpectation(const LedgerSoftwareProductFields& fields) {
    EXPECT_FALSE(fields.metadataChangeIsExpected);
    EXPECT_EQ(fields.expectedBundleVersion, std::nullopt);
    EXPECT_EQ(fields.expectedStoreVersion, std::nullopt);
  }

  std::string path_;
  std::optional<SoftwareMap> map_;
  LedgerSoftwareProductRef record_;
  std::shared_ptr<RecordingObserver> observer_;
};

TEST_F(SoftwareMapExpectedChangesTest, CompletedUpdateIsAnnouncedOnceAndClearsTheExpectation) {
  LogCapture log;
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "2.0", 620);
  LedgerSoftwareProductFields expecting = record_->snapshot();
  EXPECT_TRUE(expecting.metadataChangeIsExpected);
  EXPECT_EQ(expecting.expectedBundleVersion, "2.0");
  EXPECT_EQ(expecting.expectedStoreVersion, 620);
  EXPECT_EQ(expecting.bundleVersion, "1.0") << "the notice alone changes no version";

  replaceBundleWith("2.0", 620);
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, true, "2.0", 620);
  map_->waitUntilIdle();

  LedgerSoftwareProductFields updated = record_->snapshot();
  EXPECT_EQ(updated.bundleVersion, "2.0");
  EXPECT_EQ(updated.versionIdentifier, 620);
  expectNoExpectation(updated);
  std::vector<RecordingObserver::Call> calls = observer_->calls();
  ASSERT_EQ(calls.size(), 1U);
  EXPECT_EQ(calls[0].product, record_);
  EXPECT_EQ(calls[0].state, kSoftwareProductChanged);
  EXPECT_EQ(calls[0].fieldsAtCall.bundleVersion, "2.0");
  EXPECT_EQ(log.countContaining("does not match expected value"), 0U) << log.dump();

  // The next scan finds what the update already merged.
  map_->reloadFromApplicationRegistry();
  map_->waitUntilIdle();
  EXPECT_EQ(observer_->calls().size(), 1U);

  // A second completion report for the same update has nothing to do.
  log.clear();
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, true, "2.0", 620);
  map_->waitUntilIdle();
  EXPECT_EQ(observer_->calls().size(), 1U);
  EXPECT_EQ(log.countContaining("Expected metadata change was already seen for product", 3), 1U)
      << log.dump();
}

TEST_F(SoftwareMapExpectedChangesTest, UpdateThatDidNotHappenOnlyClearsTheExpectation) {
  LogCapture log;
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "2.0", 620);
  // Even with a changed record on disk, a failed update is not merged.
  replaceBundleWith("2.0", 620);
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, false, "2.0", 620);
  map_->waitUntilIdle();
  LedgerSoftwareProductFields fields = record_->snapshot();
  expectNoExpectation(fields);
  EXPECT_EQ(fields.bundleVersion, "1.0");
  EXPECT_TRUE(observer_->calls().empty());
  EXPECT_TRUE(
      log.hasOnce("SoftwareMap: Update did not happen, removed expectations of a product "
                  "change at path: " +
                      path_,
                  3));
}

TEST_F(SoftwareMapExpectedChangesTest, ReportsAboutUnknownPathsAreLoggedAndIgnored) {
  LogCapture log;
  const std::string unknown = rootApplications() + "/Unknown.app";
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(unknown, "2.0", 1);
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(unknown, true, "2.0", 1);
  map_->waitUntilIdle();
  EXPECT_TRUE(log.hasOnce(
      "SoftwareMap: ERROR: No software product was found for update reported at path: " + unknown,
      3));
  EXPECT_TRUE(
      log.hasOnce("SoftwareMap: ERROR: No software product was found for completed "
                  "update reported at path: " +
                      unknown,
                  3));
  expectNoExpectation(record_->snapshot());
  EXPECT_TRUE(observer_->calls().empty());
}

TEST_F(SoftwareMapExpectedChangesTest, VersionsOtherThanExpectedAreReported) {
  LogCapture log;
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "3.0", 630);
  replaceBundleWith("2.5", 625);
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, true, "3.0", 630);
  map_->waitUntilIdle();
  EXPECT_TRUE(
      log.hasOnce("SoftwareMap: Changed product bundle version (2.5) does not match "
                  "expected value (3.0)",
                  1));
  EXPECT_TRUE(
      log.hasOnce("SoftwareMap: Changed product bundle version (625) does not match "
                  "expected value (630)",
                  1));
  LedgerSoftwareProductFields fields = record_->snapshot();
  EXPECT_EQ(fields.bundleVersion, "2.5");
  expectNoExpectation(fields);
  ASSERT_EQ(observer_->calls().size(), 1U);
  EXPECT_EQ(observer_->calls()[0].state, kSoftwareProductChanged);
}

TEST_F(SoftwareMapExpectedChangesTest, CompletedUpdateThatChangedNothingIsNotAnnounced) {
  LogCapture log;
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "1.0", 610);
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, true, "1.0", 610);
  map_->waitUntilIdle();
  EXPECT_TRUE(observer_->calls().empty());
  expectNoExpectation(record_->snapshot());
  EXPECT_EQ(log.countContaining("Warning: No change identified in reported product", 1), 1U)
      << log.dump();
}

TEST_F(SoftwareMapExpectedChangesTest, ScanThatSeesTheNewVersionFirstEndsTheExpectation) {
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "2.0", 620);
  replaceBundleWith("2.0", 620);
  map_->reloadFromApplicationRegistry();
  map_->waitUntilIdle();
  expectNoExpectation(record_->snapshot());
  EXPECT_EQ(record_->snapshot().bundleVersion, "2.0");
  LogCapture log;
  map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, true, "2.0", 620);
  map_->waitUntilIdle();
  ASSERT_EQ(observer_->calls().size(), 1U) << "the update was announced twice";
  EXPECT_EQ(observer_->calls()[0].state, kSoftwareProductChanged);
  EXPECT_EQ(log.countContaining("Expected metadata change was already seen", 3), 1U) << log.dump();
}

}  // namespace
}  // namespace larder::testing
