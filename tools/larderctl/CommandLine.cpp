#include "tools/larderctl/CommandLine.h"

#include <charconv>
#include <cmath>
#include <limits>

namespace larder {
namespace {

// The longest wait a person may ask for: a day.
constexpr double kLongestTimeoutSeconds = 86400;

// A store item identifier as people type it: 1 to 2^64-1, digits only, so
// that "-5" is refused rather than wrapped round to a huge number.
const CLI::Validator& itemIdentifierCheck() {
  static const CLI::Validator validator(
      [](std::string& word) -> std::string {
        std::uint64_t value = 0;
        const char* end = word.data() + word.size();
        const auto [stop, error] = std::from_chars(word.data(), end, value);
        if (word.empty() || word.front() == '+' || error != std::errc() || stop != end ||
            value == 0) {
          return "a store item identifier is a whole number from 1 to " +
                 std::to_string(std::numeric_limits<std::uint64_t>::max()) + ", not '" + word + "'";
        }
        return {};
      },
      "ITEM");
  return validator;
}

// A number of seconds, finite and at most a day: above 0 for a wait, from
// 0 for a delay.
CLI::Validator secondsCheck(bool zeroAllowed, std::string what) {
  return CLI::Validator(
      [zeroAllowed, what = std::move(what)](std::string& word) -> std::string {
        double value = 0;
        const char* end = word.data() + word.size();
        const auto [stop, error] = std::from_chars(word.data(), end, value);
        const bool inRange = zeroAllowed ? value >= 0 : value > 0;
        if (error != std::errc() || stop != end || !std::isfinite(value) || !inRange ||
            value > kLongestTimeoutSeconds) {
          return what + (zeroAllowed ? " from 0" : " above 0") + " and at most " +
                 std::to_string(static_cast<int>(kLongestTimeoutSeconds)) + ", not '" + word + "'";
        }
        return {};
      },
      "SECONDS");
}

// A number of days above 0, as `history --since` takes it.
const CLI::Validator& daysCheck() {
  static const CLI::Validator validator(
      [](std::string& word) -> std::string {
        double value = 0;
        const char* end = word.data() + word.size();
        const auto [stop, error] = std::from_chars(word.data(), end, value);
        if (error != std::errc() || stop != end || !std::isfinite(value) || value <= 0) {
          return "days are a number above 0, not '" + word + "'";
        }
        return {};
      },
      "DAYS");
  return validator;
}

}  // namespace

CommandLine::CommandLine() : app_("talk to the larder store service", "larderctl") {
  app_.require_subcommand(1);
  app_.fallthrough();
  app_.set_version_flag("--version", LARDER_VERSION, "print the version and exit");
  app_.footer(
      "Exit status: 0 success; 1 the operation failed or the service could not be reached; 2 "
      "the command line was wrong; 3 nothing to do (updates: none available; install: nothing to "
      "install).");
  addGlobalOptions();
  addSoftwareMapCommands();
  addDialogCommands();
  addStoreCommands();
  addOtherCommands();
  addPreferenceCommands();
}

const CLI::App* CommandLine::chosen() const {
  const auto parsed = app_.get_subcommands();
  return parsed.empty() ? nullptr : parsed.front();
}

bool CommandLine::chose(std::string_view name) const {
  const CLI::App* command = chosen();
  return command != nullptr && command->get_name() == name;
}

std::string CommandLine::chosenAction() const {
  const CLI::App* command = chosen();
  if (command == nullptr) return {};
  const auto actions = command->get_subcommands();
  return actions.empty() ? std::string() : actions.front()->get_name();
}

bool CommandLine::knows(const std::string& name) const {
  try {
    return app_.get_subcommand(name) != nullptr;
  } catch (const CLI::OptionNotFound&) {
    return false;
  }
}

void CommandLine::addGlobalOptions() {
  app_.add_flag("--json", global.json, "print JSON instead of text");
  app_.add_flag("--daemon", global.daemon, "talk to com.orvane.larderd.daemon");
  app_.add_option("--client-type", global.clientType,
                  "store client type to present: 0 store application, 1 book application, 2 "
                  "device configuration tool, 3 metadata search, 4 web browser")
      ->check(CLI::Range(0, 4));
  global.timeoutOption =
      app_.add_option("--timeout", global.timeoutSeconds, "seconds to wait for a reply")
          ->check(secondsCheck(false, "seconds to wait are a number"));
}

void CommandLine::addSoftwareMapCommands() {
  app_.add_subcommand("products", "list the installed store software");
  auto* product = app_.add_subcommand("product", "show one product");
  auto* byBundle = product->add_option("--bundle-id", bundleIdentifier, "bundle identifier");
  auto* byItem = product->add_option("--item-id", itemIdentifier, "store item identifier")
                     ->check(itemIdentifierCheck());
  byBundle->excludes(byItem);
  product->callback([this] {
    if (bundleIdentifier.empty() && !itemIdentifier) {
      throw CLI::ValidationError("give --bundle-id or --item-id");
    }
  });
  auto* watch = app_.add_subcommand("watch", "print software map changes until interrupted");
  watch->add_flag("--badge", watchBadge,
                  "print the store's badge count each time it is sent instead");
  auto* call = app_.add_subcommand("call", "call any request: call METHOD ARGS...");
  call->add_option("method", member, "D-Bus method name, e.g. ProductForBundleIdentifier")
      ->required();
  call->add_option("arguments", words, "arguments; containers as JSON");
}

void CommandLine::addDialogCommands() {
  auto* agentCommand = app_.add_subcommand(
      "agent", "answer the service's dialogs, at the terminal or with a fixed answer");
  agentCommand->add_option("--answer", agent.answer, "answer every dialog so: ok, cancel or other")
      ->check(CLI::IsMember({"ok", "cancel", "other"}));
  auto* accountOption =
      agentCommand->add_option("--account", agent.accountName, "account name for sign-in dialogs");
  auto* passwordOption =
      agentCommand->add_option("--password", agent.password, "password for sign-in dialogs");
  accountOption->needs(passwordOption);
  passwordOption->needs(accountOption);
  agentCommand->add_option("--count", agent.count, "exit after this many dialogs")
      ->check(CLI::PositiveNumber);
  agentCommand
      ->add_option("--delay", agent.delaySeconds, "seconds to wait before giving a fixed answer")
      ->check(secondsCheck(true, "a delay is a number of seconds"));
  agentCommand->callback([this, accountOption] {
    agent.json = global.json;
    if (agent.answer.empty() && (accountOption->count() > 0 || agent.delaySeconds > 0)) {
      throw CLI::ValidationError("--account, --password and --delay go with --answer");
    }
  });
  auto* dialogCommand =
      app_.add_subcommand("dialog", "show a dialog through the service and print its exit code");
  dialogCommand->add_option("--message", dialog.message, "title of the dialog")->required();
  dialogCommand->add_option("--explanation", dialog.explanation, "body text");
  dialogCommand->add_option("--ok", dialog.okButton, "title of the OK button (exit code 1)");
  dialogCommand->add_option("--cancel", dialog.cancelButton,
                            "title of the cancel button (exit code 0)");
  dialogCommand->add_option("--other", dialog.otherButton,
                            "title of the other button (exit code 2)");
}

void CommandLine::addStoreCommands() {
  auto* signin = app_.add_subcommand("signin", "sign an account in with the store");
  signin->add_option("account", accountName, "account name")->required();
  signin->add_option("--password", password, "password (read from standard input when not given)");
  app_.add_subcommand("signout", "sign the primary account out");
  app_.add_subcommand("account", "show the primary account (exit status 1 when nobody is)");
  auto* purchase = app_.add_subcommand(
      "purchase", "buy an item and install its download, following it to its end");
  purchase->add_option("item", purchaseItem, "store item identifier")
      ->required()
      ->check(itemIdentifierCheck());
  purchase->add_option("--buy-params", buyParameters,
                       "the store's buy parameters (default itemId=ITEM)");
  purchase->add_flag("--no-wait", noWait,
                     "return once the store has answered, without following the install");
  auto* downloads = app_.add_subcommand("downloads", "list the downloads in progress");
  downloads
      ->add_option("--mask", downloadMask, "download types: 1 install, 2 stage, 3 both (default)")
      ->check(CLI::Range(1, 3));
  auto* updates = app_.add_subcommand(
      "updates", "list the updates known for the installed software (exit status 3: none)");
  updates->add_flag("--check", checkFirst, "ask the store first");
  addUpdateCommands();
}

void CommandLine::addUpdateCommands() {
  auto* install = app_.add_subcommand(
      "install",
      "install available updates now, as the user's own start: app updates by item, OS updates "
      "by product key, everything available, the critical OS updates, or the OS update that "
      "carries tags (exit status 1: an update failed; 3: nothing to install)");
  install->add_option("ITEM", this->install.items, "item identifiers of available app updates");
  install->add_option("--os", this->install.osKeys, "product keys of available OS updates")
      ->expected(1, -1);
  auto* all = install->add_flag("--all", this->install.all, "every available app and OS update");
  auto* critical = install->add_flag("--critical", this->install.critical,
                                     "the available OS updates marked critical");
  all->excludes(critical);
  auto* tags = install
                   ->add_option("--tags", this->install.tags,
                                "install the one OS update that carries all these tags")
                   ->expected(1, -1);
  install
      ->add_option("--fallback-item", this->install.fallbackItem,
                   "with --tags: the item to purchase when not exactly one update matches")
      ->needs(tags);
  tags->excludes(all)->excludes(critical);
  auto* cancel =
      app_.add_subcommand("cancel", "cancel the running installs of OS updates, by product key");
  cancel->add_option("KEY", cancelKeys, "product keys of OS updates")->required();
  auto* osUpdates = app_.add_subcommand(
      "os-updates", "list the OS updates the system offers (exit status 3: none)");
  osUpdates->add_flag("--scan", this->osUpdates.scan,
                      "scan for OS updates first, showing progress");
  osUpdates->add_option("--hide", this->osUpdates.hide, "hide the OS updates of these product keys")
      ->expected(1, -1);
  osUpdates->add_flag("--unhide-all", this->osUpdates.unhideAll,
                      "show every hidden OS update again");
  addLaterCommand();
  app_.add_subcommand("badge", "print the count the store application shows on its badge");
  app_.add_subcommand("runs",
                      "show what the update machinery is doing and what its last background run "
                      "decided for each update (exit status 3: no run recorded yet)");
  app_.add_subcommand("why",
                      "explain in words why an update was not installed, from what the service "
                      "offers, the last background run's decisions and the installed-updates "
                      "journal (exit status 3: nothing is known of it)")
      ->add_option("ITEM|KEY", whyTarget,
                   "an app update's item identifier, bundle identifier or title, or an OS "
                   "update's product key or title")
      ->required();
  auto* history = app_.add_subcommand(
      "history",
      "list what was installed in the last 30 days, newest first, as the store application shows "
      "it (exit status 3: nothing)");
  history->add_option("--since", historySinceDays, "only what was installed in the last DAYS days")
      ->check(daysCheck());
  auto* notifications = app_.add_subcommand(
      "notifications",
      "list the notifications the service delivered (exit status 3: none), or act on one as the "
      "desktop's notification server would");
  auto* activate = notifications->add_option("--activate", activateNotification,
                                             "the identifier of the notification to act on");
  notifications
      ->add_option("--action", notificationAction,
                   "what the user did: default (clicked the contents, when not given), action "
                   "(the main button), other (the second button), snooze (put it away for "
                   "now), or N or alternate-N (entry N of the main button's menu)")
      ->needs(activate)
      ->check([](const std::string& word) {
        const auto digits = [](std::string_view text) {
          return !text.empty() && text.find_first_not_of("0123456789") == std::string::npos;
        };
        const std::string_view prefix = "alternate-";
        const bool entry =
            digits(word) || (word.starts_with(prefix) && digits(word.substr(prefix.size())));
        return entry || word == "default" || word == "action" || word == "other" || word == "snooze"
                   ? std::string()
                   : "must be default, action, other, snooze or a menu entry number";
      });
}

void CommandLine::addLaterCommand() {
  auto* later = app_.add_subcommand(
      "later",
      "install the available updates later: tonight, in an hour, or be reminded tomorrow; "
      "--list shows what waits (exit status 3: nothing), --cancel drops it");
  auto* when = later->add_option("when", this->later.when, "tonight, hour or tomorrow")
                   ->check(CLI::IsMember({"tonight", "hour", "tomorrow"}));
  auto* list = later->add_flag("--list", this->later.list, "show what waits for later");
  auto* cancel = later->add_flag("--cancel", this->later.cancel, "install nothing later");
  when->excludes(cancel);
  list->excludes(cancel);
}

void CommandLine::addOtherCommands() {
  auto* dmapDump = app_.add_subcommand("dmap-dump", "decode a DMAP document and print it as JSON");
  dmapDump->add_option("file", dmapFile, "the document; - for standard input")->required();
  auto* backgroundScan =
      app_.add_subcommand("background-scan",
                          "scan for OS updates and tell the service what was found, as the "
                          "software update agent does");
  backgroundScan->add_option("--info", backgroundScanInfo,
                             "send this JSON object instead of scanning");
  auto* laterAgent = app_.add_subcommand(
      "later-agent",
      "the deferred-install agent: when the armed moment of a later install has come, tell the "
      "service (NowIsLaterWithModeCountdownDeferred), or that it passed unused");
  laterAgent
      ->add_flag("--once", laterAgentOnce,
                 "decide once and exit; the systemd timer larder-later.timer repeats it")
      ->required();
  laterAgent->add_option("--now", laterAgentNow,
                         "decide as if it were this moment (ISO 8601; UTC without a zone)");
}

void CommandLine::addPreferenceCommands() {
  auto* prefs = app_.add_subcommand(
      "prefs", "read and write preferences: prefs get|set|delete DOMAIN [KEY] [VALUE]");
  prefs->require_subcommand(1);
  prefs->footer(
      "Domains: com.orvane.larderd (the service), com.orvane.quaymart (the store application), "
      "com.orvane.SoftwareUpdate (software update). Scope app reads the user's value, else the "
      "machine's, and writes the user's.");
  auto* get = prefs->add_subcommand("get", "print a preference, or a whole domain without KEY");
  auto* set = prefs->add_subcommand("set", "store a preference");
  auto* remove =
      prefs->add_subcommand("delete", "remove a preference (exit status 3: there was none)");
  for (CLI::App* action : {get, set, remove}) {
    action->add_option("domain", preferences.domain, "preference domain")->required();
    auto* key = action->add_option("key", preferences.key, "preference key");
    if (action != get) key->required();
    action->add_option("--scope", preferences.scope, "app (default), user or system")
        ->check(CLI::IsMember({"app", "user", "system"}));
  }
  set->add_option("value", preferences.value,
                  "the value: true/false, a number, an ISO 8601 date, JSON for containers, "
                  "else text")
      ->required();
  set->add_option("--type", preferences.type,
                  "read VALUE as bool, integer, real, string, date "
                  "or json")
      ->check(CLI::IsMember({"bool", "integer", "real", "string", "date", "json"}));
}

}  // namespace larder
