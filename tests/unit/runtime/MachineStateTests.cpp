// The machine's power, login sessions and administrator settings, each
// read from a fake tree below a temporary platform root.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/LedgerPowerSource.h"
#include "store-runtime/host/LedgerSessionList.h"
#include "store-runtime/host/LedgerSystemSettings.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "tests/unit/RunLoopThread.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using testing::RunLoopThread;
using testing::ScopedEnvironment;
using testing::TemporaryFolder;

constexpr auto kGenerous = 5s;
constexpr auto kQuickPoll = 10ms;

// One supply: its attribute files and their text.
using Supply = std::map<std::string, std::string>;
using Supplies = std::map<std::string, Supply>;

class MachineStateTest : public ::testing::Test {
 protected:
  void SetUp() override { environment_.set("LARDER_ROOT", folder_ / "root"); }

  std::string rooted(const std::string& path) const { return folder_ / ("root/" + path); }

  // Atomic, so that a poll never reads a half-written attribute.
  void writeText(const std::string& rootedPath, std::string_view text) const {
    ASSERT_TRUE(FileIO::writeAtomically(rooted(rootedPath), text));
  }
  void writePlist(const std::string& rootedPath, const PlistValue& value) const {
    writeText(rootedPath, PropertyListSerialization::writeXml(value));
  }
  void installSupplies(const Supplies& supplies) const {
    for (const auto& [name, attributes] : supplies) {
      for (const auto& [attribute, text] : attributes) {
        writeText("sys/class/power_supply/" + name + "/" + attribute, text + "\n");
      }
    }
  }

  TemporaryFolder folder_;
  ScopedEnvironment environment_;
};

const Supply kUnpluggedAdapter = {{"type", "Mains"}, {"online", "0"}};

TEST_F(MachineStateTest, RemainingTimeFollowsTheSuppliesRule) {
  struct Case {
    const char* name;
    Supplies supplies;
    double expected;
  };
  const std::vector<Case> cases = {
      {"mains",
       {{"AC", {{"type", "Mains"}, {"online", "1"}}},
        {"BAT0", {{"type", "Battery"}, {"energy_now", "100"}, {"power_now", "10"}}}},
       LedgerPowerSource::kUnlimitedRemainingTime},
      {"no supplies is a desktop", {}, LedgerPowerSource::kUnlimitedRemainingTime},
      {"battery by energy",
       {{"AC", kUnpluggedAdapter},
        {"BAT0", {{"type", "Battery"}, {"energy_now", "36000000"}, {"power_now", "12000000"}}}},
       10800},
      {"battery by charge, negative current",
       {{"BAT0", {{"type", "Battery"}, {"charge_now", "2000000"}, {"current_now", "-1000000"}}}},
       7200},
      {"zero power draw falls back to charge",
       {{"BAT0",
         {{"type", "Battery"},
          {"energy_now", "5000"},
          {"power_now", "0"},
          {"charge_now", "3000"},
          {"current_now", "6000"}}}},
       1800},
      {"two batteries add up",
       {{"AC", kUnpluggedAdapter},
        {"BAT0", {{"type", "Battery"}, {"energy_now", "36000000"}, {"power_now", "12000000"}}},
        {"BAT1", {{"type", "Battery"}, {"charge_now", "2000000"}, {"current_now", "1000000"}}}},
       18000},
      {"only batteries that give both count",
       {{"BAT0", {{"type", "Battery"}, {"energy_now", "36000000"}, {"power_now", "12000000"}}},
        {"BAT1", {{"type", "Battery"}, {"energy_now", "999"}}}},
       10800},
      {"a mouse's battery is not the machine's",
       {{"AC", kUnpluggedAdapter},
        {"BAT0", {{"type", "Battery"}, {"energy_now", "36000000"}, {"power_now", "12000000"}}},
        {"hidpp_battery_0",
         {{"type", "Battery"}, {"scope", "Device"}, {"energy_now", "900"}, {"power_now", "1"}}}},
       10800},
      {"zero draw",
       {{"BAT0", {{"type", "Battery"}, {"energy_now", "100"}, {"power_now", "0"}}}},
       LedgerPowerSource::kUnknownRemainingTime},
      {"garbage text",
       {{"BAT0",
         {{"type", "Battery"},
          {"energy_now", "lots"},
          {"power_now", "12x"},
          {"charge_now", "nan"},
          {"current_now", "inf"}}}},
       LedgerPowerSource::kUnknownRemainingTime},
      {"a battery without readings",
       {{"AC", kUnpluggedAdapter}, {"BAT0", {{"type", "Battery"}}}},
       LedgerPowerSource::kUnknownRemainingTime},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove_all(rooted("sys"));
    installSupplies(c.supplies);
    EXPECT_DOUBLE_EQ(LedgerPowerSource::remainingTimeEstimate(), c.expected);
  }
}

TEST_F(MachineStateTest, BatteryWarningComesFromTheDriversWordElseTheCharge) {
  struct Case {
    const char* name;
    Supplies supplies;
    std::int64_t expected;
  };
  auto battery = [](Supply attributes) {
    attributes["type"] = "Battery";
    return attributes;
  };
  const std::vector<Case> cases = {
      {"mains power never warns",
       {{"AC", {{"type", "Mains"}, {"online", "1"}}},
        {"BAT0", battery({{"capacity_level", "Critical"}})}},
       LedgerPowerSource::kNoWarning},
      {"no battery", {{"AC", kUnpluggedAdapter}}, LedgerPowerSource::kNoWarning},
      {"driver says low",
       {{"BAT0", battery({{"capacity_level", "Low"}, {"capacity", "80"}})}},
       LedgerPowerSource::kEarlyWarning},
      {"driver says critical",
       {{"BAT0", battery({{"capacity_level", "Critical"}})}},
       LedgerPowerSource::kFinalWarning},
      {"driver says normal at a low charge",
       {{"BAT0", battery({{"capacity_level", "Normal"}, {"capacity", "3"}})}},
       LedgerPowerSource::kNoWarning},
      {"unknown level falls back to the charge",
       {{"BAT0", battery({{"capacity_level", "Unknown"}, {"capacity", "10"}})}},
       LedgerPowerSource::kEarlyWarning},
      {"charge at the final threshold",
       {{"BAT0", battery({{"capacity", "5"}})}},
       LedgerPowerSource::kFinalWarning},
      {"charge above the early threshold",
       {{"BAT0", battery({{"capacity", "11"}})}},
       LedgerPowerSource::kNoWarning},
      {"the fullest battery decides",
       {{"BAT0", battery({{"capacity_level", "Critical"}})},
        {"BAT1", battery({{"capacity", "8"}})}},
       LedgerPowerSource::kEarlyWarning},
      {"a mouse's empty battery is not the machine's",
       {{"BAT0", battery({{"capacity", "60"}})},
        {"hidpp_battery_0", battery({{"scope", "Device"}, {"capacity_level", "Critical"}})}},
       LedgerPowerSource::kNoWarning},
      {"unreadable charge gives no warning",
       {{"BAT0", battery({{"capacity", "low"}})}},
       LedgerPowerSource::kNoWarning},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove_all(rooted("sys"));
    installSupplies(c.supplies);
    EXPECT_EQ(LedgerPowerSource::batteryWarningLevel(), c.expected);
  }
}

// Counts the callbacks of one observation and notes the thread they ran on.
struct CallbackLog {
  std::atomic<int> calls{0};
  std::atomic<std::thread::id> thread{};
  DispatchSemaphore called;

  std::function<void()> callback() {
    return [this] {
      thread = std::this_thread::get_id();
      ++calls;
      called.signal();
    };
  }
};

TEST_F(MachineStateTest, ObservationHearsEachFlipOnItsLoop) {
  installSupplies({{"AC", {{"type", "Mains"}, {"online", "1"}}}, {"BAT0", {{"type", "Battery"}}}});
  RunLoopThread loopThread;
  CallbackLog log;
  auto observation =
      LedgerPowerSource::observeLimitedPowerChanges(log.callback(), loopThread.loop(), kQuickPoll);
  ASSERT_NE(observation, nullptr);

  writeText("sys/class/power_supply/AC/online", "0\n");
  ASSERT_TRUE(log.called.waitFor(kGenerous));
  EXPECT_EQ(log.calls, 1);
  EXPECT_EQ(log.thread.load(), loopThread.id());

  writeText("sys/class/power_supply/AC/online", "1\n");
  ASSERT_TRUE(log.called.waitFor(kGenerous));
  EXPECT_EQ(log.calls, 2);
}

// An observation ended inside its callback or from another thread hears no further flip. A
// live poll would be due within one interval of the flip, and the loop fires due timers in the
// order of their due times, so once a marker due two intervals after the flip has fired, a
// live poll would have heard it.
TEST_F(MachineStateTest, EndedObservationHearsNoMore) {
  for (const bool endInsideCallback : {true, false}) {
    SCOPED_TRACE(endInsideCallback ? "ended inside its callback" : "ended by the test's thread");
    installSupplies({{"AC", {{"type", "Mains"}, {"online", "1"}}}});
    RunLoopThread loopThread;
    std::atomic<int> calls{0};
    DispatchSemaphore called;
    std::unique_ptr<LedgerPowerSource::Observation> observation;
    observation = LedgerPowerSource::observeLimitedPowerChanges(
        [&] {
          ++calls;
          if (endInsideCallback) observation.reset();
          called.signal();
        },
        loopThread.loop(), kQuickPoll);
    ASSERT_NE(observation, nullptr);

    writeText("sys/class/power_supply/AC/online", "0\n");
    ASSERT_TRUE(called.waitFor(kGenerous));
    if (!endInsideCallback) observation.reset();

    writeText("sys/class/power_supply/AC/online", "1\n");
    DispatchSemaphore markerFired;
    loopThread.loop().addTimer(2 * kQuickPoll, false, [&] { markerFired.signal(); });
    ASSERT_TRUE(markerFired.waitFor(kGenerous));
    EXPECT_EQ(calls, 1);
  }
}

TEST_F(MachineStateTest, SessionFileCountsFinishedLogins) {
  struct Case {
    const char* name;
    std::optional<std::string> fileText;  // nullopt: no file
    std::size_t expected;
  };
  auto session = [](const char* user, PlistValue state) {
    return PlistValue(PlistDictionary{{"user", PlistValue(user)}, {"state", std::move(state)}});
  };
  const std::string states = PropertyListSerialization::writeXml(PlistValue(
      PlistArray{session("ada", "active"), session("bob", "online"), session("cy", "opening"),
                 session("dee", "closing"), session("eve", PlistValue(std::int64_t{1})),
                 PlistValue("online"), PlistValue(PlistDictionary{{"user", PlistValue("fay")}})}));
  const std::vector<Case> cases = {
      {"states", states, 2},
      {"a dictionary instead of a list",
       PropertyListSerialization::writeXml(PlistValue(PlistDictionary{{"state", "active"}})), 0},
      {"damaged", "<plist><array><dict><key>state", 0},
      {"missing", std::nullopt, 0},
  };
  const std::string path = PlatformStateFile::pathForName("sessions.plist");
  EXPECT_EQ(path, rooted("var/lib/larder-platform/sessions.plist"));
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove(path);
    if (c.fileText) writeText("var/lib/larder-platform/sessions.plist", *c.fileText);
    EXPECT_EQ(LedgerSessionList::loggedInSessionCount(), c.expected);
  }
}

TEST_F(MachineStateTest, SystemPowerSettingsAreTheFilesDictionary) {
  EXPECT_EQ(LedgerSystemSettings::powerSettingsPath(), rooted("etc/larder/power-settings.plist"));
  EXPECT_TRUE(LedgerSystemSettings::systemPowerSettings().empty());

  const PlistDictionary settings = {{"SleepDisabled", PlistValue(true)},
                                    {"DisplaySleepMinutes", PlistValue(std::int64_t{10})}};
  writePlist("etc/larder/power-settings.plist", PlistValue(settings));
  EXPECT_EQ(LedgerSystemSettings::systemPowerSettings(), settings);

  writePlist("etc/larder/power-settings.plist", PlistValue(PlistArray{PlistValue(true)}));
  EXPECT_TRUE(LedgerSystemSettings::systemPowerSettings().empty());
  writeText("etc/larder/power-settings.plist", "<plist><dict><key>");
  EXPECT_TRUE(LedgerSystemSettings::systemPowerSettings().empty());
}

TEST_F(MachineStateTest, MajorOSUpdatesAreManagedOnlyByATrueBoolean) {
  struct Case {
    const char* name;
    std::optional<std::string> fileText;
    bool expected;
  };
  auto profiles = [](PlistValue managed) {
    return PropertyListSerialization::writeXml(
        PlistValue(PlistDictionary{{"areMajorOSUpdatesManaged", std::move(managed)}}));
  };
  const std::vector<Case> cases = {
      {"true", profiles(PlistValue(true)), true},
      {"false", profiles(PlistValue(false)), false},
      {"an integer is not a boolean", profiles(PlistValue(std::int64_t{1})), false},
      {"absent", PropertyListSerialization::writeXml(PlistValue(PlistDictionary{})), false},
      {"damaged", "<plist><dict><key>areMajorOSUpdatesManaged</key><true/>", false},
      {"missing", std::nullopt, false},
  };
  const std::string path = LedgerSystemSettings::configurationProfilesPath();
  EXPECT_EQ(path, rooted("etc/larder/configuration-profiles.plist"));
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove(path);
    if (c.fileText) writeText("etc/larder/configuration-profiles.plist", *c.fileText);
    EXPECT_EQ(LedgerSystemSettings::areMajorOSUpdatesManaged(), c.expected);
  }
}

}  // namespace
}  // namespace larder
