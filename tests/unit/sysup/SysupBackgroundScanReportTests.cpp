#include "store-runtime/sysup/SysupBackgroundScanReport.h"

#include <gtest/gtest.h>

#include "tests/unit/sysup/SysupTestSupport.h"

namespace larder {
namespace {

using testing::catalogEntry;
using testing::keys;

struct ReportCase {
  std::string name;
  PlistDictionary state;
  PlistDictionary expected;
};

const PlistDictionary kResults{{"A", PlistDictionary{{"State", 2}, {"InstalledLater", true}}}};

std::vector<ReportCase> reportCases() {
  const PlistDictionary critical{{"isCritical", true}};
  const PlistDictionary criticalRestart{{"isCritical", true}, {"restartRequired", true}};
  return {
      {"NothingOffered",
       {},
       {{"criticalUpdatesCount", 0}, {"criticalUpdatesRequireRestart", false}}},
      {"OnlyCriticalOnesCountAndOnlyTheirRestarts",
       {{"catalog", PlistArray{catalogEntry("A", critical), catalogEntry("B", critical),
                               catalogEntry("C", {{"restartRequired", true}}),
                               catalogEntry("D", criticalRestart)}},
        {"hidden", keys({"D"})}},
       {{"criticalUpdatesCount", 2}, {"criticalUpdatesRequireRestart", false}}},
      {"ACriticalRestartLaterListAndLogoutResults",
       {{"catalog", PlistArray{catalogEntry("A", criticalRestart), catalogEntry("B")}},
        {"later", keys({"B", "A"})},
        {"postLogoutResults", kResults}},
       {{"criticalUpdatesCount", 1},
        {"criticalUpdatesRequireRestart", true},
        {"osUpdatesToPerformLater", keys({"A", "B"})},
        {"postLogoutUpdatesInstalled", kResults}}},
  };
}

class SysupBackgroundScanReportTest : public testing::SysupTest,
                                      public ::testing::WithParamInterface<ReportCase> {};

TEST_P(SysupBackgroundScanReportTest, ScansAndSaysOnlyWhatThereIsToSay) {
  merge(GetParam().state);
  EXPECT_EQ(SysupBackgroundScanReport::composeReport(controller()), GetParam().expected);
  // The logout results are told once.
  EXPECT_TRUE(stored("postLogoutResults").isNull());
  EXPECT_FALSE(SysupBackgroundScanReport::composeReport(controller())
                   .contains("postLogoutUpdatesInstalled"));
}

INSTANTIATE_TEST_SUITE_P(Cases, SysupBackgroundScanReportTest, ::testing::ValuesIn(reportCases()),
                         [](const auto& info) { return info.param.name; });

}  // namespace
}  // namespace larder
