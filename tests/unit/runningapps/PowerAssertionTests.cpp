#include <gtest/gtest.h>

#include "store-runtime/host/LedgerPowerAssertion.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "tests/unit/runningapps/AppTestSupport.h"

namespace larder {
namespace {

class PowerAssertionTest : public ::testing::Test {
 protected:
  static PlistDictionary assertions() {
    PlistValue state(PlatformStateFile::named(LedgerPowerAssertion::kFileName).readDictionary());
    const PlistDictionary* found = state["assertions"].dictionary();
    return found ? *found : PlistDictionary{};
  }

  // A root other than "/": the record, never the real logind.
  testing::AppTestRoot root_;
};

TEST_F(PowerAssertionTest, TheRecordAppearsAndGoesOnRelease) {
  Result<std::uint32_t> first =
      LedgerPowerAssertion::create("PreventUserIdleSystemSleep", "Installing");
  Result<std::uint32_t> second =
      LedgerPowerAssertion::create("PreventSystemSleep", "Quitting apps");
  ASSERT_TRUE(first) << first.errorDescription();
  ASSERT_TRUE(second) << second.errorDescription();
  EXPECT_NE(*first, 0u);
  EXPECT_NE(*first, *second);

  PlistDictionary stored = assertions();
  ASSERT_EQ(stored.size(), 2u);
  const PlistValue& record = stored[std::to_string(*first)];
  EXPECT_EQ(*record["type"].string(), "PreventUserIdleSystemSleep");
  EXPECT_EQ(*record["name"].string(), "Installing");
  EXPECT_TRUE(record["date"].isDate());

  EXPECT_EQ(LedgerPowerAssertion::release(*first), 0);
  stored = assertions();
  EXPECT_EQ(stored.count(std::to_string(*first)), 0u);
  EXPECT_EQ(stored.count(std::to_string(*second)), 1u);
  EXPECT_EQ(LedgerPowerAssertion::release(*first), LedgerPowerAssertion::kNotFoundCode);
  EXPECT_EQ(LedgerPowerAssertion::release(*second), 0);
  EXPECT_TRUE(assertions().empty());
}

TEST_F(PowerAssertionTest, ThermalEmergencyCountIsReadFromTheSystemState) {
  EXPECT_EQ(LedgerDimWakeThermalEmergencyCount(), 0);
  ASSERT_TRUE(
      PlatformStateFile::named("system-state.plist").updateDictionary([](PlistDictionary& state) {
        state["dimWakeThermalEmergencyCount"] = 3;
      }));
  EXPECT_EQ(LedgerDimWakeThermalEmergencyCount(), 3);
}

}  // namespace
}  // namespace larder
