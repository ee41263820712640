// The installed-updates journal end to end: a user-started run installs two
// app updates from larder-store, and the journal's entries reach the bus
// and `larderctl history`.
#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <set>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

constexpr std::uint64_t kMapsID = 7301;
constexpr std::uint64_t kClockID = 7302;

class UpdateJournalServiceTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {
    StoreAndServiceTest::SetUp();
    catalogue_.addAccount(
        {.accountID = 1, .orvaneID = "ada@example.org", .password = "pw", .opaqueID = "account-1"});
    for (const auto& [name, item] : {std::pair{"Maps", kMapsID}, std::pair{"Clock", kClockID}}) {
      const std::string identifier = std::string("com.example.journal.") + name;
      platform_.installBundle({.folder = applications(),
                               .name = name,
                               .bundleIdentifier = identifier,
                               .version = "1.0",
                               .itemIdentifier = item});
      catalogue_.addItem({.wareID = item,
                          .bundleID = identifier,
                          .title = name,
                          .version = "2.0",
                          .actionParams = "itemId=" + std::to_string(item)});
    }
  }
};

TEST_F(UpdateJournalServiceTest,
       ARunThatInstallsTwoAppUpdatesLeavesTwoEntriesOnTheBusAndInHistory) {
  start();
  ASSERT_EQ(run({"signin", "ada@example.org", "--password", "pw"}).status, 0);
  const LarderctlRun before = run({"history"});
  EXPECT_EQ(before.status, 3) << before.output << before.errors;
  EXPECT_EQ(before.output, "nothing installed in the last 30 days\n");
  const LarderctlRun wrong = run({"history", "--since", "-1"});
  EXPECT_EQ(wrong.status, 2);
  EXPECT_NE(wrong.errors.find("days are a number above 0, not '-1'"), std::string::npos)
      << wrong.errors;

  ASSERT_EQ(run({"updates", "--check"}).status, 0) << service_->log();
  const LarderctlRun installed = run({"install", "--all"});
  ASSERT_EQ(installed.status, 0) << installed.output << installed.errors << service_->log();

  // The store application's request.
  auto shopper = client();
  const PlistValue journal = shopper->call("InstalledUpdatesJournal", {}).at(0);
  ASSERT_TRUE(journal.array()) << service_->log();
  ASSERT_EQ(journal.array()->size(), 2U) << service_->log();
  std::set<std::string> titles;
  for (const PlistValue& entry : *journal.array()) {
    titles.insert(*entry["title"].string());
    EXPECT_EQ(entry["version"], PlistValue("2.0"));
    EXPECT_FALSE(entry["__isSoftwareUpdate"].boolValue());
    EXPECT_GT(entry["installDate"].doubleValue(), 1.7e9) << "dates travel as seconds";
  }
  EXPECT_EQ(titles, (std::set<std::string>{"Maps", "Clock"}));
  // The file below the user's data folder holds them, as a binary list.
  const auto bytes =
      FileIO::read(platform_.home() + "/.local/share/larder/Quaymart/updatejournal.plist");
  ASSERT_TRUE(bytes);
  EXPECT_EQ(std::string(bytes->begin(), bytes->begin() + 8), "bplist00");

  const LarderctlRun history = run({"history"});
  EXPECT_EQ(history.status, 0) << history.errors;
  for (const char* name : {"Maps", "Clock"}) {
    const std::size_t row = history.output.find(std::string("\n") + name);
    ASSERT_NE(row, std::string::npos) << history.output;
    const std::string line =
        history.output.substr(row + 1, history.output.find('\n', row + 1) - row - 1);
    EXPECT_NE(line.find("2.0"), std::string::npos) << line;
    EXPECT_NE(line.find(" app"), std::string::npos) << line;
  }
  const LarderctlRun json = run({"--json", "history", "--since", "1"});
  EXPECT_EQ(json.status, 0) << json.errors;
  const nlohmann::json entries = nlohmann::json::parse(json.output);
  ASSERT_EQ(entries.size(), 2U) << json.output;
  EXPECT_GE(entries[0]["installDate"].get<double>(), entries[1]["installDate"].get<double>())
      << "newest first";

  // An audit that a notification carries the key of is given back whole;
  // a key that names nothing, or a path, is answered empty.
  ASSERT_TRUE(FileIO::writeAtomically(
      platform_.cacheHome() + "/com.orvane.larderd/UpdateOperationAuditInfoCache-k1.plist",
      PropertyListSerialization::writeXml(PlistDictionary{{"failedUpdates", PlistArray{"Maps"}}})));
  EXPECT_EQ(shopper->call("UpdateAutoInfoWithToken", {std::string("k1")}).at(0),
            PlistValue(PlistDictionary{{"failedUpdates", PlistArray{"Maps"}}}));
  for (const char* token : {"no-such-key", "../../etc/passwd"}) {
    const PlistValue info = shopper->call("UpdateAutoInfoWithToken", {std::string(token)}).at(0);
    ASSERT_TRUE(info.dictionary()) << token;
    EXPECT_TRUE(info.dictionary()->empty()) << token;
  }
}

// The software update agent's report: its silent installs are journaled,
// a post-logout one shown once the platform's results name it.
TEST_F(UpdateJournalServiceTest, AReportsSilentInstallsAreShownAndAPendingOneOnlyOnceConfirmed) {
  startService(kNoStoreURL);
  const LarderctlRun reported = run({"background-scan", "--info", R"({
      "autoInstalledUpdatesCount": 2,
      "autoInstallJournalEntries": {
        "1": {"JournalEntryTitle": "Malware rules", "JournalEntryProductVersion": "5.1",
              "JournalEntryDescription": "RULES-51"},
        "2": {"JournalEntryTitle": "Kernel fix", "JournalEntryProductVersion": "9.1",
              "JournalEntryDescription": "KERNEL-9", "JournalEntryWasPostLogoutInstall": true},
        "3": {"JournalEntryTitle": "Graphics", "JournalEntryProductVersion": "2.0",
              "JournalEntryDescription": "GPU-2", "JournalEntryWasPostLogoutInstall": true}},
      "postLogoutUpdatesInstalled": {"KERNEL-9": {"State": "Installed"}}})"});
  ASSERT_EQ(reported.status, 0) << reported.errors;
  nlohmann::json shown;
  ASSERT_TRUE(eventually([&] {
    const LarderctlRun history = run({"--json", "history"});
    shown = nlohmann::json::parse(history.output.empty() ? "[]" : history.output);
    return shown.size() >= 2;
  })) << service_->log();
  std::set<std::string> keys;
  for (const nlohmann::json& entry : shown) {
    keys.insert(entry["productKey"].get<std::string>());
    EXPECT_EQ(entry["__isSoftwareUpdate"], true);
    EXPECT_FALSE(entry.contains("__postLogoutInstallPending")) << entry.dump();
  }
  EXPECT_EQ(keys, (std::set<std::string>{"RULES-51", "KERNEL-9"}))
      << "the pending update the results did not name is not shown";
  const std::string table = run({"history"}).output;
  EXPECT_NE(table.find("Kernel fix"), std::string::npos) << table;
  EXPECT_EQ(table.find("Graphics"), std::string::npos) << table;
}

}  // namespace
}  // namespace larder::testing
