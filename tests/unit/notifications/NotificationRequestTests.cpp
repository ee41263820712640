// How a notification becomes the arguments of the server's Notify call.
#include <gtest/gtest.h>

#include "notifications/center/NotificationRequest.h"

namespace larder::testing {
namespace {

UserNotification banner() {
  UserNotification notification;
  notification.title = "Updates Available";
  notification.informativeText = "3 updates <b>ready</b> & waiting";
  notification.actionButtonTitle = "Update";
  notification.otherButtonTitle = "Later";
  return notification;
}

struct MappingCase {
  std::string name;
  UserNotification notification;
  std::vector<std::string> actions;
  std::uint8_t urgency;
  bool resident;
  std::string imagePath;
  std::int32_t expireTimeout;
};

TEST(NotificationRequestTest, MapsEachKindOfNotification) {
  UserNotification alertThatStays = banner();
  alertThatStays.displayStyle = UserNotification::kAlert;
  alertThatStays.poofsOnCancel = false;

  UserNotification alertWithMenu = banner();
  alertWithMenu.displayStyle = UserNotification::kAlert;
  alertWithMenu.alternateActionButtonTitles = {"Try Tonight", "Remind Me Tomorrow"};

  UserNotification noActionButton = banner();
  noActionButton.hasActionButton = false;
  noActionButton.otherButtonTitle.clear();

  UserNotification emptyActionTitle = banner();
  emptyActionTitle.actionButtonTitle.clear();

  UserNotification withImage = banner();
  withImage.imageURL = "/usr/share/icons/larder.png";

  const std::vector<MappingCase> cases{
      {"banner", banner(), {"default", "", "action", "Update", "other", "Later"}, 0, false, "", -1},
      {"alert that stays",
       alertThatStays,
       {"default", "", "action", "Update", "other", "Later"},
       2,
       true,
       "",
       0},
      {"alert with menu",
       alertWithMenu,
       {"default", "", "action", "Update", "other", "Later", "alternate-0", "Try Tonight",
        "alternate-1", "Remind Me Tomorrow"},
       1,
       false,
       "",
       -1},
      {"no action button", noActionButton, {"default", ""}, 0, false, "", -1},
      {"empty action title", emptyActionTitle, {"default", "", "other", "Later"}, 0, false, "", -1},
      {"image",
       withImage,
       {"default", "", "action", "Update", "other", "Later"},
       0,
       false,
       "/usr/share/icons/larder.png",
       -1},
  };
  for (const MappingCase& row : cases) {
    SCOPED_TRACE(row.name);
    const NotificationRequest request = NotificationRequest::forNotification(row.notification);
    EXPECT_EQ(request.appName, "larder");
    EXPECT_EQ(request.replacesId, 0u);
    EXPECT_EQ(request.appIcon, "");
    EXPECT_EQ(request.summary, "Updates Available");
    // Markup goes as it is: the server decides what it means.
    EXPECT_EQ(request.body, "3 updates <b>ready</b> & waiting");
    EXPECT_EQ(request.actions, row.actions);
    EXPECT_EQ(request.urgency, row.urgency);
    EXPECT_EQ(request.resident, row.resident);
    EXPECT_EQ(request.imagePath, row.imagePath);
    EXPECT_EQ(request.desktopEntry, "larder");
    EXPECT_EQ(request.expireTimeout, row.expireTimeout);
  }
}

}  // namespace
}  // namespace larder::testing
