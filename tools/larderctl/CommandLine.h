#pragma once

#include <CLI/CLI.hpp>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "tools/larderctl/DialogAgentCommand.h"
#include "tools/larderctl/DialogCommand.h"
#include "tools/larderctl/InstallOptions.h"
#include "tools/larderctl/LaterCommand.h"
#include "tools/larderctl/OSUpdatesCommand.h"
#include "tools/larderctl/PreferencesOptions.h"

namespace larder {

// Every command, option and help text of larderctl in one place: main
// parses with it, and the manual page and the shell completion are written
// from it, so that none of them can drift from the others.
class CommandLine {
 public:
  struct Global {
    bool json = false;
    bool daemon = false;
    std::int64_t clientType = 0;
    double timeoutSeconds = 25;
    CLI::Option* timeoutOption = nullptr;
  };

  CommandLine();
  CommandLine(const CommandLine&) = delete;
  CommandLine& operator=(const CommandLine&) = delete;

  CLI::App& app() { return app_; }
  // The subcommand that was given, or null before parsing.
  [[nodiscard]] const CLI::App* chosen() const;
  [[nodiscard]] bool chose(std::string_view name) const;
  // Whether `name` is one of the commands.
  [[nodiscard]] bool knows(const std::string& name) const;

  Global global;
  // product
  std::string bundleIdentifier;
  std::optional<std::uint64_t> itemIdentifier;
  // call
  std::string member;
  std::vector<std::string> words;
  // agent, dialog
  DialogAgentOptions agent;
  DialogCommandOptions dialog;
  // signin
  std::string accountName;
  std::optional<std::string> password;
  // purchase
  std::uint64_t purchaseItem = 0;
  std::string buyParameters;
  bool noWait = false;
  // downloads
  std::int64_t downloadMask = 3;
  // updates
  bool checkFirst = false;
  // os-updates
  OSUpdatesOptions osUpdates;
  // install, cancel
  InstallOptions install;
  std::vector<std::string> cancelKeys;
  // watch
  bool watchBadge = false;
  // dmap-dump
  std::string dmapFile;
  // background-scan
  std::optional<std::string> backgroundScanInfo;
  // later-agent
  bool laterAgentOnce = false;
  std::optional<std::string> laterAgentNow;
  // why
  std::string whyTarget;
  // notifications
  std::optional<std::string> activateNotification;
  std::optional<std::string> notificationAction;
  // later
  LaterOptions later;
  // history
  std::optional<double> historySinceDays;
  // prefs get|set|delete
  PreferencesOptions preferences;
  // The subcommand of a command that has them ("get" of "prefs get").
  [[nodiscard]] std::string chosenAction() const;

 private:
  void addGlobalOptions();
  void addSoftwareMapCommands();
  void addDialogCommands();
  void addStoreCommands();
  void addLaterCommand();
  void addOtherCommands();
  void addPreferenceCommands();
  void addUpdateCommands();

  CLI::App app_;
};

}  // namespace larder
