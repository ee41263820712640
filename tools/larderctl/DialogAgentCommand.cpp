#include "tools/larderctl/DialogAgentCommand.h"

#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <iostream>
#include <memory>
#include <optional>
#include <stdexcept>

#include <sdbus-c++/Error.h>
#include <nlohmann/json.hpp>

#include "platform/system/StopSignals.h"
#include "tools/larderctl/DialogAgent.h"
#include "tools/larderctl/DialogPrompt.h"

namespace larder {

namespace {

using Clock = std::chrono::steady_clock;

int terminationSignalDescriptor() {
  sigset_t signals = StopSignals::set();
  const int descriptor = ::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK);
  if (descriptor < 0) throw std::runtime_error("cannot watch for signals");
  return descriptor;
}

std::int64_t exitCodeForAnswer(const std::string& answer) {
  if (answer == "ok") return DialogAgentProtocol::kOK;
  if (answer == "other") return DialogAgentProtocol::kOther;
  return DialogAgentProtocol::kCancel;
}

std::string textField(const PlistDictionary& fields, std::string_view key) {
  auto found = fields.find(key);
  if (found == fields.end() || !found->second.string()) return {};
  return *found->second.string();
}

std::string buttonTitle(const PlistDictionary& fields, std::int64_t exitCode) {
  switch (exitCode) {
    case DialogAgentProtocol::kOK:
      return textField(fields, "okButtonString");
    case DialogAgentProtocol::kCancel:
      return textField(fields, "cancelButtonString");
    case DialogAgentProtocol::kOther:
      return textField(fields, "otherButtonString");
    default:
      return {};
  }
}

// Standard input read without blocking the agent's loop: whole lines, and
// whether the input has ended.
class InputLines {
 public:
  // Reads what is there now.
  void fill() {
    char buffer[4096];
    const ssize_t count = ::read(STDIN_FILENO, buffer, sizeof buffer);
    if (count > 0) {
      pending_.append(buffer, static_cast<std::size_t>(count));
    } else if (count == 0 || (errno != EINTR && errno != EAGAIN)) {
      ended_ = true;
      // The last line may lack its newline.
      if (!pending_.empty() && pending_.back() != '\n') pending_ += '\n';
    }
  }

  std::optional<std::string> nextLine() {
    const auto end = pending_.find('\n');
    if (end == std::string::npos) return std::nullopt;
    std::string line = pending_.substr(0, end);
    pending_.erase(0, end + 1);
    if (!line.empty() && line.back() == '\r') line.pop_back();
    return line;
  }

  // No more lines will come.
  [[nodiscard]] bool ended() const { return ended_ && pending_.find('\n') == std::string::npos; }

 private:
  std::string pending_;
  bool ended_ = false;
};

// Keeps a typed password off the screen while it lives.
class EchoSuppression {
 public:
  EchoSuppression() {
    if (::tcgetattr(STDIN_FILENO, &saved_) != 0) return;
    termios quiet = saved_;
    quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    active_ = ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet) == 0;
  }
  ~EchoSuppression() {
    if (active_) ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &saved_);
  }
  EchoSuppression(const EchoSuppression&) = delete;
  EchoSuppression& operator=(const EchoSuppression&) = delete;

 private:
  termios saved_{};
  bool active_ = false;
};

}  // namespace

// One run of the agent: the loop that waits for dialogs, dismissals,
// typed lines, signals and the delay of a fixed answer.
class DialogAgentCommand::Session {
 public:
  Session(ServiceClient& client, const DialogAgentOptions& options)
      : client_(client),
        options_(options),
        agent_(client.connection(), kObjectPath),
        signals_(terminationSignalDescriptor()) {}

  int run() {
    agent_.watchServiceRestarts(client_.connection(), client_.serviceName());
    registerAgent();
    while (!done()) {
      if (!current_) startNextDialog();
      if (done()) break;
      if (!waitForEvents()) break;
    }
    unregister();
    return 0;
  }

 private:
  [[nodiscard]] bool interactive() const { return options_.answer.empty(); }
  [[nodiscard]] bool done() const { return options_.count > 0 && handled_ >= options_.count; }

  // Takes queued dialogs until one needs to wait: for the person, or for
  // the delay of a fixed answer.
  void startNextDialog() {
    while (!current_ && !done()) {
      std::optional<DialogAgent::Dialog> dialog = agent_.takeDialog();
      if (!dialog) return;
      current_ = std::move(dialog);
      std::cerr << "larderctl: showing dialog " << current_->identifier << std::endl;
      if (interactive()) {
        if (input_.ended()) {
          answerCurrent(DialogPrompt::endOfInputAnswer());
          continue;
        }
        prompt_ = std::make_unique<DialogPrompt>(current_->fields, std::cout);
        prompt_->show();
        feedPrompt();
      } else if (options_.delaySeconds > 0) {
        deadline_ = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                       std::chrono::duration<double>(options_.delaySeconds));
      } else {
        answerCurrent(fixedAnswer());
      }
    }
  }

  // False when a signal asks the agent to end.
  bool waitForEvents() {
    const bool readsInput = interactive() && current_ && !input_.ended();
    pollfd descriptors[] = {{agent_.wakeDescriptor(), POLLIN, 0},
                            {signals_.get(), POLLIN, 0},
                            {readsInput ? STDIN_FILENO : -1, POLLIN, 0}};
    if (::poll(descriptors, 3, pollTimeout()) < 0 && errno != EINTR) {
      throw std::runtime_error("poll failed");
    }
    if (descriptors[1].revents != 0) return false;
    if (descriptors[0].revents != 0) {
      agent_.drainWake();
      // A restarted service has forgotten its agents.
      if (agent_.takeServiceRestart()) registerAgent();
      handleDismissals();
    }
    if (descriptors[2].revents != 0) readInput();
    if (deadline_ && Clock::now() >= *deadline_) answerCurrent(fixedAnswer());
    return true;
  }

  void registerAgent() {
    client_.callDialogAgents("RegisterDialogAgent", {std::string(kObjectPath)});
    std::cerr << "larderctl: dialog agent " << client_.connection().getUniqueName() << " "
              << kObjectPath << " registered" << std::endl;
  }

  [[nodiscard]] int pollTimeout() const {
    if (!deadline_) return -1;
    auto remaining =
        std::chrono::duration_cast<std::chrono::milliseconds>(*deadline_ - Clock::now());
    return static_cast<int>(std::max<std::int64_t>(remaining.count() + 1, 0));
  }

  [[nodiscard]] DialogAgentProtocol::Answer fixedAnswer() const {
    DialogAgentProtocol::Answer answer{exitCodeForAnswer(options_.answer), {}};
    const bool signIn =
        current_ && current_->fields.contains("kind") &&
        current_->fields.at("kind").int64Value() == DialogAgentProtocol::kSignInKind;
    if (signIn && !options_.accountName.empty()) {
      answer.values = {{"accountName", options_.accountName}, {"password", options_.password}};
    }
    return answer;
  }

  void readInput() {
    input_.fill();
    feedPrompt();
    if (current_ && prompt_ && input_.ended()) {
      std::cout << std::endl;
      std::cerr << "larderctl: end of input; dialogs are answered with cancel" << std::endl;
      answerCurrent(DialogPrompt::endOfInputAnswer());
    }
  }

  void feedPrompt() {
    while (current_ && prompt_) {
      std::optional<std::string> line = input_.nextLine();
      if (!line) return;
      std::optional<DialogAgentProtocol::Answer> answer = prompt_->take(*line);
      if (answer) {
        answerCurrent(*answer);
        return;
      }
      if (prompt_->wantsSecret() && ::isatty(STDIN_FILENO) && !echoOff_) echoOff_.emplace();
    }
  }

  void answerCurrent(const DialogAgentProtocol::Answer& answer) {
    DialogAgent::Dialog dialog = std::move(*current_);
    endCurrent();
    // A dismissal got there first; it is reported as such.
    if (!agent_.answer(dialog.ticket, answer)) return;
    report(dialog, answer.exitCode, answer.values, false);
  }

  void endCurrent() {
    current_.reset();
    prompt_.reset();
    deadline_.reset();
    echoOff_.reset();
  }

  void handleDismissals() {
    for (const DialogAgent::Dismissal& dismissal : agent_.takeDismissals()) {
      if (current_ && current_->ticket == dismissal.dialog.ticket) {
        if (prompt_) std::cout << "\n(taken down by the service)" << std::endl;
        endCurrent();
      }
      report(dismissal.dialog, dismissal.exitCode, {}, true);
    }
  }

  void report(const DialogAgent::Dialog& dialog, std::int64_t exitCode,
              const PlistDictionary& values, bool dismissed) {
    ++handled_;
    const std::string message = textField(dialog.fields, "message");
    if (options_.json) {
      nlohmann::json line{{"identifier", dialog.identifier},
                          {"message", message},
                          {"exitCode", exitCode},
                          {"dismissed", dismissed}};
      // The password stays off the output.
      if (std::string account = textField(values, "accountName"); !account.empty()) {
        line["accountName"] = account;
      }
      std::cout << line.dump() << std::endl;
      return;
    }
    if (dismissed) {
      std::cout << "dismissed \"" << message << "\" with " << exitCode << std::endl;
      return;
    }
    std::cout << "answered " << exitCode;
    if (std::string title = buttonTitle(dialog.fields, exitCode); !title.empty()) {
      std::cout << " (" << title << ")";
    }
    std::cout << " to \"" << message << "\"";
    if (std::string account = textField(values, "accountName"); !account.empty()) {
      std::cout << " as " << account;
    }
    std::cout << std::endl;
  }

  void unregister() {
    try {
      client_.callDialogAgents("UnregisterDialogAgent", {std::string(kObjectPath)});
    } catch (const sdbus::Error& error) {
      std::cerr << "larderctl: could not unregister: " << error.getMessage() << std::endl;
    }
  }

  ServiceClient& client_;
  const DialogAgentOptions& options_;
  DialogAgent agent_;
  FileDescriptor signals_;
  InputLines input_;
  std::optional<DialogAgent::Dialog> current_;
  std::unique_ptr<DialogPrompt> prompt_;
  std::optional<Clock::time_point> deadline_;
  std::optional<EchoSuppression> echoOff_;
  std::size_t handled_ = 0;
};

void DialogAgentCommand::blockTerminationSignals() {
  StopSignals::block();
}

DialogAgentCommand::DialogAgentCommand(ServiceClient& client, DialogAgentOptions options)
    : client_(client), options_(std::move(options)) {}

DialogAgentCommand::~DialogAgentCommand() = default;

int DialogAgentCommand::run() {
  return Session(client_, options_).run();
}

}  // namespace larder
