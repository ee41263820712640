#include "tools/larderctl/DialogPrompt.h"

#include <algorithm>
#include <cctype>

namespace larder {

namespace {

std::string lowercase(std::string text) {
  std::ranges::transform(text, text.begin(),
                         [](unsigned char character) { return std::tolower(character); });
  return text;
}

std::string trimmed(const std::string& text) {
  const auto first = text.find_first_not_of(" \t\r");
  if (first == std::string::npos) return {};
  const auto last = text.find_last_not_of(" \t\r");
  return text.substr(first, last - first + 1);
}

std::string textField(const PlistDictionary& fields, std::string_view key) {
  auto found = fields.find(key);
  if (found == fields.end() || !found->second.string()) return {};
  return *found->second.string();
}

std::string_view roleWord(std::int64_t exitCode) {
  switch (exitCode) {
    case DialogAgentProtocol::kOK:
      return "ok";
    case DialogAgentProtocol::kOther:
      return "other";
    default:
      return "cancel";
  }
}

}  // namespace

DialogPrompt::DialogPrompt(const PlistDictionary& fields, std::ostream& out)
    : fields_(fields), out_(out) {
  const std::pair<std::string_view, std::int64_t> keys[] = {
      {"okButtonString", DialogAgentProtocol::kOK},
      {"cancelButtonString", DialogAgentProtocol::kCancel},
      {"otherButtonString", DialogAgentProtocol::kOther}};
  for (const auto& [key, exitCode] : keys) {
    auto found = fields_.find(key);
    if (found != fields_.end() && found->second.string()) {
      buttons_.push_back({exitCode, *found->second.string()});
    }
  }
  if (buttons_.empty()) buttons_.push_back({DialogAgentProtocol::kOK, "OK"});
  auto kind = fields_.find("kind");
  signIn_ = kind != fields_.end() && kind->second.int64Value() == DialogAgentProtocol::kSignInKind;
}

std::string DialogPrompt::plainText(std::string_view markup) {
  static constexpr std::pair<std::string_view, std::string_view> kTags[] = {
      {"<br>", "\n"}, {"<li>", "\n  - "}, {"</li>", ""}, {"<ul>", ""}, {"</ul>", ""}};
  std::string text;
  for (std::size_t i = 0; i < markup.size();) {
    const auto* tag = std::ranges::find_if(
        kTags, [&](const auto& entry) { return markup.substr(i).starts_with(entry.first); });
    if (tag == std::end(kTags)) {
      text += markup[i++];
    } else {
      text += tag->second;
      i += tag->first.size();
    }
  }
  return text;
}

void DialogPrompt::show() {
  out_ << "\n== " << textField(fields_, "message") << " ==\n";
  if (std::string explanation = textField(fields_, "explanation"); !explanation.empty()) {
    out_ << plainText(explanation) << "\n";
  }
  if (std::string content = textField(fields_, "content"); !content.empty()) {
    out_ << "\n" << content << "\n";
  }
  askForChoice();
}

void DialogPrompt::askForChoice() {
  out_ << "Choose";
  for (const Button& button : buttons_) {
    out_ << " [" << button.exitCode << "] " << button.title;
  }
  out_ << ": " << std::flush;
}

std::optional<std::int64_t> DialogPrompt::choiceFor(const std::string& line) const {
  const std::string typed = lowercase(trimmed(line));
  for (const Button& button : buttons_) {
    if (typed.empty() && button.exitCode == DialogAgentProtocol::kOK) return button.exitCode;
    if (typed == std::to_string(button.exitCode) || typed == roleWord(button.exitCode) ||
        typed == lowercase(button.title)) {
      return button.exitCode;
    }
  }
  return std::nullopt;
}

std::optional<DialogAgentProtocol::Answer> DialogPrompt::take(const std::string& line) {
  switch (step_) {
    case Step::kChoice: {
      std::optional<std::int64_t> choice = choiceFor(line);
      if (!choice) {
        out_ << "No such button. ";
        askForChoice();
        return std::nullopt;
      }
      if (!signIn_ || *choice != DialogAgentProtocol::kOK)
        return DialogAgentProtocol::Answer{*choice, {}};
      chosen_ = *choice;
      step_ = Step::kAccountName;
      const std::string suggested = textField(fields_, "accountName");
      out_ << "Account name" << (suggested.empty() ? "" : " [" + suggested + "]") << ": "
           << std::flush;
      return std::nullopt;
    }
    case Step::kAccountName: {
      accountName_ = trimmed(line);
      if (accountName_.empty()) accountName_ = textField(fields_, "accountName");
      step_ = Step::kPassword;
      out_ << "Password: " << std::flush;
      return std::nullopt;
    }
    case Step::kPassword:
      out_ << "\n";
      return DialogAgentProtocol::Answer{chosen_,
                                         {{"accountName", accountName_}, {"password", line}}};
  }
  return std::nullopt;
}

DialogAgentProtocol::Answer DialogPrompt::endOfInputAnswer() {
  return DialogAgentProtocol::Answer{DialogAgentProtocol::kCancel, {}};
}

}  // namespace larder
