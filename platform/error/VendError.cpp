#include "platform/error/VendError.h"

namespace larder {

namespace {

std::optional<std::string> userInfoText(const PlistDictionary& userInfo, std::string_view key) {
  auto found = userInfo.find(key);
  if (found == userInfo.end()) return std::nullopt;
  const std::string* text = found->second.string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

}  // namespace

VendError VendError::make(std::int64_t code, std::optional<std::string> title,
                          std::optional<std::string> message) {
  VendError error;
  error.code = code;
  if (message) {
    error.description = *message;
  } else if (title) {
    error.description = *title;
  }
  if (title) error.userInfo[std::string(kTitleKey)] = std::move(*title);
  if (message) error.userInfo[std::string(kMessageKey)] = std::move(*message);
  return error;
}

VendError VendError::withDomain(std::string domain, std::int64_t code,
                                std::optional<std::string> message) {
  VendError error = make(code, std::nullopt, std::move(message));
  error.domain = std::move(domain);
  return error;
}

VendError VendError::cancelledByUser() {
  return make(kCancelledCode, "AC check failed",
              "Can't start because the user canceled the dialog.");
}

VendError VendError::notAuthorized() {
  return make(kNotAuthorizedCode, "Authorization failed",
              "Not authorized to proceed with updates.");
}

VendError VendError::alreadyInstalled() {
  return make(kAlreadyInstalledCode, std::nullopt, "Skipping download");
}

VendError VendError::notEnoughDiskSpace() {
  return make(kNotEnoughDiskSpaceCode, "Disk check failed",
              "Can't start because there is not enough disk space.");
}

VendError VendError::noUniqueTaggedUpdate() {
  return make(kNoUniqueTaggedUpdateCode);
}

VendError VendError::urlBagKeyMissing() {
  return make(kURLBagKeyMissingCode, "DAAP Key not in Bag");
}

std::optional<std::string> VendError::title() const {
  return userInfoText(userInfo, kTitleKey);
}

std::optional<std::string> VendError::message() const {
  return userInfoText(userInfo, kMessageKey);
}

std::string VendError::descriptionText() const {
  return "Error Domain=" + domain + " Code=" + std::to_string(code) + " \"" + description + "\"";
}

PlistDictionary VendError::toDictionary() const {
  PlistDictionary dictionary = userInfo;
  dictionary["domain"] = domain;
  dictionary["code"] = code;
  dictionary["description"] = description;
  return dictionary;
}

std::optional<VendError> VendError::fromDictionary(const PlistDictionary& dictionary) {
  if (dictionary.empty()) return std::nullopt;
  VendError error;
  PlistValue wrapped(dictionary);
  if (const std::string* domain = wrapped["domain"].string()) error.domain = *domain;
  error.code = wrapped["code"].int64Value();
  if (const std::string* text = wrapped["description"].string()) error.description = *text;
  for (const auto& [key, value] : dictionary) {
    if (key != "domain" && key != "code" && key != "description") error.userInfo[key] = value;
  }
  return error;
}

}  // namespace larder
