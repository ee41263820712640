#include "store-runtime/dialogs/VendDialog.h"

#include <array>

#include "platform/log/TillLogManager.h"
#include "platform/system/Uuid.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendDialog";

// The keys the dialog reads itself. Every other key of the dictionary is
// kept and handed to the agent as it came.
constexpr std::array<std::string_view, 8> kOwnKeys{
    "identifier",         "message",           "explanation", "okButtonString",
    "cancelButtonString", "otherButtonString", "kind",        "content"};

std::string textFor(const PlistDictionary& dictionary, std::string_view key) {
  auto found = dictionary.find(key);
  if (found == dictionary.end()) return {};
  const std::string* text = found->second.string();
  return text ? *text : std::string();
}

// A button exists when its key holds a string; an empty string still asks
// for the button, which then carries the title of its role.
std::optional<std::string> buttonTitleFor(const PlistDictionary& dictionary, std::string_view key,
                                          std::string_view titleOfRole) {
  auto found = dictionary.find(key);
  if (found == dictionary.end() || !found->second.isString()) return std::nullopt;
  const std::string& title = *found->second.string();
  return title.empty() ? std::string(titleOfRole) : title;
}

VendDialog::Kind kindFor(const PlistDictionary& dictionary) {
  auto found = dictionary.find("kind");
  if (found == dictionary.end() || !found->second.isInteger()) return VendDialog::kAlert;
  switch (found->second.int64Value()) {
    case VendDialog::kSignIn:
      return VendDialog::kSignIn;
    case VendDialog::kFirmwareWarning:
      return VendDialog::kFirmwareWarning;
    case VendDialog::kLicenseAgreement:
      return VendDialog::kLicenseAgreement;
    default:
      return VendDialog::kAlert;
  }
}

bool isOwnKey(std::string_view key) {
  for (std::string_view own : kOwnKeys) {
    if (own == key) return true;
  }
  return false;
}

std::optional<VendDialogButton> buttonWithTitle(const std::optional<std::string>& title,
                                                VendDialogButton::Role role) {
  if (!title) return std::nullopt;
  return VendDialogButton{*title, role};
}

}  // namespace

VendDialog VendDialog::dialogWithDictionary(const PlistDictionary& dictionary) {
  VendDialog dialog;
  dialog.identifier_ = Uuid::generateString();
  dialog.message_ = textFor(dictionary, "message");
  dialog.explanation_ = textFor(dictionary, "explanation");
  dialog.okButtonString_ = buttonTitleFor(dictionary, "okButtonString", "OK");
  dialog.cancelButtonString_ = buttonTitleFor(dictionary, "cancelButtonString", "Cancel");
  dialog.otherButtonString_ = buttonTitleFor(dictionary, "otherButtonString", "Other");
  // A dialog must offer a way out.
  if (!dialog.okButtonString_ && !dialog.cancelButtonString_ && !dialog.otherButtonString_) {
    dialog.okButtonString_ = "OK";
  }
  dialog.kind_ = kindFor(dictionary);
  dialog.content_ = textFor(dictionary, "content");
  for (const auto& [key, value] : dictionary) {
    if (!isOwnKey(key)) dialog.otherFields_.emplace(key, value);
  }
  return dialog;
}

void VendDialog::dismissDialogWithDictionary(const PlistDictionary& dictionary) {
  const std::string identifier = textFor(dictionary, "identifier");
  if (identifier.empty()) {
    TILL_LOG(1, "%@: Cannot dismiss a dialog without identifier: %@", kSpeaker,
             PlistValue(dictionary));
    return;
  }
  auto exitCode = dictionary.find("exitCode");
  const std::int64_t code = exitCode != dictionary.end() && exitCode->second.isInteger()
                                ? exitCode->second.int64Value()
                                : kNoButtonExitCode;
  TILL_LOG(2, "%@: Dismissing dialog %@ with exit code %@", kSpeaker, identifier, code);
  if (auto presenter = VendRuntime::shared()->dialogPresenter())
    presenter->dismiss(identifier, code);
}

std::optional<VendDialogButton> VendDialog::okButton() const {
  return buttonWithTitle(okButtonString_, VendDialogButton::kOK);
}

std::optional<VendDialogButton> VendDialog::cancelButton() const {
  return buttonWithTitle(cancelButtonString_, VendDialogButton::kCancel);
}

std::optional<VendDialogButton> VendDialog::otherButton() const {
  return buttonWithTitle(otherButtonString_, VendDialogButton::kOther);
}

std::optional<VendDialogButton> VendDialog::buttonForExitCode(std::int64_t exitCode) const {
  switch (exitCode) {
    case VendDialogButton::kOK:
      return okButton();
    case VendDialogButton::kCancel:
      return cancelButton();
    case VendDialogButton::kOther:
      return otherButton();
    default:
      return std::nullopt;
  }
}

PlistDictionary VendDialog::toDictionary() const {
  PlistDictionary dictionary = otherFields_;
  dictionary["identifier"] = identifier_;
  dictionary["message"] = message_;
  dictionary["explanation"] = explanation_;
  if (okButtonString_) dictionary["okButtonString"] = *okButtonString_;
  if (cancelButtonString_) dictionary["cancelButtonString"] = *cancelButtonString_;
  if (otherButtonString_) dictionary["otherButtonString"] = *otherButtonString_;
  dictionary["kind"] = static_cast<std::int64_t>(kind_);
  dictionary["content"] = content_;
  return dictionary;
}

}  // namespace larder
