// The runtime's helper facilities: gzip, errors, restrictions, the
// simulated platform agents, message traces, localised text, string and
// file helpers. Each test runs against its own platform root, home and XDG
// folders below a fresh temporary folder.

#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/LocalizedStringBundle.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/LedgerDockMessaging.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerRootHelper.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/host/VendManagedRestrictions.h"
#include "store-runtime/http/VendGzip.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "tests/unit/runtime/RuntimeTestSupport.h"
#include "tests/unit/runtime/UnprivilegedUser.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

using testing::readFile;

void writeText(const std::string& path, std::string_view text) {
  testing::writeFile(path, text);
}
void writePlist(const std::string& path, const PlistValue& value) {
  writeText(path, PropertyListSerialization::writeXml(value));
}
PlistValue readPlist(const std::string& path) {
  std::optional<PlistData> bytes = FileIO::read(path).optional();
  if (!bytes) return {};
  std::optional<PlistValue> value = PropertyListSerialization::read(*bytes);
  return value.value_or(PlistValue());
}

double secondsNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

class RuntimeFacilityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "larder-facilities-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    temporary_ = pattern;
    root_ = temporary_ + "/root";
    home_ = temporary_ + "/home";
    fs::create_directories(root_);
    fs::create_directories(home_);
    environment_.set("LARDER_ROOT", root_);
    environment_.set("HOME", home_);
    for (const char* kind : {"CACHE", "STATE", "CONFIG"})
      environment_.set(std::string("XDG_") + kind + "_HOME", temporary_ + "/" + kind);
    environment_.unset("LARDER_STORE_APP");
    environment_.unset("__OSINSTALL_ENVIRONMENT");
  }

  void TearDown() override {
    LedgerTraceMessageWaitUntilWritten();
    for (const std::string& folder : lockedFolders_) ::chmod(folder.c_str(), 0755);
    std::error_code code;
    fs::remove_all(temporary_, code);
    environment_.restore();
  }

  std::string rooted(std::string_view path) const { return root_ + std::string(path); }
  std::string platformState(std::string_view name) const {
    return rooted("/var/lib/larder-platform/") + std::string(name);
  }

  // A bundle with the given information dictionary and, if given, purchase
  // record text.
  std::string makeBundle(const std::string& path, const PlistDictionary& info,
                         std::optional<std::string> purchaseText = std::nullopt) {
    fs::create_directories(path);
    writePlist(path + "/bundle.plist", PlistValue(info));
    if (purchaseText) writeText(path + "/purchase.plist", *purchaseText);
    return path;
  }

  std::string temporary_;
  std::string root_;
  std::string home_;
  std::vector<std::string> lockedFolders_;
  testing::ScopedEnvironment environment_;
};

PlistData pseudoRandomBytes(std::size_t count, unsigned seed) {
  const std::string bytes = testing::randomBytes(count, seed);
  return {bytes.begin(), bytes.end()};
}

TEST_F(RuntimeFacilityTest, GzipRoundTripsEmptySmallRandomAndLargeInputs) {
  std::string text = "<plist><dict><key>bundle-id</key><string>com.example.app</string></dict>";
  std::vector<PlistData> inputs = {
      {},
      PlistData(text.begin(), text.end()),
      pseudoRandomBytes(300000, 7),              // incompressible, several output chunks
      PlistData(10u << 20u, std::uint8_t{'a'}),  // compresses a thousandfold
  };
  for (const PlistData& input : inputs) {
    std::optional<PlistData> zipped = VendCopyGzippedDataForData(input);
    ASSERT_TRUE(zipped.has_value()) << input.size();
    ASSERT_GE(zipped->size(), 18u);
    EXPECT_EQ((*zipped)[0], 0x1f);
    EXPECT_EQ((*zipped)[1], 0x8b);
    std::optional<PlistData> unzipped = VendCopyGunzippedDataForData(*zipped, 16u << 20u);
    ASSERT_TRUE(unzipped.has_value()) << input.size();
    EXPECT_EQ(*unzipped, input);
  }
  EXPECT_LT(VendCopyGzippedDataForData(inputs[3])->size(), 100000u);
}

TEST_F(RuntimeFacilityTest, GunzipRefusesDamagedTruncatedPaddedAndOversizedStreams) {
  const PlistData zipped = *VendCopyGzippedDataForData(pseudoRandomBytes(20000, 11));
  const auto changed = [&](const std::function<void(PlistData&)>& change) {
    PlistData copy = zipped;
    change(copy);
    return copy;
  };
  const std::string plain = "not compressed at all";
  const std::pair<const char*, PlistData> refused[] = {
      {"a flipped byte", changed([](PlistData& d) { d[d.size() / 2] ^= 0x55; })},
      {"a bad checksum", changed([](PlistData& d) { d[d.size() - 6] ^= 0x01; })},  // in the CRC-32
      {"truncated", changed([](PlistData& d) { d.resize(d.size() - 5); })},
      {"padded", changed([](PlistData& d) { d.push_back(0); })},
      {"not compressed", PlistData(plain.begin(), plain.end())},
      {"empty", PlistData{}},
  };
  for (const auto& [name, data] : refused) EXPECT_FALSE(VendCopyGunzippedDataForData(data)) << name;

  // A small body that expands beyond the limit is refused, at the limit it is fine.
  PlistData zeros(4u << 20u, 0);
  PlistData bomb = *VendCopyGzippedDataForData(zeros);
  EXPECT_FALSE(VendCopyGunzippedDataForData(bomb, zeros.size() - 1));
  std::optional<PlistData> exact = VendCopyGunzippedDataForData(bomb, zeros.size());
  ASSERT_TRUE(exact);
  EXPECT_EQ(exact->size(), zeros.size());
}

// The named errors, and errors made from a title and a message (the
// message is preferred as the description) or in another domain.
TEST_F(RuntimeFacilityTest, ErrorsCarryTheirDomainsCodesAndTexts) {
  using Text = std::optional<std::string>;
  const struct {
    VendError error;
    std::string_view domain;
    std::int64_t code;
    Text title, message;
    std::string description;
  } table[] = {
      {VendError::cancelledByUser(), VendErrorDomain, -128, "AC check failed",
       "Can't start because the user canceled the dialog.",
       "Can't start because the user canceled the dialog."},
      {VendError::notAuthorized(), VendErrorDomain, 4, "Authorization failed",
       "Not authorized to proceed with updates.", "Not authorized to proceed with updates."},
      {VendError::alreadyInstalled(), VendErrorDomain, 7, std::nullopt, "Skipping download",
       "Skipping download"},
      {VendError::notEnoughDiskSpace(), VendErrorDomain, 11, "Disk check failed",
       "Can't start because there is not enough disk space.",
       "Can't start because there is not enough disk space."},
      {VendError::noUniqueTaggedUpdate(), VendErrorDomain, 27, std::nullopt, std::nullopt, ""},
      {VendError::urlBagKeyMissing(), VendErrorDomain, 30, "DAAP Key not in Bag", std::nullopt,
       "DAAP Key not in Bag"},
      {VendError::make(99, "Title", "Message"), VendErrorDomain, 99, "Title", "Message", "Message"},
      {VendError::make(99, "Title", std::nullopt), VendErrorDomain, 99, "Title", std::nullopt,
       "Title"},
      {VendError::make(99), VendErrorDomain, 99, std::nullopt, std::nullopt, ""},
      {VendError::withDomain("NSURLErrorDomain", -1001, "timed out"), "NSURLErrorDomain", -1001,
       std::nullopt, std::nullopt, "timed out"},
      {VendError::withDomain("D", 1), "D", 1, std::nullopt, std::nullopt, ""},
  };
  for (const auto& expected : table) {
    SCOPED_TRACE(expected.code);
    EXPECT_EQ(expected.error.domain, expected.domain);
    EXPECT_EQ(expected.error.code, expected.code);
    EXPECT_EQ(expected.error.title(), expected.title);
    EXPECT_EQ(expected.error.description, expected.description);
    EXPECT_EQ(expected.error.isCancellation(), expected.code == -128);
    // What an error of another domain keeps beside its description is its own matter.
    if (expected.domain == VendErrorDomain) {
      EXPECT_EQ(expected.error.message(), expected.message);
      EXPECT_EQ(expected.error.userInfo.empty(), !expected.title && !expected.message);
    }
    // Title and message survive the wire form.
    std::optional<VendError> back = VendError::fromDictionary(expected.error.toDictionary());
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, expected.error);
    EXPECT_EQ(back->title(), expected.title);
  }
}

// Each state of the file in turn, read at every call: whether it requires
// an administrator and whether it silences update notifications.
TEST_F(RuntimeFacilityTest, RestrictionsFollowTheFileAtEveryCall) {
  const std::string path = rooted("/etc/larder/restrictions.plist");
  EXPECT_EQ(VendManagedRestrictions::restrictionsFilePath(), path);
  const std::string admin(LedgerRestrictStoreToRequireAdminForSoftwareInstall);
  const std::string silent(LedgerRestrictStoreToDisableSoftwareUpdateNotifications);
  const struct {
    const char* what;
    std::optional<std::string> text;  // nullopt: a folder where the file should be
    bool admin, silent;
  } states[] = {
      {"no file", "", false, false},
      {"booleans",
       PropertyListSerialization::writeXml(PlistDictionary{{silent, true}, {admin, false}}), false,
       true},
      // Numbers count, other types do not.
      {"number and text",
       PropertyListSerialization::writeXml(
           PlistDictionary{{admin, PlistValue(std::int64_t{1})}, {silent, "YES"}}),
       true, false},
      {"damaged", "<?xml version=\"1.0\"?><plist><dict><key>RequireAdmin", false, false},
      {"a list", PropertyListSerialization::writeXml(PlistArray{PlistValue(admin), true}), false,
       false},
      {"a folder", std::nullopt, false, false},
  };
  for (const auto& state : states) {
    SCOPED_TRACE(state.what);
    fs::remove_all(path);
    if (!state.text) fs::create_directories(path);
    if (state.text && !state.text->empty()) writeText(path, *state.text);
    EXPECT_EQ(VendManagedRestrictions::isRestrictedTo(admin), state.admin);
    EXPECT_EQ(VendManagedRestrictions::isRestrictedTo(silent), state.silent);
    EXPECT_FALSE(VendManagedRestrictions::isRestrictedTo("SomethingElse"));
  }
}

TEST_F(RuntimeFacilityTest, TwilightArmingIsPersistedAndUndone) {
  EXPECT_FALSE(LedgerTwilightAgent::isArmedForInstallLater());
  EXPECT_FALSE(LedgerTwilightAgent::armedMode());

  double before = secondsNow();
  LedgerTwilightAgent::armObserverWithMode(2);
  EXPECT_TRUE(LedgerTwilightAgent::isArmedForInstallLater());
  EXPECT_EQ(LedgerTwilightAgent::armedMode(), 2);
  PlistValue stored = readPlist(platformState("twilight.plist"));
  EXPECT_TRUE(stored["armed"].boolValue());
  EXPECT_EQ(stored["armedMode"].int64Value(), 2);
  ASSERT_TRUE(stored["armedDate"].isDate());
  EXPECT_NEAR(stored["armedDate"].date()->secondsSince1970, before, 5);

  LedgerTwilightAgent::armObserverWithMode(1);
  EXPECT_EQ(LedgerTwilightAgent::armedMode(), 1);

  LedgerTwilightAgent::disarmObserver();
  EXPECT_FALSE(LedgerTwilightAgent::isArmedForInstallLater());
  EXPECT_FALSE(LedgerTwilightAgent::armedMode());
  stored = readPlist(platformState("twilight.plist"));
  EXPECT_FALSE(stored["armed"].boolValue());
  EXPECT_TRUE(stored["armedMode"].isNull());
}

TEST_F(RuntimeFacilityTest, RestartCountdownTakesAPresetAnswerOrRunsOut) {
  PlatformStateFile state(platformState("twilight.plist"));
  state.updateDictionary([](PlistDictionary& s) { s["countdownAnswer"] = std::int64_t{4}; });
  EXPECT_EQ(LedgerTwilightAgent::showRestartCountdownNotification(), 4);
  PlistValue stored = readPlist(state.path());
  EXPECT_TRUE(stored["countdownAnswer"].isNull()) << "an answer is used once";
  EXPECT_FALSE(stored["restartCountdownShown"].boolValue());
  EXPECT_EQ(stored["lastCountdownResult"].int64Value(), 4);

  // No answer: the countdown runs out, which means restart.
  EXPECT_EQ(LedgerTwilightAgent::showRestartCountdownNotification(),
            LedgerTwilightAgent::kCountdownRanOut);
  stored = readPlist(state.path());
  EXPECT_EQ(stored["countdownCount"].int64Value(), 2);
  EXPECT_EQ(stored["lastCountdownResult"].int64Value(), 1);
}

TEST_F(RuntimeFacilityTest, RestartCountdownIsShownUntilTheUserAnswers) {
  PlatformStateFile state(platformState("twilight.plist"));
  state.updateDictionary([](PlistDictionary& s) { s["countdownSeconds"] = 30.0; });
  std::atomic<bool> sawShown{false};
  std::thread user([&] {
    auto deadline = std::chrono::steady_clock::now() + 10s;
    while (!LedgerTwilightAgent::isRestartCountdownShown() &&
           std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(10ms);
    }
    sawShown = LedgerTwilightAgent::isRestartCountdownShown();
    state.updateDictionary([](PlistDictionary& s) { s["countdownAnswer"] = std::int64_t{3}; });
  });
  auto start = std::chrono::steady_clock::now();
  std::int64_t result = LedgerTwilightAgent::showRestartCountdownNotification();
  auto took = std::chrono::steady_clock::now() - start;
  user.join();
  EXPECT_TRUE(sawShown);
  EXPECT_EQ(result, 3);
  EXPECT_LT(took, 20s) << "an answer ends the countdown early";
  EXPECT_FALSE(LedgerTwilightAgent::isRestartCountdownShown());
}

TEST_F(RuntimeFacilityTest, TraceMessagesFromManyThreadsAreWholeLines) {
  constexpr int kThreads = 8;
  constexpr int kPerThread = 150;
  // Longer than a pipe buffer, so a line written in pieces would show.
  const std::string padding(6000, 'x');
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        LedgerTraceMessage("com.orvane.Quaymart.test",
                           PlistDictionary{{"thread", PlistValue(std::int64_t{t})},
                                           {"index", PlistValue(std::int64_t{i})},
                                           {"padding", PlistValue(padding)},
                                           {"bundle_id", "Third Party App"}});
      }
    });
  }
  for (auto& thread : threads) thread.join();
  LedgerTraceMessageWaitUntilWritten();

  const std::string path = temporary_ + "/STATE/larder/messagetrace.log";
  EXPECT_EQ(LedgerTraceMessageLogPath(), path);
  std::ifstream log(path);
  std::set<std::pair<int, int>> seen;
  std::string line;
  int lines = 0;
  while (std::getline(log, line)) {
    ++lines;
    nlohmann::json record = nlohmann::json::parse(line, nullptr, false);
    ASSERT_FALSE(record.is_discarded()) << "torn line " << lines;
    EXPECT_EQ(record["domain"], "com.orvane.Quaymart.test");
    EXPECT_EQ(record["message"]["padding"], padding);
    EXPECT_EQ(record["message"]["bundle_id"], "Third Party App");
    seen.emplace(record["message"]["thread"].get<int>(), record["message"]["index"].get<int>());
  }
  EXPECT_EQ(lines, kThreads * kPerThread);
  EXPECT_EQ(seen.size(), static_cast<std::size_t>(kThreads * kPerThread));
}

TEST_F(RuntimeFacilityTest, TraceLinesKeepEveryValueKind) {
  PlistDictionary message{{"success", true},
                          {"count", PlistValue(std::int64_t{-3})},
                          {"ratio", 0.5},
                          {"data", PlistValue(PlistData{'h', 'i', '!'})},
                          {"when", PlistValue(PlistDate{0})},
                          {"list", PlistValue(PlistArray{"a", PlistValue(std::int64_t{1})})},
                          {"odd", PlistValue(std::string("bad \xff byte"))}};
  nlohmann::json record = nlohmann::json::parse(
      LedgerTraceMessageLine("com.orvane.Quaymart.kinds", message, PlistDate{86400}));
  EXPECT_EQ(record["date"], "1970-01-02T00:00:00Z");
  EXPECT_EQ(record["message"]["success"], true);
  EXPECT_EQ(record["message"]["count"], -3);
  EXPECT_EQ(record["message"]["ratio"], 0.5);
  EXPECT_EQ(record["message"]["data"], "aGkh");
  EXPECT_EQ(record["message"]["when"], "1970-01-01T00:00:00Z");
  EXPECT_EQ(record["message"]["list"], nlohmann::json::array({"a", 1}));
  EXPECT_TRUE(record["message"]["odd"].is_string());
}

TEST_F(RuntimeFacilityTest, LocalizedTextComesFromTheClientsWordingThenTheDefaultThenTheKey) {
  const VendStoreClient store =
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication);
  const VendStoreClient books =
      VendStoreClient::initWithStoreClientType(VendStoreClient::kBookApplication);
  const LocalizedStringBundle framework = LocalizedStringBundle::tradelineFramework();
  const LocalizedStringBundle dialogs = LocalizedStringBundle::forVendDialog();
  const auto inFramework = [&](std::string_view key, std::string_view given) {
    return LedgerLocalizedStringFromTableInBundle(key, std::nullopt, framework, given, &store);
  };
  const std::pair<std::string, std::string_view> cases[] = {
      {inFramework("UPDATE_NOTIFICATION_LATER_BUTTON", ""), "Later"},
      {inFramework("NO_SUCH_KEY", "Fallback"), "Fallback"},
      {inFramework("NO_SUCH_KEY", ""), "NO_SUCH_KEY"},
      {LedgerLocalizedString("SOFTWARE_LICENSE_AGREEMENT_TITLE", nullptr),
       "Software License Agreement"},
      // The book client has wording of its own; the client-free lookup of
      // the bundle ignores it.
      {LedgerLocalizedString("UPDATES_AVAILABLE_NOTIFICATION_TITLE", &store), "Updates Available"},
      {LedgerLocalizedString("UPDATES_AVAILABLE_NOTIFICATION_TITLE", &books),
       "Book Updates Available"},
      {framework.localizedStringForKey("UPDATES_AVAILABLE_NOTIFICATION_TITLE", "", std::nullopt),
       "Updates Available"},
      // The runtime's own bundle answers the texts of its dialogs.
      {dialogs.localizedStringForKey("AUTOUPDATE_OPTIN_OK", "", std::nullopt), "Turn On"},
      {dialogs.localizedStringForKey("NOPE", "", std::nullopt), "NOPE"},
      {dialogs.localizedStringForKey("NOPE", "given", std::nullopt), "given"},
  };
  for (const auto& [text, expected] : cases) EXPECT_EQ(text, expected);
  // Texts the book client does not override are the common ones.
  EXPECT_EQ(LedgerLocalizedString("UPDATE_NOTIFICATION_DETAILS_BUTTON", &books),
            LedgerLocalizedString("UPDATE_NOTIFICATION_DETAILS_BUTTON", &store));

  // Each key the service uses must give text of its own, not the key back.
  for (std::string_view key :
       {"AC_POWER_MESSAGE", "CANCEL", "CANNOT_UPDATE_BODY", "CONFIRM_RESTART_TITLE_DOWNLOAD",
        "CRITICAL_UPDATES_INSTALL_NOW_RESTART_TEXT", "DOITLATER_HELPER_POWER_TEXT",
        "INSTALL_QUIT_APP_MULTIPLE_MESSAGE_FORMAT", "OVP_INVITE_NOTIFICATION_TITLE_FORMAT",
        "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_AND_OTHERS_FORMAT",
        "UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_RESTART_REQUIRED_OPTIN",
        "UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_SHOW_DETAILS_BUTTON"}) {
    const std::string text = LedgerLocalizedString(key, nullptr);
    EXPECT_NE(text, key);
    EXPECT_FALSE(text.empty()) << key;
  }
  EXPECT_NE(LedgerLocalizedString("CANNOT_UPDATE_BODY", nullptr).find("%@"), std::string::npos);
}

TEST_F(RuntimeFacilityTest, BundleOnDiskAnswersFromItsOwnTables) {
  std::string bundle = temporary_ + "/Update.bundle";
  writePlist(bundle + "/resources/Localizable.strings",
             PlistValue(PlistDictionary{{"MajorOS.Title", "A New System"}}));
  writePlist(bundle + "/resources/Other.strings",
             PlistValue(PlistDictionary{{"MajorOS.Title", "Other Table"}}));
  LocalizedStringBundle onDisk = LocalizedStringBundle::atPath(bundle);
  EXPECT_EQ(onDisk.localizedStringForKey("MajorOS.Title", "", std::nullopt), "A New System");
  EXPECT_EQ(onDisk.localizedStringForKey("MajorOS.Title", "", "Other"), "Other Table");
  EXPECT_EQ(onDisk.localizedStringForKey("MajorOS.Badge", "", std::nullopt), "MajorOS.Badge");
  // Table names cannot leave the bundle, and framework keys are not mixed in.
  EXPECT_EQ(onDisk.localizedStringForKey("MajorOS.Title", "", "../resources/Other"),
            "MajorOS.Title");
  EXPECT_EQ(onDisk.localizedStringForKey("CANCEL", "", std::nullopt), "CANCEL");
}

TEST_F(RuntimeFacilityTest, TildeExpandsAgainstTheRealHomeNotHOME) {
  const passwd* entry = ::getpwuid(::getuid());
  const std::string realHome = entry && entry->pw_dir ? entry->pw_dir : "";
  ASSERT_FALSE(realHome.empty());
  ASSERT_NE(realHome, home_);  // the fixture points HOME elsewhere
  const std::string base = realHome == "/" ? "" : realHome;
  const passwd* rootEntry = ::getpwnam("root");
  ASSERT_NE(rootEntry, nullptr);
  const std::pair<std::string, std::string> cases[] = {
      {"~/Library/Application Support/Books", base + "/Library/Application Support/Books"},
      {"~", realHome},
      {"~root/notes", std::string(rootEntry->pw_dir) + "/notes"},
      {"~no-such-user-x9/a", "~no-such-user-x9/a"},
      {"/srv/~/x", "/srv/~/x"},
      {"relative/~", "relative/~"},
      {"", ""},
  };
  for (const auto& [path, expanded] : cases)
    EXPECT_EQ(stringByExpandingTildeInPathOutsideOfSandbox(path), expanded) << path;
}

TEST_F(RuntimeFacilityTest, QueryStringHelperPlacesSeparatorsAndKeepsTheFragment) {
  struct Case {
    std::string_view url;
    std::string_view text;
    std::string_view expected;
  };
  const Case cases[] = {
      {"quaymart://showUpdatesPage", "source=notification",
       "quaymart://showUpdatesPage?source=notification"},
      {"https://h/p?a=1", "b=2", "https://h/p?a=1&b=2"},
      {"https://h/p?", "b=2", "https://h/p?b=2"},
      {"https://h/p?a=1&", "b=2", "https://h/p?a=1&b=2"},
      {"https://h/p#top", "b=2", "https://h/p?b=2#top"},
      {"https://h/p?a=1#x?y", "b=2", "https://h/p?a=1&b=2#x?y"},
      {"https://h/p?a=1", "&b=2", "https://h/p?a=1&b=2"},
      {"https://h/p", "?b=2", "https://h/p?b=2"},
      {"https://h/p?a=1", "", "https://h/p?a=1"},
      {"", "b=2", "?b=2"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(urlByAddingStringToQueryString(c.url, c.text), c.expected)
        << c.url << " + " << c.text;
  }
}

TEST_F(RuntimeFacilityTest, LockedApplicationsMayNotLaunch) {
  const std::string path = platformState("locked-applications.plist");
  EXPECT_EQ(LedgerLockedApplicationsFilePath(), path);
  EXPECT_TRUE(LedgerIsClientAppAllowedToLaunch("com.orvane.Quaymart"));

  writePlist(path, PlistValue(PlistArray{"com.example.Other", "com.orvane.Quaymart"}));
  EXPECT_FALSE(LedgerIsClientAppAllowedToLaunch("com.orvane.Quaymart"));
  EXPECT_TRUE(LedgerIsClientAppAllowedToLaunch("com.orvane.Quaymart.helper"));
  EXPECT_TRUE(LedgerIsClientAppAllowedToLaunch("com.orvane.quaymart"));

  // An empty list, a dictionary or a damaged file locks nothing.
  for (const std::string& text :
       {PropertyListSerialization::writeXml(PlistArray{}),
        PropertyListSerialization::writeXml(PlistDictionary{{"com.orvane.Quaymart", true}}),
        std::string("garbage")}) {
    writeText(path, text);
    EXPECT_TRUE(LedgerIsClientAppAllowedToLaunch("com.orvane.Quaymart")) << text;
  }
}

TEST_F(RuntimeFacilityTest, DimWakeGuestAndRecoveryComeFromTheirSources) {
  EXPECT_FALSE(LedgerIsDimWake());
  EXPECT_FALSE(LedgerOnRecoveryPartition());
  const std::string state = platformState("system-state.plist");
  writePlist(state, PlistValue(PlistDictionary{{"dimWake", true}, {"guestUser", true}}));
  EXPECT_TRUE(LedgerIsDimWake());
  EXPECT_TRUE(LedgerCurrentUserIsGuestUser());
  writePlist(state, PlistValue(PlistDictionary{{"guestUser", false}}));
  EXPECT_FALSE(LedgerIsDimWake());
  EXPECT_FALSE(LedgerCurrentUserIsGuestUser());

  for (const auto& [name, guest] : {std::pair{"guest", true},
                                    {"guest-a1b2c3", true},
                                    {"guest-", false},
                                    {"guesthouse", false},
                                    {"root", false},
                                    {"", false}}) {
    EXPECT_EQ(LedgerIsGuestUserName(name), guest) << name;
  }

  // Being set is what counts, whatever the value.
  for (const auto& [value, recovery] :
       {std::pair<const char*, bool>{nullptr, false}, {"", true}, {"1", true}}) {
    if (value)
      ::setenv("__OSINSTALL_ENVIRONMENT", value, 1);
    else
      ::unsetenv("__OSINSTALL_ENVIRONMENT");
    EXPECT_EQ(LedgerOnRecoveryPartition(), recovery) << (value ? value : "(unset)");
  }
}

TEST_F(RuntimeFacilityTest, CriticalUpdateTimeStampIsKeptPerUser) {
  EXPECT_FALSE(LedgerCriticalUpdateTimeStamp());
  double before = secondsNow();
  LedgerCreateCriticalUpdateTimeStamp();
  std::optional<PlistDate> stamp = LedgerCriticalUpdateTimeStamp();
  ASSERT_TRUE(stamp);
  EXPECT_GE(stamp->secondsSince1970, before - 1);
  EXPECT_LE(stamp->secondsSince1970, secondsNow() + 1);
  EXPECT_TRUE(fs::exists(temporary_ + "/CONFIG/larder/CriticalUpdate.plist"));
  // Another user's configuration folder has none.
  ::setenv("XDG_CONFIG_HOME", (temporary_ + "/other-config").c_str(), 1);
  EXPECT_FALSE(LedgerCriticalUpdateTimeStamp());
}

TEST_F(RuntimeFacilityTest, OSMajorVersionComesFromOSReleaseElseTheKernel) {
  utsname name{};
  ASSERT_EQ(::uname(&name), 0);
  const std::string release = name.release;
  const std::string kernelMajor = release.substr(0, release.find_first_not_of("0123456789"));
  const struct {
    const char* etc;
    const char* usr;  // nullptr: no such file
    std::string expected;
  } cases[] = {
      {"NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"13.2\"\nID=debian\n", "VERSION_ID=9\n", "13"},
      {"NAME=Ubuntu\n  VERSION_ID=22.04  \n", nullptr, "22"},
      // No version in /etc: the second place, then the kernel.
      {"NAME=rolling\n", "VERSION_ID='7'\n", "7"},
      {"NAME=rolling\n", nullptr, kernelMajor},
  };
  for (const auto& c : cases) {
    writeText(rooted("/etc/os-release"), c.etc);
    fs::remove(rooted("/usr/lib/os-release"));
    if (c.usr) writeText(rooted("/usr/lib/os-release"), c.usr);
    EXPECT_EQ(VendDevice::osMajorVersionString(), c.expected) << c.etc;
  }
  EXPECT_EQ(VendDevice::majorVersionOf("\"12\""), "12");
  EXPECT_EQ(VendDevice::majorVersionOf("bookworm"), "");
}

TEST_F(RuntimeFacilityTest, GuidPrefersMachineIdAndOtherwiseKeepsOneItMade) {
  const std::string machineId = "0123456789abcdef0123456789ABCDEF";
  writeText(rooted("/etc/machine-id"), machineId + "\n");
  EXPECT_EQ(VendDevice::guid(), machineId);

  writeText(rooted("/etc/machine-id"), "not-an-id\n");
  std::string made = VendDevice::guid();
  EXPECT_EQ(made.size(), 32u);
  EXPECT_NE(made, machineId);
  EXPECT_EQ(VendDevice::guid(), made) << "the identifier stays the same";
  EXPECT_EQ(readFile(platformState("machine-guid")), made + "\n");

  fs::remove(rooted("/etc/machine-id"));
  EXPECT_EQ(VendDevice::guid(), made);
}

TEST_F(RuntimeFacilityTest, AvailableDiskSpaceIsThatOfThePlatformRoot) {
  std::uint64_t space = VendDevice::availableDiskSpace();
  std::error_code code;
  fs::space_info info = fs::space(root_, code);
  ASSERT_FALSE(code);
  // Other processes write meanwhile; the two readings are close, not equal.
  double difference = static_cast<double>(space) - static_cast<double>(info.available);
  EXPECT_LT(std::abs(difference), 256.0 * 1024 * 1024);
  EXPECT_GT(space, 0u);
  ::setenv("LARDER_ROOT", (temporary_ + "/missing-root").c_str(), 1);
  EXPECT_EQ(VendDevice::availableDiskSpace(), 0u);
}

TEST_F(RuntimeFacilityTest, RootHelperWritesSystemPreferencesWithTheOSVersion) {
  writeText(rooted("/etc/os-release"), "VERSION_ID=\"13.1\"\n");
  const std::string path = rooted("/etc/larder/com.orvane.larderd.plist");
  EXPECT_EQ(LedgerRootHelper::systemPreferencesPath(), path);
  writePlist(path, PlistValue(PlistDictionary{{"OVPInviteURL", "https://example.test/invite"},
                                              {"OVPInviteOrgName", "Example"},
                                              {"Unrelated", "kept"}}));

  LedgerRootHelper::Proxy& proxy = LedgerRootHelper::sharedInstance().proxy();
  proxy.setAutoUpdateEnabledPreference(false);
  proxy.setAutoUpdateRestartRequiredEnabledPreference(true);
  proxy.setLastDoItLaterLogoutFailed(true);
  PlistValue stored = readPlist(path);
  ASSERT_TRUE(stored["AutoUpdateEnabled"].isBoolean());
  EXPECT_FALSE(stored["AutoUpdateEnabled"].boolValue());
  EXPECT_EQ(stored["AutoUpdateEnabledMajorOSVersion"], PlistValue("13"));
  EXPECT_TRUE(stored["AutoUpdateRestartRequiredEnabled"].boolValue());
  EXPECT_EQ(stored["AutoUpdateRestartRequiredMajorOSVersion"], PlistValue("13"));
  EXPECT_TRUE(stored["LastDoItLaterLogoutFailed"].boolValue());

  proxy.deleteOVPInviteFromPreferences();
  stored = readPlist(path);
  EXPECT_TRUE(stored["OVPInviteURL"].isNull());
  EXPECT_TRUE(stored["OVPInviteOrgName"].isNull());
  EXPECT_EQ(stored["Unrelated"], PlistValue("kept"));
  EXPECT_FALSE(stored["AutoUpdateEnabled"].boolValue());
}

TEST_F(RuntimeFacilityTest, RootHelperKeepsTheLockedPathsAsASet) {
  LedgerRootHelper::Proxy& proxy = LedgerRootHelper::sharedInstance().proxy();
  proxy.updateLockedFilePaths({"/Applications/A.app", "/Applications/B.app"}, true);
  proxy.updateLockedFilePaths({"/Applications/A.app"}, true);
  EXPECT_EQ(readPlist(platformState("locked-file-paths.plist")),
            PlistValue(PlistArray{"/Applications/A.app", "/Applications/B.app"}));
  proxy.updateLockedFilePaths({"/Applications/A.app", "/Applications/Never.app"}, false);
  EXPECT_EQ(readPlist(LedgerRootHelper::lockedFilePathsPath()),
            PlistValue(PlistArray{"/Applications/B.app"}));
}

TEST_F(RuntimeFacilityTest, StateFileChangesFromManyThreadsAreNotLost) {
  PlatformStateFile file(platformState("counter.plist"));
  constexpr int kThreads = 6;
  constexpr int kIncrements = 40;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < kIncrements; ++i) {
        file.updateDictionary([](PlistDictionary& state) {
          state["count"] = PlistValue(state)["count"].int64Value() + 1;
        });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(PlistValue(file.readDictionary())["count"].int64Value(), kThreads * kIncrements);
}

TEST_F(RuntimeFacilityTest, DockRecordsIconsPlaceholdersAndMessages) {
  VendStoreClient store =
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication);
  const std::string iconSource = temporary_ + "/icon.png";
  writeText(iconSource, "PNGDATA");
  LedgerDockMessaging& dock = LedgerDockMessaging::sharedInstance();
  dock.loadIconForIdentifier("061-12345", "file://" + iconSource, store);
  dock.loadIconForProductID(400100, "https://store.test/icon.png", store);
  dock.loadIconForIdentifier("../../escape", iconSource, store);

  std::string location = LedgerIconLocationForIdentifier(store.identifier(), "061-12345");
  EXPECT_EQ(readFile(location), "PNGDATA");
  std::string escaped = LedgerIconLocationForIdentifier(store.identifier(), "../../escape");
  EXPECT_EQ(fs::path(escaped).parent_path(), fs::path(location).parent_path());
  EXPECT_EQ(readFile(escaped), "PNGDATA");

  LedgerRootHelper::sharedInstance().proxy().createPlaceholderWithName("Big Update", 0,
                                                                       PlistData{1, 2, 3});
  dock.createPlaceholderWithName("Other", 0, PlistData{});
  dock.removePlaceholderWithName("Other");
  dock.sendMessageForUpdate(
      PlistDictionary{{"productKey", "061-12345"}, {"title", "Big Update"}},
      PlistDictionary{{"state", PlistValue(std::int64_t{2})}, {"percentComplete", 40.0}});

  PlistValue state = readPlist(LedgerDockMessaging::stateFilePath());
  const std::string iconKey = store.identifier() + "/061-12345";
  EXPECT_EQ(state["icons"][iconKey]["url"], PlistValue("file://" + iconSource));
  EXPECT_EQ(state["icons"][iconKey]["location"], PlistValue(location));
  // The remote icon is recorded, which is when a fetch would have written it.
  EXPECT_EQ(state["icons"][store.identifier() + "/400100"]["url"],
            PlistValue("https://store.test/icon.png"));
  EXPECT_FALSE(fs::exists(LedgerIconLocationForIdentifier(store.identifier(), "400100")))
      << "remote icons are recorded, not fetched";
  EXPECT_EQ(state["placeholders"]["Big Update"]["iconData"], PlistValue(PlistData{1, 2, 3}));
  EXPECT_TRUE(state["placeholders"]["Other"].isNull());
  EXPECT_EQ(state["messages"]["061-12345"]["status"]["percentComplete"], PlistValue(40.0));

  LedgerRootHelper::sharedInstance().proxy().removePlaceholderWithName("Big Update");
  EXPECT_TRUE(
      readPlist(LedgerDockMessaging::stateFilePath())["placeholders"]["Big Update"].isNull());
}

TEST_F(RuntimeFacilityTest, StoreApplicationLaunchIsRecordedAndStarted) {
  const std::string url = "quaymart://showUpdatesPage?source=installer";
  EXPECT_TRUE(LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url));
  PlistValue state = readPlist(LedgerQuaymartLauncher::stateFilePath());
  ASSERT_TRUE(state["launches"].isArray());
  ASSERT_EQ(state["launches"].array()->size(), 1u);
  EXPECT_EQ(state["launches"].array()->at(0)["url"], PlistValue(url));
  EXPECT_FALSE(state["launches"].array()->at(0)["launched"].boolValue());

  const std::string script = temporary_ + "/store-app.sh";
  const std::string output = temporary_ + "/store-app.out";
  writeText(script, "#!/bin/sh\nprintf '%s' \"$1\" > '" + output + ".tmp' && mv '" + output +
                        ".tmp' '" + output + "'\n");
  ASSERT_EQ(::chmod(script.c_str(), 0755), 0);
  ::setenv("LARDER_STORE_APP", script.c_str(), 1);
  EXPECT_TRUE(LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url));
  auto deadline = std::chrono::steady_clock::now() + 10s;
  while (!fs::exists(output) && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(20ms);
  }
  EXPECT_EQ(readFile(output), url);
  state = readPlist(LedgerQuaymartLauncher::stateFilePath());
  ASSERT_EQ(state["launches"].array()->size(), 2u);
  EXPECT_TRUE(state["launches"].array()->at(1)["launched"].boolValue());

  ::setenv("LARDER_STORE_APP", (temporary_ + "/no-such-program").c_str(), 1);
  EXPECT_FALSE(LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url));
}

TEST_F(RuntimeFacilityTest, StoreSoftwareIsTheBundleWithAPurchaseRecord) {
  const PlistDictionary info{{"HostBundleIdentifier", "com.example.store"}};
  std::string store = makeBundle(
      rooted("/Applications/Store.app"), info,
      PropertyListSerialization::writeXml(PlistDictionary{{"bundleIdentifier", "com.example.store"},
                                                          {"bundleVersion", "1.0"},
                                                          {"wareID", std::int64_t{4242}}}));
  EXPECT_TRUE(VendFileManager::isQuaymartAppAtPath(store));
  for (const std::string& path :
       {makeBundle(rooted("/Applications/Plain.app"), info),
        makeBundle(rooted("/Applications/Damaged.app"), info,
                   std::string("<plist><dict><key>wareID")),
        makeBundle(rooted("/Applications/Array.app"), {},
                   PropertyListSerialization::writeXml(PlistValue(PlistArray{"a"}))),
        rooted("/Applications/Missing.app"), store + "/purchase.plist"}) {
    EXPECT_FALSE(VendFileManager::isQuaymartAppAtPath(path)) << path;
  }
}

TEST_F(RuntimeFacilityTest, InstallableMeansAReplaceableBundleInAnApplicationFolder) {
  PlistDictionary info{{"HostBundleIdentifier", "com.example.app"}};
  std::string top = makeBundle(rooted("/Applications/App.app"), info);
  fs::create_directories(rooted("/Applications/Folder"));
  fs::create_directory_symlink(top, rooted("/Applications/Link.app"));
  const std::pair<std::string, bool> cases[] = {
      {top, true},
      {top + "/", true},
      {makeBundle(rooted("/Applications/Utilities/Tool.app"), info), true},
      {makeBundle(home_ + "/Applications/Mine.app", info), true},
      {makeBundle(rooted("/Volumes/Disk/Applications/There.app"), info), true},
      {makeBundle(rooted("/opt/Elsewhere.app"), info), false},
      {makeBundle(top + "/helpers/Helper.app", info), false},
      {rooted("/Applications/Folder"), false},
      {rooted("/Applications/Link.app"), false},
      {rooted("/Applications/Missing.app"), false},
      {rooted("/Applications/../opt/Elsewhere.app"), false},
  };
  for (const auto& [path, installable] : cases) {
    EXPECT_EQ(VendFileManager::isInstallableAtPath(path), installable) << path;
  }
}

TEST_F(RuntimeFacilityTest, BundleInAFolderWeCannotWriteIsNotInstallable) {
  std::string locked = rooted("/Applications/Locked");
  std::string lockedBundle =
      makeBundle(locked + "/Held.app", {{"HostBundleIdentifier", "com.example.app"}});
  testing::UnprivilegedUser user(temporary_);
  ASSERT_EQ(user.failure(), "");
  ASSERT_TRUE(VendFileManager::isInstallableAtPath(lockedBundle));
  ASSERT_EQ(::chmod(locked.c_str(), 0555), 0);
  lockedFolders_.push_back(locked);
  EXPECT_FALSE(VendFileManager::isInstallableAtPath(lockedBundle));
}

TEST_F(RuntimeFacilityTest, DisplayNamePrefersTheBundlesOwnNames) {
  std::string bare = makeBundle(rooted("/Applications/Bare Folder.app"), {});
  const std::pair<std::string, std::string> cases[] = {
      {makeBundle(rooted("/Applications/Both.app"),
                  {{"HostBundleDisplayName", "Shown Name"}, {"HostBundleName", "Name"}}),
       "Shown Name"},
      {makeBundle(rooted("/Applications/NameOnly.app"),
                  {{"HostBundleDisplayName", ""}, {"HostBundleName", "Plain Name"}}),
       "Plain Name"},
      {bare, "Bare Folder"},
      {bare + "/", "Bare Folder"},
      {rooted("/Applications/Gone.app"), "Gone"},
  };
  for (const auto& [path, name] : cases) EXPECT_EQ(VendFileManager::displayNameAtPath(path), name);
}

TEST(VendHTTPTransfer, RedirectsNeverDowngradeAndLeaveTheAccountAtItsOrigin) {
  using Redirect = VendHTTPTransfer::Redirect;
  const struct {
    const char* from;
    const char* to;
    Redirect expected;
  } cases[] = {
      {"https://store.example/a", "https://store.example/b", Redirect::kFollow},
      {"https://store.example/a", "https://STORE.example:443/b", Redirect::kFollow},
      {"http://store.example/a", "https://store.example/b", Redirect::kFollowWithoutAccount},
      {"https://store.example/a", "https://cdn.example/b", Redirect::kFollowWithoutAccount},
      {"https://store.example/a", "https://store.example:8443/b", Redirect::kFollowWithoutAccount},
      {"https://store.example/a", "http://store.example/b", Redirect::kRefuse},
      {"https://store.example/a", "ftp://store.example/b", Redirect::kRefuse},
      {"http://store.example/a", "file:///etc/passwd", Redirect::kRefuse},
      {"https://store.example/a", "not a url", Redirect::kRefuse},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(VendHTTPTransfer::redirectPolicy(c.from, c.to), c.expected)
        << c.from << " -> " << c.to;
  }
}

}  // namespace
}  // namespace larder
