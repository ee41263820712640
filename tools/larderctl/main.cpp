// larderctl: the command-line client of larderd.
#include <sdbus-c++/Error.h>

#include <CLI/CLI.hpp>
#include <iostream>

#include "client/ServiceClient.h"
#include "client/ServiceRequests.h"
#include "platform/system/StopSignals.h"
#include "tools/larderctl/BackgroundScanCommand.h"
#include "tools/larderctl/CallArguments.h"
#include "tools/larderctl/CommandLine.h"
#include "tools/larderctl/DialogAgentCommand.h"
#include "tools/larderctl/DialogCommand.h"
#include "tools/larderctl/DmapDumpCommand.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/HistoryCommand.h"
#include "tools/larderctl/InstallCommand.h"
#include "tools/larderctl/LaterAgentCommand.h"
#include "tools/larderctl/LaterCommand.h"
#include "tools/larderctl/NotificationsCommand.h"
#include "tools/larderctl/OSUpdatesCommand.h"
#include "tools/larderctl/PreferencesCommand.h"
#include "tools/larderctl/ProductPrinter.h"
#include "tools/larderctl/RunsCommand.h"
#include "tools/larderctl/StoreCommands.h"
#include "tools/larderctl/UpdatesCommand.h"
#include "tools/larderctl/WatchCommand.h"
#include "tools/larderctl/WhyCommand.h"

namespace {

using namespace larder;

std::uint64_t microseconds(double seconds) {
  return static_cast<std::uint64_t>(seconds * 1e6);
}

ServiceClient connect(const CommandLine::Global& options) {
  ServiceClient client(options.daemon ? "com.orvane.larderd.daemon" : "com.orvane.larderd",
                       microseconds(options.timeoutSeconds));
  client.presentStoreClient(options.clientType);
  return client;
}

int runProducts(const CommandLine& line) {
  ServiceClient client = connect(line.global);
  PlistArray reply = client.call("AllProducts", {});
  ProductPrinter(line.global.json).printProducts(reply.at(0));
  return kExitSuccess;
}

int runProduct(const CommandLine& line) {
  ServiceClient client = connect(line.global);
  PlistArray reply = line.itemIdentifier
                         ? client.call("ProductForItemIdentifier", {*line.itemIdentifier})
                         : client.call("ProductForBundleIdentifier", {line.bundleIdentifier});
  const PlistDictionary* product = reply.at(0).dictionary();
  if (!product || product->empty()) {
    if (line.global.json) {
      std::cout << "null" << std::endl;
    } else {
      std::cerr << "larderctl: no store software with "
                << (line.itemIdentifier ? "item identifier " + std::to_string(*line.itemIdentifier)
                                        : "bundle identifier " + line.bundleIdentifier)
                << " is installed" << std::endl;
    }
    return kExitFailure;
  }
  ProductPrinter(line.global.json).printProduct(reply.at(0));
  return kExitSuccess;
}

int runWatch(const CommandLine& line) {
  StopSignals::block();
  ServiceClient client = connect(line.global);
  const CommandLine::Global& options = line.global;
  WatchCommand watch(client, options.json,
                     [&client, &options] { client.presentStoreClient(options.clientType); });
  return line.watchBadge ? watch.runBadge() : watch.run();
}

int runBadge(const CommandLine& line) {
  ServiceClient client = connect(line.global);
  const std::uint64_t count = client.call("AvailableUpdatesBadgeCount", {}).at(0).uint64Value();
  if (line.global.json) {
    std::cout << "{\"badgeCount\":" << count << "}" << std::endl;
  } else {
    std::cout << count << std::endl;
  }
  return kExitSuccess;
}

int runCall(const CommandLine& line) {
  const RequestSignature* request = ServiceRequests::find(line.member);
  if (!request) {
    throw CLI::ValidationError("larderd has no request named '" + line.member + "'");
  }
  const PlistArray arguments = CallArguments::parse(*request, line.words);
  ServiceClient client = connect(line.global);
  ProductPrinter(line.global.json).printReply(client.call(line.member, arguments));
  return kExitSuccess;
}

int runAgent(const CommandLine& line) {
  DialogAgentCommand::blockTerminationSignals();
  ServiceClient client = connect(line.global);
  return DialogAgentCommand(client, line.agent).run();
}

int runDialog(const CommandLine& line) {
  ServiceClient client = connect(line.global);
  const std::uint64_t timeout = line.global.timeoutOption->count() > 0
                                    ? microseconds(line.global.timeoutSeconds)
                                    : DialogCommand::kDefaultTimeoutMicroseconds;
  return DialogCommand(client, line.global.json).run(line.dialog, timeout);
}

int runStore(const CommandLine& line) {
  ServiceClient client = connect(line.global);
  StoreCommands store(client, line.global.json);
  if (line.chose("signin")) return store.signIn(line.accountName, line.password);
  if (line.chose("signout")) return store.signOut();
  if (line.chose("account")) return store.account();
  if (line.chose("purchase"))
    return store.purchase(line.purchaseItem, line.buyParameters, !line.noWait);
  return store.downloads(line.downloadMask);
}

int runBackgroundScan(const CommandLine& line) {
  // A wrong --info is a usage error, found before anything is tried.
  std::optional<PlistDictionary> given;
  if (line.backgroundScanInfo) {
    given = BackgroundScanCommand::reportFromJson(*line.backgroundScanInfo);
  }
  ServiceClient client = connect(line.global);
  return BackgroundScanCommand(line.global.json).run(client, given);
}

int runLaterAgent(const CommandLine& line) {
  // A wrong --now is a usage error, found before anything is decided.
  const LaterAgentCommand::Clock::time_point now =
      LaterAgentCommand::momentFrom(line.laterAgentNow);
  return LaterAgentCommand(line.global.json, [&line] { return connect(line.global); }).run(now);
}

int runChosen(const CommandLine& line) {
  if (line.chose("dmap-dump")) return DmapDumpCommand(line.global.json).run(line.dmapFile);
  if (line.chose("prefs")) {
    return PreferencesCommand(line.global.json).run(line.chosenAction(), line.preferences);
  }
  if (line.chose("products")) return runProducts(line);
  if (line.chose("product")) return runProduct(line);
  if (line.chose("watch")) return runWatch(line);
  if (line.chose("call")) return runCall(line);
  if (line.chose("agent")) return runAgent(line);
  if (line.chose("dialog")) return runDialog(line);
  if (line.chose("os-updates")) {
    ServiceClient client = connect(line.global);
    return OSUpdatesCommand(client, line.global.json).run(line.osUpdates);
  }
  if (line.chose("badge")) return runBadge(line);
  if (line.chose("background-scan")) return runBackgroundScan(line);
  if (line.chose("later-agent")) return runLaterAgent(line);
  if (line.chose("notifications")) {
    ServiceClient client = connect(line.global);
    NotificationsCommand command(client, line.global.json);
    if (line.activateNotification) {
      return command.activate(*line.activateNotification, line.notificationAction);
    }
    return command.list();
  }
  if (line.chose("later")) {
    ServiceClient client = connect(line.global);
    return LaterCommand(client, line.global.json).run(line.later);
  }
  if (line.chose("why")) {
    ServiceClient client = connect(line.global);
    return WhyCommand(client, line.global.json).run(line.whyTarget);
  }
  if (line.chose("history")) {
    ServiceClient client = connect(line.global);
    return HistoryCommand(client, line.global.json).run(line.historySinceDays);
  }
  if (line.chose("runs")) {
    ServiceClient client = connect(line.global);
    return RunsCommand(client, line.global.json).run();
  }
  if (line.chose("install") || line.chose("cancel")) {
    ServiceClient client = connect(line.global);
    ServiceClient runner = connect(line.global);
    InstallCommand install(client, runner, line.global.json);
    return line.chose("install") ? install.run(line.install) : install.cancel(line.cancelKeys);
  }
  if (line.chose("updates")) {
    ServiceClient client = connect(line.global);
    return UpdatesCommand(client, line.global.json).run(line.checkFirst);
  }
  return runStore(line);
}

// The first word that is neither an option nor an option's value: what
// the person meant as a command.
std::string firstCommandWord(int argc, char** argv) {
  for (int index = 1; index < argc; ++index) {
    const std::string word = argv[index];
    if (word == "--client-type" || word == "--timeout") {
      ++index;
    } else if (!word.starts_with("-")) {
      return word;
    }
  }
  return {};
}

// A usage error names the command whose help tells more.
int reportUsageError(const CommandLine& line, const CLI::Error& error, int argc, char** argv) {
  const CLI::App* command = line.chosen();
  const std::string word = firstCommandWord(argc, argv);
  std::cerr << "larderctl: ";
  if (command || (!word.empty() && line.knows(word))) {
    std::cerr << error.what();
  } else if (word.empty()) {
    std::cerr << "no command given";
  } else {
    std::cerr << "no command named '" << word << "'";
  }
  std::cerr << "; see `larderctl " << (command ? command->get_name() + " " : std::string())
            << "--help`" << std::endl;
  return kExitUsage;
}

}  // namespace

int main(int argc, char** argv) {
  CommandLine line;
  try {
    line.app().parse(argc, argv);
  } catch (const CLI::CallForHelp& help) {
    return line.app().exit(help);
  } catch (const CLI::CallForAllHelp& help) {
    return line.app().exit(help);
  } catch (const CLI::CallForVersion& version) {
    return line.app().exit(version);
  } catch (const CLI::ParseError& error) {
    return reportUsageError(line, error, argc, argv);
  }
  try {
    return runChosen(line);
  } catch (const CLI::ValidationError& error) {
    return reportUsageError(line, error, argc, argv);
  } catch (const sdbus::Error& error) {
    std::cerr << "larderctl: " << error.getMessage() << std::endl;
  } catch (const std::exception& error) {
    std::cerr << "larderctl: " << error.what() << std::endl;
  }
  return kExitFailure;
}
