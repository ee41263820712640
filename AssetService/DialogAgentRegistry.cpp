#include "AssetService/DialogAgentRegistry.h"

#include <algorithm>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>

#include "client/DBusValueCodec.h"
#include "client/DialogAgentProtocol.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "DialogAgentRegistry";

VendDialogAnswer cancelledAnswer() {
  return VendDialogAnswer{VendDialogButton::kCancel, {}};
}

std::string describeError(const sdbus::Error& error) {
  return error.getName() + ": " + error.getMessage();
}

void sendAnswer(sdbus::MethodCall& call, const VendDialogAnswer& answer) {
  try {
    DBusValueCodec::reply(call, "xa{sv}", {answer.exitCode, answer.values});
  } catch (const sdbus::Error& error) {
    TILL_LOG(2, "%@: Answer to %@ not delivered: %@", kSpeaker, call.getSender(),
             describeError(error));
  }
}

}  // namespace

static_assert(DialogAgentProtocol::kSignInKind == VendDialog::kSignIn,
              "agents recognise the sign-in dialog by its kind");
static_assert(std::int64_t{DialogAgentProtocol::kCancel} == VendDialogButton::kCancel &&
                  std::int64_t{DialogAgentProtocol::kOK} == VendDialogButton::kOK &&
                  std::int64_t{DialogAgentProtocol::kOther} == VendDialogButton::kOther,
              "an agent's exit code is the role of the chosen button");

DialogAgentRegistry::DialogAgentRegistry()
    : agentCalls_(std::make_shared<VendElasticQueue>(
          std::string(DialogAgentProtocol::kRegistryInterfaceName))) {}

DialogAgentRegistry::~DialogAgentRegistry() = default;

void DialogAgentRegistry::exportOn(sdbus::IObject& object, sdbus::IConnection& connection) {
  {
    MutexLock lock(mutex_);
    connection_ = &connection;
  }
  exportBusMethods<DialogAgentRegistry>(
      object, DialogAgentProtocol::kRegistryInterfaceName, DialogAgentProtocol::registryMethods(),
      {{"RegisterDialogAgent", &DialogAgentRegistry::registerAgent},
       {"UnregisterDialogAgent", &DialogAgentRegistry::unregisterAgent},
       {"DisplayDialog", &DialogAgentRegistry::displayDialog}},
      shared_from_this());
}

void DialogAgentRegistry::registerAgent(sdbus::MethodCall call) {
  Agent agent{call.getSender(), *DBusValueCodec::read(call, "o").string(), 0};
  {
    MutexLock lock(mutex_);
    std::erase_if(agents_, [&](const Agent& known) {
      return known.peer == agent.peer && known.objectPath == agent.objectPath;
    });
    agent.registration = nextRegistration_++;
    agents_.push_back(agent);
  }
  TILL_LOG(2, "%@: Dialog agent %@ %@ registered", kSpeaker, agent.peer, agent.objectPath);
  DBusValueCodec::reply(call, "", {});
}

void DialogAgentRegistry::unregisterAgent(sdbus::MethodCall call) {
  const std::string peer = call.getSender();
  const std::string objectPath = *DBusValueCodec::read(call, "o").string();
  std::size_t removed = 0;
  {
    MutexLock lock(mutex_);
    removed = std::erase_if(agents_, [&](const Agent& known) {
      return known.peer == peer && known.objectPath == objectPath;
    });
  }
  // Dialogs the agent already shows stay with it until it answers them.
  TILL_LOG(removed > 0 ? 2 : 3, "%@: Dialog agent %@ %@ %@", kSpeaker, peer, objectPath,
           removed > 0 ? "unregistered" : "was not registered");
  DBusValueCodec::reply(call, "", {});
}

void DialogAgentRegistry::displayDialog(sdbus::MethodCall call) {
  const PlistValue fields = DBusValueCodec::read(call, "a{sv}");
  VendDialog dialog = VendDialog::dialogWithDictionary(*fields.dictionary());
  TILL_LOG(2, "%@: %@ asks to show dialog %@ \"%@\"", kSpeaker, call.getSender(),
           dialog.identifier(), dialog.message());
  auto pending = std::make_shared<sdbus::MethodCall>(std::move(call));
  // Requests of scripts and support have no store client of their own.
  VendUIService(VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication),
                VendRuntime::shared())
      .presentDialog(dialog,
                     [pending](const VendDialogAnswer& answer) { sendAnswer(*pending, answer); });
}

void DialogAgentRegistry::present(const VendDialog& dialog, Reply reply) {
  Agent agent;
  std::uint64_t ticket = 0;
  {
    MutexLock lock(mutex_);
    if (!agents_.empty() && connection_) {
      agent = agents_.back();
      ticket = nextTicket_++;
      pending_.emplace(ticket, PendingDialog{agent, dialog.identifier(), std::move(reply)});
    }
  }
  if (ticket == 0) {
    TILL_LOG(2, "%@: No dialog agent; dialog %@ \"%@\" counts as cancelled", kSpeaker,
             dialog.identifier(), dialog.message());
    VendDialogAnswer answer = cancelledAnswer();
    answer.nobodyAsked = true;
    reply(std::move(answer));
    return;
  }
  TILL_LOG(2, "%@: Dialog %@ goes to agent %@ %@", kSpeaker, dialog.identifier(), agent.peer,
           agent.objectPath);
  agentCalls_->async([self = shared_from_this(), agent, dialog, ticket] {
    self->askAgent(agent, dialog, ticket);
  });
}

void DialogAgentRegistry::askAgent(const Agent& agent, const VendDialog& dialog,
                                   std::uint64_t ticket) {
  sdbus::IConnection* connection = nullptr;
  {
    MutexLock lock(mutex_);
    // Dismissed, or its agent left, while it waited for a worker.
    if (!pending_.contains(ticket)) return;
    connection = connection_;
  }
  try {
    auto proxy = sdbus::createProxy(*connection, agent.peer, agent.objectPath);
    sdbus::MethodCall call = proxy->createMethodCall(
        std::string(DialogAgentProtocol::kAgentInterfaceName), "DisplayDialog");
    DBusValueCodec::writeAll(call, "a{sv}", {dialog.toDictionary()});
    const auto timeout = std::chrono::duration_cast<std::chrono::microseconds>(kAgentCallTimeout);
    sdbus::MethodReply reply = proxy->callMethod(call, static_cast<std::uint64_t>(timeout.count()));
    PlistArray out = DBusValueCodec::readAll(reply, "xa{sv}");
    const PlistDictionary* values = out.at(1).dictionary();
    answer(ticket, VendDialogAnswer{out.at(0).int64Value(), values ? *values : PlistDictionary{}});
  } catch (const sdbus::Error& error) {
    agentFailed(agent, describeError(error));
    answer(ticket, cancelledAnswer());
  }
}

void DialogAgentRegistry::agentFailed(const Agent& agent, const std::string& why) {
  std::size_t removed = 0;
  {
    MutexLock lock(mutex_);
    removed = std::erase_if(
        agents_, [&](const Agent& known) { return known.registration == agent.registration; });
  }
  TILL_LOG(1, "%@: Dialog agent %@ %@ failed (%@)%@", kSpeaker, agent.peer, agent.objectPath, why,
           removed > 0 ? " and is dropped" : "");
}

void DialogAgentRegistry::answer(std::uint64_t ticket, VendDialogAnswer answer) {
  Reply reply;
  {
    MutexLock lock(mutex_);
    auto found = pending_.find(ticket);
    // Already answered by a dismissal or by its agent leaving.
    if (found == pending_.end()) return;
    reply = std::move(found->second.reply);
    pending_.erase(found);
  }
  reply(std::move(answer));
}

std::vector<DialogAgentRegistry::PendingDialog> DialogAgentRegistry::takePendingDialogs(
    const std::function<bool(const PendingDialog&)>& matches) {
  std::vector<PendingDialog> taken;
  MutexLock lock(mutex_);
  for (auto entry = pending_.begin(); entry != pending_.end();) {
    if (matches(entry->second)) {
      taken.push_back(std::move(entry->second));
      entry = pending_.erase(entry);
    } else {
      ++entry;
    }
  }
  return taken;
}

void DialogAgentRegistry::dismiss(std::string_view dialogIdentifier, std::int64_t exitCode) {
  std::vector<PendingDialog> taken = takePendingDialogs(
      [&](const PendingDialog& pending) { return pending.dialogIdentifier == dialogIdentifier; });
  if (taken.empty()) {
    TILL_LOG(3, "%@: Dialog %@ is not up; nothing to dismiss", kSpeaker, dialogIdentifier);
    return;
  }
  for (PendingDialog& pending : taken) {
    TILL_LOG(2, "%@: Dialog %@ dismissed with exit code %@", kSpeaker, dialogIdentifier, exitCode);
    tellAgentOfDismissal(pending.agent, pending.dialogIdentifier, exitCode);
    pending.reply(VendDialogAnswer{exitCode, {}});
  }
}

void DialogAgentRegistry::tellAgentOfDismissal(const Agent& agent,
                                               const std::string& dialogIdentifier,
                                               std::int64_t exitCode) {
  sdbus::IConnection* connection = nullptr;
  {
    MutexLock lock(mutex_);
    connection = connection_;
  }
  if (!connection) return;
  try {
    auto proxy = sdbus::createProxy(*connection, agent.peer, agent.objectPath);
    sdbus::MethodCall call = proxy->createMethodCall(
        std::string(DialogAgentProtocol::kAgentInterfaceName), "DismissDialog");
    DBusValueCodec::writeAll(call, "sx", {dialogIdentifier, exitCode});
    call.dontExpectReply();
    proxy->callMethod(call);
  } catch (const sdbus::Error& error) {
    TILL_LOG(2, "%@: Agent %@ %@ not told of the dismissal: %@", kSpeaker, agent.peer,
             agent.objectPath, describeError(error));
  }
}

void DialogAgentRegistry::peerDidLeave(const std::string& peer) {
  std::size_t removed = 0;
  std::size_t waiting = 0;
  {
    MutexLock lock(mutex_);
    removed = std::erase_if(agents_, [&](const Agent& known) { return known.peer == peer; });
    waiting = static_cast<std::size_t>(std::ranges::count_if(
        pending_, [&](const auto& entry) { return entry.second.agent.peer == peer; }));
  }
  if (removed == 0) return;
  // Its dialogs are not cancelled here: an answer it sent just before it
  // left may still be on its way to the worker that waits for it. The bus
  // ends every call the peer leaves unanswered with an error, and that
  // error cancels the dialog.
  TILL_LOG(2, "%@: Dialog agents of %@ left the bus; %@ dialog(s) of theirs end with the bus",
           kSpeaker, peer, waiting);
}

std::size_t DialogAgentRegistry::agentCount() const {
  MutexLock lock(mutex_);
  return agents_.size();
}

}  // namespace larder
