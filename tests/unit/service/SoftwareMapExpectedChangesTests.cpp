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
    path_ = makeStoreBundle(rootApplications(), "Updating", "com.example.updating", "1.0", 61, 610);
    map_.emplace(options(storePath(), true));
    map_->waitUntilIdle();
    record_ = map_->productForBundleIdentifier("com.example.updating");
    ASSERT_NE(record_, nullptr);
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
  void reportDone(bool success, const std::string& version, std::int64_t storeVersion) {
    map_->productAtPathWasUpdatedToBundleVersionStoreVersion(path_, success, version, storeVersion);
    map_->waitUntilIdle();
  }
  // The version, the expectation and what observers heard, in one line.
  std::string state() const {
    const LedgerSoftwareProductFields fields = record_->snapshot();
    std::string text = fields.bundleVersion.value_or("-") + " " +
                       std::to_string(fields.versionIdentifier.value_or(0)) + " expecting " +
                       std::to_string(fields.metadataChangeIsExpected) + " " +
                       fields.expectedBundleVersion.value_or("-") + " " +
                       std::to_string(fields.expectedStoreVersion.value_or(0)) + "; told";
    for (const auto& call : observer_->calls()) {
      text += " " + std::to_string(call.state) + (call.product == record_ ? "" : " of another") +
              " at " + call.fieldsAtCall.bundleVersion.value_or("-");
    }
    return text;
  }

  std::string path_;
  std::optional<SoftwareMap> map_;
  LedgerSoftwareProductRef record_;
  std::shared_ptr<RecordingObserver> observer_ = std::make_shared<RecordingObserver>();
};

TEST_F(SoftwareMapExpectedChangesTest, CompletedUpdateIsAnnouncedOnceAndClearsTheExpectation) {
  LogCapture log;
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "2.0", 620);
  EXPECT_EQ(state(), "1.0 610 expecting 1 2.0 620; told") << "the notice alone changes no version";
  replaceBundleWith("2.0", 620);
  reportDone(true, "2.0", 620);
  EXPECT_EQ(state(), "2.0 620 expecting 0 - 0; told 2 at 2.0");
  EXPECT_EQ(log.countContaining("does not match expected value"), 0U) << log.dump();

  // Neither the next scan nor a second report announces it again.
  map_->reloadFromApplicationRegistry();
  map_->waitUntilIdle();
  log.clear();
  reportDone(true, "2.0", 620);
  EXPECT_EQ(state(), "2.0 620 expecting 0 - 0; told 2 at 2.0");
  EXPECT_EQ(log.countContaining("Expected metadata change was already seen for product", 3), 1U)
      << log.dump();
}

TEST_F(SoftwareMapExpectedChangesTest, ScanThatSeesTheNewVersionFirstEndsTheExpectation) {
  map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, "2.0", 620);
  replaceBundleWith("2.0", 620);
  map_->reloadFromApplicationRegistry();
  map_->waitUntilIdle();
  EXPECT_EQ(state(), "2.0 620 expecting 0 - 0; told 2 at 2.0");
  LogCapture log;
  reportDone(true, "2.0", 620);
  EXPECT_EQ(state(), "2.0 620 expecting 0 - 0; told 2 at 2.0") << "the update was announced twice";
  EXPECT_EQ(log.countContaining("Expected metadata change was already seen", 3), 1U) << log.dump();
}

TEST_F(SoftwareMapExpectedChangesTest, OtherOutcomesClearTheExpectationAndSaySo) {
  struct Case {
    std::string name;
    std::string expectedVersion;
    std::int64_t expectedStoreVersion;
    std::optional<std::pair<std::string, std::int64_t>> onDisk;
    bool success;
    std::string state;
    std::vector<std::pair<std::string, int>> lines;
  };
  const std::vector<Case> cases{
      // Even with a changed record on disk, a failed update is not merged.
      {"failed",
       "2.0",
       620,
       std::pair{"2.0", 620},
       false,
       "1.0 610 expecting 0 - 0; told",
       {{"SoftwareMap: Update did not happen, removed expectations of a product change at path: " +
             path_,
         3}}},
      {"nothing changed",
       "1.0",
       610,
       std::nullopt,
       true,
       "1.0 610 expecting 0 - 0; told",
       {{"SoftwareMap: Warning: No change identified in reported product", 1}}},
      {"other versions",
       "3.0",
       630,
       std::pair{"2.5", 625},
       true,
       "2.5 625 expecting 0 - 0; told 2 at 2.5",
       {{"SoftwareMap: Changed product bundle version (2.5) does not match expected value (3.0)",
         1},
        {"SoftwareMap: Changed product bundle version (625) does not match expected value (630)",
         1}}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    replaceBundleWith("1.0", 610);
    map_->reloadFromApplicationRegistry();
    map_->waitUntilIdle();
    observer_ = std::make_shared<RecordingObserver>();
    map_->addObserver(observer_);
    LogCapture log;
    map_->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path_, c.expectedVersion,
                                                                c.expectedStoreVersion);
    if (c.onDisk) replaceBundleWith(c.onDisk->first, c.onDisk->second);
    reportDone(c.success, c.expectedVersion, c.expectedStoreVersion);
    EXPECT_EQ(state(), c.state);
    for (const auto& [line, level] : c.lines) {
      EXPECT_EQ(log.countContaining(line, level), 1U) << line << "\n" << log.dump();
    }
  }
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
  EXPECT_EQ(state(), "1.0 610 expecting 0 - 0; told");
}

}  // namespace
}  // namespace larder::testing
