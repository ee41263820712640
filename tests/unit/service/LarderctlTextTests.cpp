// What larderctl says and reads, without a bus: the texts of bus failures,
// the arguments of `call`, and record fields as people read them.
#include <gtest/gtest.h>

#include <CLI/CLI.hpp>
#include <cstdlib>
#include <ctime>

#include "client/BusFailureText.h"
#include "client/ServiceRequests.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tools/larderctl/CallArguments.h"
#include "tools/larderctl/DialogPrompt.h"
#include "tools/larderctl/Spinner.h"
#include "tools/larderctl/UpdateExplanation.h"
#include "tools/larderctl/ValueText.h"

namespace larder {
namespace {

TEST(BusFailureTextTest, EachFailureSaysWhatFailedWithWhatAndWhatToDo) {
  struct Row {
    std::string errorName;
    std::string_view bus;
    std::string expected;
  };
  const std::vector<Row> rows{
      {"org.freedesktop.DBus.Error.NameHasNoOwner", "session",
       "larderd is not running: nothing owns com.orvane.larderd on the session bus. Is larderd "
       "running? `systemctl --user status larderd`"},
      {"org.freedesktop.DBus.Error.ServiceUnknown", "system",
       "larderd is not running: nothing owns com.orvane.larderd on the system bus. Is larderd "
       "running? `systemctl status larderd`"},
      {"org.freedesktop.DBus.Error.NoReply", "session",
       "larderd did not answer AllProducts within 2.5 s; give it longer with --timeout, or see "
       "what it is doing: `journalctl --user -u larderd`"},
      {"org.freedesktop.DBus.Error.UnknownMethod", "session",
       "the running larderd does not know AllProducts (the message); it may be older than this "
       "larderctl: `systemctl --user restart larderd`"},
      {"org.freedesktop.DBus.Error.AccessDenied", "session",
       "the session bus refused AllProducts to com.orvane.larderd: the message"},
      {"com.orvane.larderd.Error.NoStoreClient", "session",
       "larderd could not do AllProducts: the message (com.orvane.larderd.Error.NoStoreClient)"},
      {"org.freedesktop.DBus.Error.Disconnected", "session",
       "calling AllProducts on com.orvane.larderd failed: the message "
       "(org.freedesktop.DBus.Error.Disconnected)"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.errorName);
    EXPECT_EQ(BusFailureText::forCall(row.errorName, "the message",
                                      {"com.orvane.larderd", row.bus, "AllProducts", 2.5}),
              row.expected);
  }
  EXPECT_EQ(
      BusFailureText::forConnection("Failed to open bus (No such file or directory)", "system"),
      "cannot connect to the system bus: Failed to open bus (No such file or directory). Is "
      "the system's D-Bus running? `systemctl status dbus`");
}

TEST(CallArgumentsTest, WordsAreReadByTheSignatureAndWrongWordsAreNamed) {
  const RequestSignature request{"", "Example", "sbxtda{sv}", "", "", ""};
  const PlistArray read = CallArguments::parse(
      request, {"text", "yes", "-7", "18446744073709551615", "2.5", R"({"key": [1, "two"]})"});
  const PlistArray expected{"text",
                            true,
                            std::int64_t{-7},
                            std::uint64_t{18446744073709551615ULL},
                            2.5,
                            PlistDictionary{{"key", PlistArray{std::int64_t{1}, "two"}}}};
  EXPECT_EQ(read, expected);

  struct Row {
    std::vector<std::string> words;
    std::string message;
  };
  const std::vector<Row> rows{
      {{"s", "maybe", "1", "1", "1", "{}"},
       "argument 2 of Example (b) must be true or false, not 'maybe'"},
      {{"s", "no", "12abc", "1", "1", "{}"},
       "argument 3 of Example (x) must be a whole number, not '12abc'"},
      {{"s", "no", "1", "-1", "1", "{}"},
       "argument 4 of Example (t) must be a whole number from 0 to 18446744073709551615, not '-1'"},
      {{"s", "no", "1", "1", "inf", "{}"}, "argument 5 of Example (d) must be a number, not 'inf'"},
      {{"s", "no", "1", "1", "1", "{"}, "argument 6 of Example (a{sv}) must be JSON, not '{'"},
      {{"s"}, "Example takes 6 argument(s) of signature 'sbxtda{sv}', not 1"},
  };
  for (const Row& row : rows) {
    try {
      CallArguments::parse(request, row.words);
      ADD_FAILURE() << "accepted: " << row.message;
    } catch (const CLI::ValidationError& error) {
      EXPECT_EQ(std::string(error.what()), row.message);
    }
  }
}

TEST(ValueTextTest, DatesInLocalTimeEnumerationsByNameOtherValuesAsTheyAre) {
  // A rule rather than a zone name, so that no time zone database is needed.
  testing::ScopedEnvironment zone;
  zone.set("TZ", "CET-1CEST,M3.5.0,M10.5.0/3");
  ::tzset();
  EXPECT_EQ(ValueText::of("purchaseDate", 1768471200.0), "2026-01-15 11:00:00 CET");
  EXPECT_EQ(ValueText::of("releaseDate", PlistDate{1768471200.0}), "2026-01-15 11:00:00 CET");
  EXPECT_EQ(ValueText::of("source", std::int64_t{2}), "store software query (2)");
  EXPECT_EQ(ValueText::of("source", std::int64_t{9}), "9");
  EXPECT_EQ(ValueText::of("itemIdentifier", std::uint64_t{18446744073709551615ULL}),
            "18446744073709551615");
  EXPECT_EQ(ValueText::of("bundleVersion", "2.0"), "2.0");
  EXPECT_EQ(ValueText::of("installed", true), "true");
  EXPECT_EQ(ValueText::of("elapsed", 1.5), "1.5");
  zone.restore();
  ::tzset();
}

TEST(UpdateExplanationTest, EachCodeSaysWhetherToWaitOrWhatHeldItBackAndQuotesOnlyWhatAddsToIt) {
  using Kind = UpdateExplanation::Kind;
  struct Row {
    std::int64_t code;
    std::optional<std::string> reason;
    Kind kind;
    std::string expected;
  };
  const std::vector<Row> rows{
      {0, std::nullopt, Kind::kApp, "no objection"},
      {3, "the app is running", Kind::kApp,
       "held back: the application was running; a background run never quits an application, "
       "so the update goes in once it has quit, or at once with `larderctl install` (code 3)"},
      {6, "The account has no payment method.", Kind::kApp,
       "held back: buying the update failed (\"The account has no payment method.\") (code 6)"},
      {100, "the app can not be quit safely (unsaved documents)", Kind::kApp,
       "held back: the application was running and could not be quit safely (\"the app can not "
       "be quit safely (unsaved documents)\") (code 100)"},
      {502, "too soon to start auto-update", Kind::kApp,
       "not yet: it is not yet time for automatic installs (code 502)"},
      // The same code means another thing for an OS update.
      {100, std::nullopt, Kind::kOS,
       "held back: an application that had to quit could not be quit safely (code 100)"},
      {104, "the update requires restart but other users are logged in", Kind::kOS,
       "held back: the update needs a restart and other users are logged in (code 104)"},
      // Codes that only apply to the other kind, or that a preference
      // imposes, fall back on the recorded reason.
      {104, std::nullopt, Kind::kApp, "held back: no reason was recorded (code 104)"},
      {42, "forced by preference", Kind::kOS, "held back: \"forced by preference\" (code 42)"},
      {550, std::nullopt, Kind::kApp, "not yet: no reason was recorded (code 550)"},
  };
  for (const Row& row : rows) {
    EXPECT_EQ(UpdateExplanation::abortCode(row.code, row.reason, row.kind), row.expected)
        << "code " << row.code;
  }
}

TEST(SpinnerTest, TheLineTurnsAndCountsTheSeconds) {
  EXPECT_EQ(Spinner::render("asking the store", 0, std::chrono::seconds(0)), "- asking the store");
  EXPECT_EQ(Spinner::render("asking the store", 5, std::chrono::seconds(12)),
            "\\ asking the store (12 s)");
}

TEST(DialogPromptText, TheListsOfTheQuitAndCannotUpdateDialogsReadAsLines) {
  EXPECT_EQ(DialogPrompt::plainText("Quit these:<li>Notes<li>Atlas"),
            "Quit these:\n  - Notes\n  - Atlas");
  EXPECT_EQ(DialogPrompt::plainText("In use by: <br><br><ul><li>Viewer</li><li>Editor</li></ul>"),
            "In use by: \n\n\n  - Viewer\n  - Editor");
  EXPECT_EQ(DialogPrompt::plainText("a < b and <b>bold</b>"), "a < b and <b>bold</b>");
}

}  // namespace
}  // namespace larder
