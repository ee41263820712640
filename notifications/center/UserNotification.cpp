#include "notifications/center/UserNotification.h"

#include <cmath>

namespace larder {

namespace {

using Clock = std::chrono::system_clock;

PlistDate plistDate(Clock::time_point point) {
  return PlistDate{std::chrono::duration<double>(point.time_since_epoch()).count()};
}

// Dates are kept to the microsecond (see UserNotificationCenter), which a
// double of seconds holds exactly enough to round back to.
Clock::time_point timePoint(PlistDate date) {
  return Clock::time_point(std::chrono::round<std::chrono::microseconds>(
      std::chrono::duration<double>(date.secondsSince1970)));
}

// Each reader leaves the field as it is when the value is missing or of
// another type, so that a record written by an older service still reads.
void readString(const PlistDictionary& dictionary, std::string_view key, std::string& field) {
  auto found = dictionary.find(key);
  if (found != dictionary.end() && found->second.isString()) field = *found->second.string();
}

void readBool(const PlistDictionary& dictionary, std::string_view key, bool& field) {
  auto found = dictionary.find(key);
  if (found != dictionary.end() && found->second.isBoolean()) field = found->second.boolValue();
}

void readInteger(const PlistDictionary& dictionary, std::string_view key, std::int64_t& field) {
  auto found = dictionary.find(key);
  if (found != dictionary.end() && found->second.isInteger()) field = found->second.int64Value();
}

}  // namespace

std::string UserNotification::source() const {
  auto found = userInfo.find("Source");
  return found != userInfo.end() && found->second.string() ? *found->second.string()
                                                           : std::string();
}

PlistDictionary UserNotification::toDictionary() const {
  PlistArray alternates(alternateActionButtonTitles.begin(), alternateActionButtonTitles.end());
  PlistDictionary dictionary{
      {"title", title},
      {"informativeText", informativeText},
      {"actionButtonTitle", actionButtonTitle},
      {"otherButtonTitle", otherButtonTitle},
      {"hasActionButton", hasActionButton},
      {"userInfo", userInfo},
      {"displayStyle", displayStyle},
      {"imageURL", imageURL},
      {"poofsOnCancel", poofsOnCancel},
      {"alternateActionButtonTitles", std::move(alternates)},
      {"alwaysShowAlternateActionMenu", alwaysShowAlternateActionMenu},
      {"style", style},
      {"clearable", clearable},
      {"identifier", identifier},
      {"serverIdentifier", std::int64_t{serverIdentifier}},
      {"displayed", displayed},
      {"activationType", activationType},
      {"alternateActionIndex", alternateActionIndex},
  };
  if (actualDeliveryDate) dictionary["actualDeliveryDate"] = plistDate(*actualDeliveryDate);
  return dictionary;
}

std::optional<UserNotification> UserNotification::fromDictionary(
    const PlistDictionary& dictionary) {
  UserNotification notification;
  readString(dictionary, "identifier", notification.identifier);
  if (notification.identifier.empty()) return std::nullopt;
  readString(dictionary, "title", notification.title);
  readString(dictionary, "informativeText", notification.informativeText);
  readString(dictionary, "actionButtonTitle", notification.actionButtonTitle);
  readString(dictionary, "otherButtonTitle", notification.otherButtonTitle);
  readBool(dictionary, "hasActionButton", notification.hasActionButton);
  if (auto found = dictionary.find("userInfo");
      found != dictionary.end() && found->second.isDictionary()) {
    notification.userInfo = *found->second.dictionary();
  }
  readInteger(dictionary, "displayStyle", notification.displayStyle);
  readString(dictionary, "imageURL", notification.imageURL);
  readBool(dictionary, "poofsOnCancel", notification.poofsOnCancel);
  if (auto found = dictionary.find("alternateActionButtonTitles");
      found != dictionary.end() && found->second.isArray()) {
    for (const PlistValue& title : *found->second.array()) {
      if (title.isString()) notification.alternateActionButtonTitles.push_back(*title.string());
    }
  }
  readBool(dictionary, "alwaysShowAlternateActionMenu", notification.alwaysShowAlternateActionMenu);
  readInteger(dictionary, "style", notification.style);
  readBool(dictionary, "clearable", notification.clearable);
  if (auto found = dictionary.find("actualDeliveryDate");
      found != dictionary.end() && found->second.isDate() &&
      std::isfinite(found->second.date()->secondsSince1970)) {
    notification.actualDeliveryDate = timePoint(*found->second.date());
  }
  std::int64_t serverIdentifier = 0;
  readInteger(dictionary, "serverIdentifier", serverIdentifier);
  // A number the server cannot have given counts as none.
  if (serverIdentifier > 0 && serverIdentifier <= std::int64_t{UINT32_MAX}) {
    notification.serverIdentifier = static_cast<std::uint32_t>(serverIdentifier);
  }
  readBool(dictionary, "displayed", notification.displayed);
  readInteger(dictionary, "activationType", notification.activationType);
  readInteger(dictionary, "alternateActionIndex", notification.alternateActionIndex);
  return notification;
}

}  // namespace larder
