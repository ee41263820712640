#pragma once

#include <cstdint>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "client/DialogAgentProtocol.h"
#include "platform/value/PlistValue.h"

namespace larder {

// One dialog put to the person at the terminal: shows the dialog, asks for
// a button and, when a sign-in dialog is confirmed, for the account name
// and password, and turns the typed lines into the agent's answer.
//
// A button is chosen by its exit code (1, 0, 2), its title, or the words
// ok, cancel and other; an empty line chooses the OK button when the
// dialog has one.
class DialogPrompt {
 public:
  DialogPrompt(const PlistDictionary& fields, std::ostream& out);

  // Prints the dialog and the first question.
  void show();
  // Takes one typed line; the answer once nothing more is needed.
  std::optional<DialogAgentProtocol::Answer> take(const std::string& line);
  // The answer when the input ends before the dialog is complete.
  static DialogAgentProtocol::Answer endOfInputAnswer();
  // The text of a dialog for a terminal: the few markup tags that dialogs
  // use become line breaks and list items; other text stays as it is.
  static std::string plainText(std::string_view markup);
  // The next line is a password, which should not be echoed.
  [[nodiscard]] bool wantsSecret() const { return step_ == Step::kPassword; }

 private:
  enum class Step { kChoice, kAccountName, kPassword };
  struct Button {
    std::int64_t exitCode;
    std::string title;
  };

  void askForChoice();
  std::optional<std::int64_t> choiceFor(const std::string& line) const;

  PlistDictionary fields_;
  std::ostream& out_;
  std::vector<Button> buttons_;
  bool signIn_ = false;
  Step step_ = Step::kChoice;
  std::int64_t chosen_ = DialogAgentProtocol::kCancel;
  std::string accountName_;
};

}  // namespace larder
