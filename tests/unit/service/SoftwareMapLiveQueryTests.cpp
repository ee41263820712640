// The live queries as the map uses them: announced replacements and recovery from a lost
// event queue.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <stdio.h>

#include <chrono>
#include <thread>

#include "tests/unit/service/ServiceTestSupport.h"

namespace larder::testing {
namespace {

class SoftwareMapLiveQueryTest : public ServiceTest {
 protected:
  // A map kept live by both queries, once their first results are merged.
  std::unique_ptr<SoftwareMap> startLiveMap(const LogCapture& log) {
    SoftwareMap::Options options = this->options(storePath("live"), true);
    options.liveQueries = true;
    auto map = std::make_unique<SoftwareMap>(options);
    EXPECT_TRUE(
        eventually([&] { return log.countContaining("MetadataQuery initial load took") >= 2; }));
    return map;
  }
};

TEST_F(SoftwareMapLiveQueryTest, AnAnnouncedReplacementBringsTheNewVersionWithoutAScan) {
  std::string path =
      makeStoreBundle(rootApplications(), "Updating", "com.example.updating", "2.4", 41, 240);
  LogCapture log;
  std::unique_ptr<SoftwareMap> map = startLiveMap(log);
  LedgerSoftwareProductRef record = map->productForItemIdentifier(41);
  ASSERT_NE(record, nullptr);

  map->productAtPathWillBeUpdatedToBundleVersionStoreVersion(path, "2.5", 250);
  // As the installer does: the new bundle is exchanged with the old, which is then deleted.
  std::string staged =
      makeStoreBundle(temporary() + "/staging", "Updating", "com.example.updating", "2.5", 41, 250);
  ASSERT_EQ(::renameat2(AT_FDCWD, staged.c_str(), AT_FDCWD, path.c_str(), RENAME_EXCHANGE), 0);
  fs::remove_all(staged);
  // The new item's arrival ends the expectation; only then is the update reported done.
  ASSERT_TRUE(eventually([&] { return !record->snapshot().metadataChangeIsExpected; }));
  map->productAtPathWasUpdatedToBundleVersionStoreVersion(path, true, "2.5", 250);

  EXPECT_TRUE(eventually([&] { return record->bundleVersion() == "2.5"; })) << log.dump();
  EXPECT_EQ(record->snapshot().versionIdentifier, 250);
  EXPECT_EQ(map->productForItemIdentifier(41), record);
}

TEST_F(SoftwareMapLiveQueryTest, AnOverflowRestartsTheQueriesAndTheirResultsRepairTheMap) {
  makeStoreBundle(rootApplications(), "Before", "com.example.before", "1.0", 31);
  LogCapture log;
  std::unique_ptr<SoftwareMap> live = startLiveMap(log);
  ASSERT_FALSE(HasFailure());
  SoftwareMap& map = *live;
  map.simulateMetadataQueryOverflowForTesting();
  ASSERT_TRUE(eventually([&] {
    return log.countContaining("Received serverPortInvalid from MetadataQuery. Reinitializing.") >=
           1;
  }));
  // A bundle that arrives while the queries are being replaced is found by
  // the new queries' first gathering.
  makeStoreBundle(rootApplications(), "During", "com.example.during", "1.0", 32);
  ASSERT_TRUE(eventually([&] { return map.productForItemIdentifier(32) != nullptr; }));
  ASSERT_TRUE(
      eventually([&] { return log.countContaining("MetadataQuery initial load took") >= 4; }));
  EXPECT_NE(map.productForItemIdentifier(31), nullptr) << "the restart loses nothing";
  EXPECT_EQ(map.allProducts().size(), 2u);
}

}  // namespace
}  // namespace larder::testing
