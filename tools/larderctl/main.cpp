// larderctl: the command-line client of larderd.
#include <csignal>

#include <sdbus-c++/Error.h>
#include <CLI/CLI.hpp>
#include <cstdio>
#include <iostream>

#include "client/DBusValueCodec.h"
#include "client/ServiceClient.h"
#include "client/ServiceRequests.h"
#include "platform/plist/JsonConversion.h"
#include "platform/system/StopSignals.h"
#include "tools/larderctl/DialogAgentCommand.h"
#include "tools/larderctl/DialogCommand.h"
#include "tools/larderctl/DmapDumpCommand.h"
#include "tools/larderctl/ProductPrinter.h"
#include "tools/larderctl/StoreCommands.h"
#include "tools/larderctl/UpdatesCommand.h"

namespace {

using namespace larder;

constexpr const char* kObserverPath = "/com/orvane/larderctl/SoftwareMapObserver";

struct GlobalOptions {
  bool json = false;
  bool daemon = false;
  std::int64_t clientType = 0;
  double timeoutSeconds = 25;
};

ServiceClient connect(const GlobalOptions& options) {
  ServiceClient client(options.daemon ? "com.orvane.larderd.daemon" : "com.orvane.larderd",
                       static_cast<std::uint64_t>(options.timeoutSeconds * 1e6));
  client.presentStoreClient(options.clientType);
  return client;
}

// Arguments of `call`, read by the request's signature: scalars as
// written, containers as JSON.
PlistArray parseArguments(const RequestSignature& request, const std::vector<std::string>& words) {
  std::vector<std::string> types = DBusValueCodec::splitSignature(request.inSignature);
  if (types.size() != words.size()) {
    throw CLI::ValidationError(std::string(request.member) + " takes " +
                               std::to_string(types.size()) + " argument(s) of signature " +
                               std::string(request.inSignature));
  }
  PlistArray arguments;
  for (std::size_t i = 0; i < types.size(); ++i) {
    const std::string& type = types[i];
    const std::string& word = words[i];
    if (type == "s" || type == "o") {
      arguments.emplace_back(word);
    } else if (type == "b") {
      arguments.emplace_back(word == "true" || word == "1" || word == "yes");
    } else if (type == "x") {
      arguments.emplace_back(static_cast<std::int64_t>(std::stoll(word)));
    } else if (type == "t") {
      arguments.emplace_back(static_cast<std::uint64_t>(std::stoull(word)));
    } else if (type == "d") {
      arguments.emplace_back(std::stod(word));
    } else {
      arguments.push_back(JsonConversion::fromJson(nlohmann::json::parse(word)));
    }
  }
  return arguments;
}

int runProducts(const GlobalOptions& options) {
  ServiceClient client = connect(options);
  PlistArray reply = client.call("AllProducts", {});
  ProductPrinter(options.json).printProducts(reply.at(0));
  return 0;
}

int runProduct(const GlobalOptions& options, const std::string& bundleIdentifier,
               std::uint64_t itemIdentifier) {
  ServiceClient client = connect(options);
  PlistArray reply = bundleIdentifier.empty()
                         ? client.call("ProductForItemIdentifier", {itemIdentifier})
                         : client.call("ProductForBundleIdentifier", {bundleIdentifier});
  const PlistDictionary* product = reply.at(0).dictionary();
  if (!product || product->empty()) {
    if (options.json)
      std::cout << "null" << std::endl;
    else
      std::cerr << "larderctl: no such product" << std::endl;
    return 1;
  }
  ProductPrinter(options.json).printProduct(reply.at(0));
  return 0;
}

int runWatch(const GlobalOptions& options) {
  StopSignals::block();

  ServiceClient client = connect(options);
  ProductPrinter printer(options.json);
  client.exportSoftwareMapObserver(kObserverPath,
                                   [&printer](const PlistValue& product, std::int64_t state) {
                                     printer.printChange(product, state);
                                   });
  std::string token =
      *client.call("AddSoftwareMapObserver", {std::string(kObserverPath)}).at(0).string();
  if (!options.json)
    std::cerr << "larderctl: watching the software map (token " << token << ")" << std::endl;
  const sigset_t signals = StopSignals::set();
  int received = 0;
  sigwait(&signals, &received);
  client.call("RemoveSoftwareMapObserver", {token});
  return 0;
}

int runCall(const GlobalOptions& options, const std::string& member,
            const std::vector<std::string>& words) {
  const RequestSignature* request = ServiceRequests::find(member);
  if (!request) {
    std::cerr << "larderctl: no request named " << member << std::endl;
    return 2;
  }
  ServiceClient client = connect(options);
  PlistArray reply = client.call(member, parseArguments(*request, words));
  ProductPrinter(options.json).printReply(reply);
  return 0;
}

int runAgent(const GlobalOptions& options, const DialogAgentOptions& agentOptions) {
  DialogAgentCommand::blockTerminationSignals();
  ServiceClient client = connect(options);
  return DialogAgentCommand(client, agentOptions).run();
}

int runDialog(const GlobalOptions& options, const DialogCommandOptions& dialogOptions,
              bool timeoutGiven) {
  ServiceClient client = connect(options);
  const std::uint64_t timeout = timeoutGiven
                                    ? static_cast<std::uint64_t>(options.timeoutSeconds * 1e6)
                                    : DialogCommand::kDefaultTimeoutMicroseconds;
  return DialogCommand(client, options.json).run(dialogOptions, timeout);
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"larderctl: talk to the larder store service"};
  app.require_subcommand(1);
  app.fallthrough();
  GlobalOptions options;
  app.add_flag("--json", options.json, "print JSON instead of tables");
  app.add_flag("--daemon", options.daemon, "talk to com.orvane.larderd.daemon");
  app.add_option("--client-type", options.clientType, "store client type to present (0-4)");
  auto* timeoutOption =
      app.add_option("--timeout", options.timeoutSeconds, "seconds to wait for a reply");

  auto* products = app.add_subcommand("products", "list the installed store software");
  auto* product = app.add_subcommand("product", "show one product");
  std::string bundleIdentifier;
  std::uint64_t itemIdentifier = 0;
  auto* byBundle = product->add_option("--bundle-id", bundleIdentifier, "bundle identifier");
  auto* byItem = product->add_option("--item-id", itemIdentifier, "store item identifier");
  byBundle->excludes(byItem);
  product->callback([&] {
    if (bundleIdentifier.empty() && byItem->count() == 0) {
      throw CLI::ValidationError("give --bundle-id or --item-id");
    }
  });
  auto* watch = app.add_subcommand("watch", "print software map changes until interrupted");
  auto* call = app.add_subcommand("call", "call any request: call METHOD ARGS...");
  std::string member;
  std::vector<std::string> words;
  call->add_option("method", member, "D-Bus method name, e.g. ProductForBundleIdentifier")
      ->required();
  call->add_option("arguments", words, "arguments; containers as JSON");

  auto* agent = app.add_subcommand(
      "agent", "answer the service's dialogs, at the terminal or with a fixed answer");
  DialogAgentOptions agentOptions;
  agent->add_option("--answer", agentOptions.answer, "answer every dialog so: ok, cancel or other")
      ->check(CLI::IsMember({"ok", "cancel", "other"}));
  auto* accountOption =
      agent->add_option("--account", agentOptions.accountName, "account name for sign-in dialogs");
  auto* passwordOption =
      agent->add_option("--password", agentOptions.password, "password for sign-in dialogs");
  accountOption->needs(passwordOption);
  passwordOption->needs(accountOption);
  agent->add_option("--count", agentOptions.count, "exit after this many dialogs");
  agent->add_option("--delay", agentOptions.delaySeconds,
                    "seconds to wait before giving a fixed answer");
  agent->callback([&] {
    agentOptions.json = options.json;
    if (agentOptions.answer.empty() &&
        (accountOption->count() > 0 || agentOptions.delaySeconds > 0)) {
      throw CLI::ValidationError("--account, --password and --delay go with --answer");
    }
  });
  auto* dialog =
      app.add_subcommand("dialog", "show a dialog through the service and print its exit code");
  DialogCommandOptions dialogOptions;
  dialog->add_option("--message", dialogOptions.message, "title of the dialog")->required();
  dialog->add_option("--explanation", dialogOptions.explanation, "body text");
  dialog->add_option("--ok", dialogOptions.okButton, "title of the OK button (exit code 1)");
  dialog->add_option("--cancel", dialogOptions.cancelButton,
                     "title of the cancel button (exit code 0)");
  dialog->add_option("--other", dialogOptions.otherButton,
                     "title of the other button (exit code 2)");

  auto* signin = app.add_subcommand("signin", "sign an account in with the store");
  std::string accountName;
  std::optional<std::string> password;
  signin->add_option("account", accountName, "account name")->required();
  signin->add_option("--password", password, "password (read from standard input when not given)");
  auto* signout = app.add_subcommand("signout", "sign the primary account out");
  auto* account = app.add_subcommand("account", "show the primary account");
  auto* purchase = app.add_subcommand("purchase", "buy an item and install its download");
  std::uint64_t purchaseItem = 0;
  std::string buyParameters;
  purchase->add_option("item", purchaseItem, "store item identifier")->required();
  purchase->add_option("--buy-params", buyParameters,
                       "the store's buy parameters (default itemId=ITEM)");
  bool noWait = false;
  purchase->add_flag("--no-wait", noWait,
                     "return once the store has answered, without following the install");
  auto* downloads = app.add_subcommand("downloads", "list the downloads in progress");
  std::int64_t downloadMask = 3;
  downloads->add_option("--mask", downloadMask,
                        "download types: 1 install, 2 stage (default both)");

  auto* updates =
      app.add_subcommand("updates", "list the updates known for the installed software");
  bool checkFirst = false;
  updates->add_flag("--check", checkFirst, "ask the store first");

  auto* dmapDump = app.add_subcommand("dmap-dump", "decode a DMAP document and print it as JSON");
  std::string dmapFile;
  dmapDump->add_option("file", dmapFile, "the document; - for standard input")->required();

  CLI11_PARSE(app, argc, argv);
  try {
    if (dmapDump->parsed()) return DmapDumpCommand(options.json).run(dmapFile);
    if (products->parsed()) return runProducts(options);
    if (updates->parsed()) {
      ServiceClient client = connect(options);
      return UpdatesCommand(client, options.json).run(checkFirst);
    }
    if (product->parsed()) return runProduct(options, bundleIdentifier, itemIdentifier);
    if (watch->parsed()) return runWatch(options);
    if (call->parsed()) return runCall(options, member, words);
    if (agent->parsed()) return runAgent(options, agentOptions);
    if (dialog->parsed()) return runDialog(options, dialogOptions, timeoutOption->count() > 0);
    if (signin->parsed() || signout->parsed() || account->parsed() || purchase->parsed() ||
        downloads->parsed()) {
      ServiceClient client = connect(options);
      StoreCommands store(client, options.json);
      if (signin->parsed()) return store.signIn(accountName, password);
      if (signout->parsed()) return store.signOut();
      if (account->parsed()) return store.account();
      if (purchase->parsed()) return store.purchase(purchaseItem, buyParameters, !noWait);
      return store.downloads(downloadMask);
    }
  } catch (const sdbus::Error& error) {
    std::cerr << "larderctl: " << error.getName() << ": " << error.getMessage() << std::endl;
    return 1;
  } catch (const std::exception& error) {
    std::cerr << "larderctl: " << error.what() << std::endl;
    return 1;
  }
  return 0;
}
