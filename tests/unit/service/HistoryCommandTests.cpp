// `larderctl history` without a bus: which entries it shows, in which order,
// and its table.
#include <gtest/gtest.h>

#include <ctime>

#include "tests/unit/ScopedEnvironment.h"
#include "tools/larderctl/HistoryCommand.h"

namespace larder {
namespace {

constexpr double kDay = 86400;
// 2026-11-26 12:00:00 UTC.
constexpr double kNow = 1795694400;

PlistDictionary entry(const std::string& title, PlistValue date, bool os = false) {
  PlistDictionary fields{{"title", title}, {"version", "2." + title}};
  if (!date.isNull()) fields["installDate"] = std::move(date);
  if (os) fields["__isSoftwareUpdate"] = true;
  return fields;
}

std::vector<std::string> titles(const PlistArray& entries) {
  std::vector<std::string> names;
  for (const PlistValue& e : entries) names.push_back(*e["title"].string());
  return names;
}

TEST(HistoryCommandTest, EntriesComeNewestFirstAndSinceKeepsOnlyTheDaysAsked) {
  // As the bus carries them: dates as seconds; one confirmed after a logout
  // stands at the end with an earlier date; one has no date at all.
  const PlistArray journal{entry("a", kNow - 20 * kDay),
                           entry("b", kNow - 3 * kDay),
                           entry("undated", PlistValue()),
                           entry("c", PlistDate{kNow - kDay}),
                           "not an entry",
                           entry("confirmed", kNow - 5 * kDay, true)};
  struct Case {
    std::optional<double> since;
    std::vector<std::string> shown;
  };
  const Case cases[] = {
      {std::nullopt, {"c", "b", "confirmed", "a", "undated"}},
      {7, {"c", "b", "confirmed"}},
      {3, {"c", "b"}},
      {0.5, {}},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(titles(HistoryCommand::newestFirst(journal, c.since, kNow)), c.shown)
        << (c.since ? std::to_string(*c.since) : "all");
  }
}

TEST(HistoryCommandTest, TheTableGivesTitleVersionLocalMinuteKindAndPending) {
  testing::ScopedEnvironment environment;
  environment.set("TZ", "CET-1CEST,M3.5.0,M10.5.0/3");
  ::tzset();
  PlistDictionary pending = entry("Security", kNow, true);
  pending["__postLogoutInstallPending"] = true;
  const std::string table =
      HistoryCommand::table({entry("Atlas", kNow + 59), pending, entry("Undated", PlistValue())});
  environment.restore();
  ::tzset();
  EXPECT_EQ(table,
            "TITLE                           VERSION       DATE              KIND  PENDING\n"
            "Atlas                           2.Atlas       2026-11-26 13:00  app\n"
            "Security                        2.Security    2026-11-26 13:00  OS    yes\n"
            "Undated                         2.Undated     -                 app\n");
}

}  // namespace
}  // namespace larder
