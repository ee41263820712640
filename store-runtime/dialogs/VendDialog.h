#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// One button of a dialog. Buttons compare "superficially" by title and
// role, which is how callers tell which one the user chose.
struct VendDialogButton {
  enum Role : std::int64_t { kCancel = 0, kOK = 1, kOther = 2 };

  std::string title;
  Role role = kCancel;

  [[nodiscard]] bool isEqual(const VendDialogButton& other, bool superficial) const {
    return role == other.role && (superficial || title == other.title);
  }
};

// A dialog shown to the logged-in user through a dialog agent. Made from a
// dictionary with "message" (title), "explanation" (body),
// "okButtonString", "cancelButtonString" and "otherButtonString". The exit
// code of a shown dialog is the role of the chosen button: 1 for OK.
class VendDialog {
 public:
  // What kind of answer the agent is asked for. A sign-in dialog also
  // answers with "accountName" and "password".
  enum Kind : std::int64_t { kAlert = 0, kSignIn = 1, kFirmwareWarning = 2, kLicenseAgreement = 3 };
  // The exit code of a dialog taken down from outside without a choice: no
  // button has it, so the waiting side can tell it from a user's answer.
  static constexpr std::int64_t kNoButtonExitCode = -1;

  static VendDialog dialogWithDictionary(const PlistDictionary& dictionary);
  // Takes down, from outside, the shown dialog with this identifier.
  static void dismissDialogWithDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] const std::string& identifier() const { return identifier_; }
  [[nodiscard]] const std::string& message() const { return message_; }
  [[nodiscard]] const std::string& explanation() const { return explanation_; }
  [[nodiscard]] Kind kind() const { return kind_; }
  void setKind(Kind kind) { kind_ = kind; }
  // The long text of a firmware warning or licence agreement.
  [[nodiscard]] const std::string& content() const { return content_; }
  void setContent(std::string content) { content_ = std::move(content); }

  [[nodiscard]] std::optional<VendDialogButton> okButton() const;
  [[nodiscard]] std::optional<VendDialogButton> cancelButton() const;
  [[nodiscard]] std::optional<VendDialogButton> otherButton() const;
  // The button of an exit code, if the dialog has it.
  [[nodiscard]] std::optional<VendDialogButton> buttonForExitCode(std::int64_t exitCode) const;

  // What a dialog agent gets: the dictionary keys above plus "identifier",
  // "kind" and "content", and any other key the dialog was made with (a
  // sign-in dialog's "accountName", for instance), unchanged.
  [[nodiscard]] PlistDictionary toDictionary() const;

 private:
  std::string identifier_;
  std::string message_;
  std::string explanation_;
  std::optional<std::string> okButtonString_;
  std::optional<std::string> cancelButtonString_;
  std::optional<std::string> otherButtonString_;
  std::string content_;
  Kind kind_ = kAlert;
  PlistDictionary otherFields_;
};

// The answer of a dialog agent.
struct VendDialogAnswer {
  std::int64_t exitCode = VendDialogButton::kCancel;
  // Extra answers: "accountName" and "password" for a sign-in dialog.
  PlistDictionary values;
  // No one saw the dialog (no agent to show it): the cancel is nobody's
  // choice, and an error should say so.
  bool nobodyAsked = false;
};

}  // namespace larder
