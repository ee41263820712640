// The restart countdown as a notification: posted through the center,
// answered by an activation that reaches the service's delegate, taken
// away when the countdown ends.
#include <gtest/gtest.h>

#include <future>

#include "ServiceTestSupport.h"
#include "notifications/activation/UserNotificationCenterDelegate.h"
#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "notifications/center/UserNotificationCenter.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder::testing {
namespace {

class QuietContext final : public UpdateNotificationContext {
 public:
  bool isAutoUpdatedEnabled() const override { return false; }
  bool isAutoUpdatedOfRestartRequiredUpdatesEnabled() const override { return false; }
  bool shouldOfferDoItLaterForAppUpdates(const std::vector<LedgerUpdateRef>&,
                                         const std::vector<SysupQuaymartUpdate>&) const override {
    return false;
  }
  bool shouldOfferDoItLaterForAvailableUpdates() const override { return false; }
  std::optional<std::string> cacheUpdateAuditInfo(const PlistDictionary&) override {
    return std::nullopt;
  }
  void resetUpdatesAvailableNotificationTimestamp() override {}
};

struct ButtonCase {
  const char* actionKey;
  std::int64_t result;
};

class RestartCountdownNotificationTest : public ServiceTest,
                                         public ::testing::WithParamInterface<ButtonCase> {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    // Long enough that only an answer ends it within the test.
    ASSERT_TRUE(PlatformStateFile(LedgerTwilightAgent::stateFilePath())
                    .updateDictionary([](PlistDictionary& state) {
                      state[std::string(LedgerTwilightAgent::kCountdownSecondsKey)] = 120.0;
                    }));
    center_ = UserNotificationCenter::makeForTesting("com.orvane.larderd",
                                                     UserNotificationCenter::kSystemCenter,
                                                     temporary() + "/delivered.plist");
    UserNotificationCenterDelegate::sharedInstance().attachTo(*center_);
  }

  // The countdown once it is in the list.
  std::optional<UserNotification> waitForCountdown() const {
    std::optional<UserNotification> found;
    eventually([&] {
      for (const UserNotification& notification : center_->deliveredNotifications()) {
        if (notification.source() == UpdateNotificationCatalogue::kSourceRestartCountdown) {
          found = notification;
        }
      }
      return found.has_value();
    });
    return found;
  }

  VendStoreClient client_ = VendStoreClient::fromDictionary(
      {{"identifier", "test-client"}, {"clientType", 0}, {"frameworkVersion", 3}});
  QuietContext context_;
  std::shared_ptr<UserNotificationCenter> center_;
};

TEST_P(RestartCountdownNotificationTest, AButtonAnswersTheCountdownAndTheNotificationGoes) {
  UpdateNotificationCatalogue catalogue(client_, context_, center_);
  auto result = std::async(std::launch::async,
                           [&catalogue] { return catalogue.showRestartCountdownNotification(); });

  const std::optional<UserNotification> countdown = waitForCountdown();
  ASSERT_TRUE(countdown);
  EXPECT_EQ(countdown->title, "Restarting to Install Updates");
  EXPECT_EQ(countdown->actionButtonTitle, "Restart Now");
  EXPECT_EQ(countdown->otherButtonTitle, "Later");
  EXPECT_EQ(countdown->displayStyle, UserNotification::kAlert);
  ASSERT_TRUE(center_->activate(countdown->identifier, GetParam().actionKey));

  ASSERT_EQ(result.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_EQ(result.get(), GetParam().result);
  EXPECT_TRUE(center_->deliveredNotifications().empty());
  // No notification server in this test: the agent recorded the countdown
  // all the same.
  PlistValue state(PlatformStateFile(LedgerTwilightAgent::stateFilePath()).readDictionary());
  EXPECT_EQ(state[LedgerTwilightAgent::kCountdownCountKey].int64Value(), 1);
  EXPECT_EQ(state[LedgerTwilightAgent::kLastCountdownResultKey].int64Value(), GetParam().result);
  EXPECT_FALSE(state[LedgerTwilightAgent::kCountdownShownKey].boolValue());
}

INSTANTIATE_TEST_SUITE_P(Buttons, RestartCountdownNotificationTest,
                         ::testing::Values(ButtonCase{"action", 1}, ButtonCase{"other", 3}));

TEST_F(ServiceTest, OnlyTheCountdownsButtonsAnswerIt) {
  UserNotification countdown;
  countdown.userInfo = PlistDictionary{{"Source", "RestartCountdown"}};
  countdown.activationType = UserNotification::kContentsClicked;
  EXPECT_EQ(UpdateNotificationCatalogue::restartCountdownAnswer(countdown, false), std::nullopt);
  countdown.activationType = UserNotification::kActionButtonClicked;
  EXPECT_EQ(UpdateNotificationCatalogue::restartCountdownAnswer(countdown, false), 1);
  EXPECT_EQ(UpdateNotificationCatalogue::restartCountdownAnswer(countdown, true), 3);
  UserNotification other = countdown;
  other.userInfo = PlistDictionary{{"Source", "AppUpdate"}};
  EXPECT_EQ(UpdateNotificationCatalogue::restartCountdownAnswer(other, false), std::nullopt);
  EXPECT_EQ(UpdateNotificationCatalogue::restartCountdownAnswer(other, true), std::nullopt);
}

}  // namespace
}  // namespace larder::testing
