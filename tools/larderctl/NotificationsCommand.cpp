#include "tools/larderctl/NotificationsCommand.h"

#include <algorithm>
#include <iostream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/StoreCommands.h"

namespace larder {

namespace {

std::string textOf(const PlistValue& notification, const char* key) {
  const std::string* text = notification[key].string();
  return text ? *text : std::string();
}

}  // namespace

std::string NotificationsCommand::actionKeyFor(const std::optional<std::string>& action) {
  if (!action) return "default";
  if (!action->empty() &&
      std::ranges::all_of(*action, [](char c) { return c >= '0' && c <= '9'; })) {
    return "alternate-" + *action;
  }
  return *action;
}

std::string NotificationsCommand::describe(const PlistValue& notification) {
  const PlistValue& userInfo = notification["userInfo"];
  std::string text = textOf(notification, "identifier") + "  " +
                     (userInfo["Source"].string() ? *userInfo["Source"].string() : "-") + "  " +
                     (notification["displayed"].boolValue() ? "on screen" : "not on screen") +
                     "\n  " + textOf(notification, "title");
  if (const std::string body = textOf(notification, "informativeText"); !body.empty()) {
    text += "\n  " + body;
  }
  std::string buttons;
  if (notification["hasActionButton"].boolValue())
    buttons = textOf(notification, "actionButtonTitle");
  if (const std::string other = textOf(notification, "otherButtonTitle"); !other.empty()) {
    buttons += (buttons.empty() ? "" : " / ") + other;
  }
  if (!buttons.empty()) text += "\n  buttons: " + buttons;
  if (const PlistArray* menu = notification["alternateActionButtonTitles"].array();
      menu && !menu->empty()) {
    text += "\n  menu:";
    for (std::size_t entry = 0; entry < menu->size(); ++entry) {
      const std::string* title = (*menu)[entry].string();
      text += " " + std::to_string(entry) + ") " + (title ? *title : "");
    }
  }
  return text;
}

int NotificationsCommand::list() {
  const PlistValue notifications = client_.callNotifications("DeliveredNotifications", {}).at(0);
  const PlistArray* list = notifications.array();
  if (json_) {
    std::cout << JsonConversion::toJson(notifications).dump() << std::endl;
  } else if (!list || list->empty()) {
    std::cout << "no notifications delivered" << std::endl;
  } else {
    for (const PlistValue& notification : *list) std::cout << describe(notification) << std::endl;
  }
  return list && !list->empty() ? kExitSuccess : kExitNothingToDo;
}

int NotificationsCommand::activate(const std::string& identifier,
                                   const std::optional<std::string>& action) {
  const std::string key = actionKeyFor(action);
  const PlistValue error =
      client_.callNotifications("ActivateNotification", {identifier, key}).at(0);
  if (error.dictionary() && !error.dictionary()->empty()) {
    return StoreCommands::reportFailure("activating notification " + identifier + " with " + key,
                                        error, json_);
  }
  if (!json_) std::cout << "activated " << identifier << " with " << key << std::endl;
  return kExitSuccess;
}

}  // namespace larder
