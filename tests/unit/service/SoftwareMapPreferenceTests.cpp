// Which record answers a bundle identifier that several installed copies
// share.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <set>
#include <string>
#include <vector>

#include "ServiceTestSupport.h"
#include "software-map/SoftwareMap.h"
#include "tests/unit/runtime/UnprivilegedUser.h"

namespace larder::testing {
namespace {

enum class Place { kRootApplications, kRootSubfolder, kHomeApplications, kVolume };

struct Copy {
  Place place;
  std::string version;
};

// Folder names of one arrangement. Two arrangements per case make the
// winner's path sort before the loser's in one and after it in the other,
// so that either copy is met first whatever order the map keeps.
struct Layout {
  std::string rootName, homeName, subfolderName;
};

struct PreferenceCase {
  const char* name;
  Copy winner;
  Copy loser;
  const char* rule;  // the words in parentheses of the deciding line
  std::vector<Layout> layouts;
};

void PrintTo(const PreferenceCase& preference, std::ostream* out) {
  *out << preference.name;
}

constexpr int kPairsPerLayout = 6;

class PreferenceRuleTest : public ServiceTest,
                           public ::testing::WithParamInterface<PreferenceCase> {
 protected:
  std::string folderFor(Place place, const Layout& layout) const {
    switch (place) {
      case Place::kRootApplications:
        return rootApplications();
      case Place::kRootSubfolder:
        return rootApplications() + "/" + layout.subfolderName;
      case Place::kHomeApplications:
        return homeApplications();
      case Place::kVolume:
        return volumeApplications("D");
    }
    return {};
  }
};

// Even layouts install the loser first and the winner with a later scan,
// odd ones the other way round, so that the map takes the records in both
// orders; the test checks that the lookups did meet the winner first as
// well as second.
TEST_P(PreferenceRuleTest, TheRuleDecidesWhenTheEarlierOnesTie) {
  const PreferenceCase& preference = GetParam();
  std::set<bool> winnerFirstSeen;
  for (std::size_t layoutIndex = 0; layoutIndex < preference.layouts.size(); ++layoutIndex) {
    const Layout& layout = preference.layouts[layoutIndex];
    useLayout(layout.rootName, layout.homeName);
    const bool winnerFirst = layoutIndex % 2 == 1;
    const auto identifier = [&](int i) {
      return "com.example.preference" + std::to_string(layoutIndex) + "." + std::to_string(i);
    };
    auto install = [&](const Copy& copy) {
      std::vector<std::string> paths;
      for (int i = 0; i < kPairsPerLayout; ++i) {
        paths.push_back(makeStoreBundle(folderFor(copy.place, layout), "P" + std::to_string(i),
                                        identifier(i), copy.version, 1000 + i));
      }
      return paths;
    };
    std::vector<std::string> first = install(winnerFirst ? preference.winner : preference.loser);
    SoftwareMap map(options(storePath("layout" + std::to_string(layoutIndex)), true));
    map.waitUntilIdle();
    std::vector<std::string> second = install(winnerFirst ? preference.loser : preference.winner);
    map.reloadFromApplicationRegistry();
    map.waitUntilIdle();
    ASSERT_EQ(map.allProducts().size(), static_cast<std::size_t>(kPairsPerLayout) * 2);
    // The order in which the map holds the records is the order in which
    // the lookup meets them.
    std::vector<std::string> order;
    for (const auto& product : map.allProducts()) order.push_back(product->bundlePath());

    for (int i = 0; i < kPairsPerLayout; ++i) {
      const std::string& winner = (winnerFirst ? first : second)[static_cast<std::size_t>(i)];
      const std::string& loser = (winnerFirst ? second : first)[static_cast<std::size_t>(i)];
      LogCapture log;
      LedgerSoftwareProductRef found = map.productForBundleIdentifier(identifier(i));
      ASSERT_NE(found, nullptr) << identifier(i);
      EXPECT_EQ(found->bundlePath(), winner) << log.dump();
      const bool updatable = std::string_view(preference.rule) == "updatable";
      EXPECT_TRUE(log.hasOnce(std::string("SoftwareMap: Preferring (") + preference.rule +
                                  ") app version " + preference.winner.version + " at " + winner +
                                  " over " + (updatable ? "non-updatable " : "") + "version " +
                                  preference.loser.version + " at " + loser,
                              1));
      std::vector<LogCapture::Line> warnings =
          log.linesContaining("multiple matches for " + identifier(i) + " found");
      ASSERT_EQ(warnings.size(), 1U) << log.dump();
      EXPECT_EQ(warnings[0].level, 1);
      EXPECT_NE(warnings[0].text.find("returning preferred result <LedgerSoftwareProduct:"),
                std::string::npos);
      EXPECT_NE(warnings[0].text.find("bundlePath=" + winner + " "), std::string::npos)
          << warnings[0].text;
      winnerFirstSeen.insert(std::find(order.begin(), order.end(), winner) <
                             std::find(order.begin(), order.end(), loser));
    }
  }
  EXPECT_EQ(winnerFirstSeen.size(), 2U) << "the lookups never met the copies in both orders";
}

INSTANTIATE_TEST_SUITE_P(
    SoftwareMap, PreferenceRuleTest,
    ::testing::Values(
        // The home copy has the shorter path, so only the folder rule can
        // pick the other one.
        PreferenceCase{"CopyInApplicationsBeatsCopyInHome",
                       {Place::kRootApplications, "3.2"},
                       {Place::kHomeApplications, "3.2"},
                       "in /Applications",
                       {{"zz-platform-root", "h", "Sub"}, {"aa-platform-root", "i", "Sub"}}},
        // The volume's copy has the shorter path; neither lies in /Applications.
        PreferenceCase{"CopyOnBootVolumeBeatsCopyOnOtherVolume",
                       {Place::kHomeApplications, "1.0"},
                       {Place::kVolume, "1.0"},
                       "on boot volume",
                       {{"r", "a-rather-long-home-folder-name", "Sub"},
                        {"s", "zz-rather-long-home-folder-name", "Sub"}}},
        // "1.9" sorts after "1.10" as text and sits in /Applications.
        PreferenceCase{"HigherVersionWinsNumerically",
                       {Place::kHomeApplications, "1.10"},
                       {Place::kRootApplications, "1.9"},
                       "newer/higher",
                       {{"r", "a-home", "Sub"}, {"s", "zz-home", "Sub"}}},
        PreferenceCase{"WithEverythingElseEqualTheShorterPathWins",
                       {Place::kRootApplications, "2.0"},
                       {Place::kRootSubfolder, "2.0"},
                       "shortest path",
                       {{"root", "home", "Utilities"}, {"root2", "home2", "Apps"}}}),
    [](const auto& info) { return std::string(info.param.name); });

using SoftwareMapPreferenceTest = ServiceTest;

// The higher version sits in /Applications, on the boot volume, with the
// shorter path: only its folder having become read-only can make it lose.
TEST_F(SoftwareMapPreferenceTest, UpdatableCopyBeatsHigherVersionThatCannotBeReplaced) {
  const std::string locked = rootApplications() + "/Locked";
  std::string higher = makeStoreBundle(locked, "Tool", "com.example.tool", "9.0", 77);
  std::string lower =
      makeStoreBundle(volumeApplications("D"), "Tool", "com.example.tool", "1.0", 77);
  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  ASSERT_EQ(map.allProducts().size(), 2U);
  UnprivilegedUser user(temporary());
  ASSERT_EQ(user.failure(), "");
  ASSERT_EQ(map.productForBundleIdentifier("com.example.tool")->bundlePath(), higher)
      << "while its folder can be written, the higher version wins";
  ASSERT_EQ(::chmod(locked.c_str(), 0555), 0);
  // Writable again before the temporary tree is removed, whatever happens.
  std::shared_ptr<void> unlock(nullptr, [&](void*) { ::chmod(locked.c_str(), 0755); });

  LogCapture log;
  LedgerSoftwareProductRef found = map.productForBundleIdentifier("com.example.tool");
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->bundlePath(), lower) << log.dump();
  EXPECT_TRUE(log.hasOnce("SoftwareMap: Preferring (updatable) app version 1.0 at " + lower +
                              " over non-updatable version 9.0 at " + higher,
                          1));
  EXPECT_EQ(log.countContaining("multiple matches for com.example.tool found", 1), 1U);
}

// The same rule for records the map remembers from its store, whose
// bundles are no longer folders at all; this case runs as any user.
TEST_F(SoftwareMapPreferenceTest, RememberedCopyThatIsGoneLosesToUpdatableLowerVersion) {
  std::vector<LedgerSoftwareProductFields> records;
  std::vector<std::pair<std::string, std::string>> winnerAndLoser;
  for (int i = 0; i < kPairsPerLayout; ++i) {
    std::string identifier = "com.example.gone" + std::to_string(i);
    std::string present = makeStoreBundle(volumeApplications("D"), "G" + std::to_string(i),
                                          identifier, "1.0", 500 + i);
    std::string gone = rootApplications() + "/G" + std::to_string(i) + ".app";
    const auto item = static_cast<std::uint64_t>(500 + i);
    records.push_back(storedRecord(present, identifier, "1.0", item));
    records.push_back(storedRecord(gone, identifier, "8.0", item));
    winnerAndLoser.emplace_back(present, gone);
  }
  std::unique_ptr<SoftwareMap> map = mapWithRecords(records);
  for (int i = 0; i < kPairsPerLayout; ++i) {
    const auto& [present, gone] = winnerAndLoser[static_cast<std::size_t>(i)];
    LogCapture log;
    LedgerSoftwareProductRef byBundle =
        map->productForBundleIdentifier("com.example.gone" + std::to_string(i));
    ASSERT_NE(byBundle, nullptr);
    EXPECT_EQ(byBundle->bundlePath(), present);
    EXPECT_TRUE(log.hasOnce("SoftwareMap: Preferring (updatable) app version 1.0 at " + present +
                                " over non-updatable version 8.0 at " + gone,
                            1));
    // The item identifier index follows the same preference.
    LedgerSoftwareProductRef byItem =
        map->productForItemIdentifier(static_cast<std::uint64_t>(500 + i));
    ASSERT_NE(byItem, nullptr);
    EXPECT_EQ(byItem->bundlePath(), present);
    EXPECT_EQ(log.countContaining("multiple matches for " + std::to_string(500 + i) + " found", 1),
              1U)
        << log.dump();
  }
}

}  // namespace
}  // namespace larder::testing
