#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/BusMethodExport.h"
#include "platform/system/Mutex.h"
#include "store-runtime/core/VendElasticQueue.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"

namespace larder {

// The service's dialog presenter: dialogs go to dialog agents, objects that
// clients (`larderctl agent`, a desktop helper) export and register over
// the bus. The newest registered agent that is still on the bus shows each
// dialog; no agent, an agent that leaves the bus while its dialog is up, or
// a call that fails answers the dialog as cancelled (exit code 0), and the
// agent that failed is dropped.
//
// A dialog may wait for a person for minutes, so each is a blocking call
// with a timeout of one hour, made on a worker queue of its own; the bus
// thread never waits for an agent. When a call outlives its timeout the
// dialog is cancelled and the agent dropped as for any failed call.
class DialogAgentRegistry final : public VendDialogPresenter,
                                  public std::enable_shared_from_this<DialogAgentRegistry> {
 public:
  static constexpr std::chrono::seconds kAgentCallTimeout = std::chrono::hours(1);

  DialogAgentRegistry();
  ~DialogAgentRegistry() override;
  DialogAgentRegistry(const DialogAgentRegistry&) = delete;
  DialogAgentRegistry& operator=(const DialogAgentRegistry&) = delete;

  // Adds the registry's methods to the service object, before its
  // registration is finished; agents are called on `connection`.
  void exportOn(sdbus::IObject& object, sdbus::IConnection& connection);
  // A peer left the bus: its agents go. Their dialogs end as cancelled when
  // the bus answers the calls the peer left unanswered with an error.
  void peerDidLeave(const std::string& peer);

  void present(const VendDialog& dialog, Reply reply) override;
  void dismiss(std::string_view dialogIdentifier, std::int64_t exitCode) override;

  [[nodiscard]] std::size_t agentCount() const;

 private:
  struct Agent {
    std::string peer;
    std::string objectPath;
    std::uint64_t registration = 0;
  };
  struct PendingDialog {
    Agent agent;
    std::string dialogIdentifier;
    Reply reply;
  };

  void registerAgent(sdbus::MethodCall call);
  void unregisterAgent(sdbus::MethodCall call);
  void displayDialog(sdbus::MethodCall call);

  void askAgent(const Agent& agent, const VendDialog& dialog, std::uint64_t ticket);
  void agentFailed(const Agent& agent, const std::string& why);
  // Hands the answer to the dialog's reply, unless it has been answered.
  void answer(std::uint64_t ticket, VendDialogAnswer answer);
  void tellAgentOfDismissal(const Agent& agent, const std::string& dialogIdentifier,
                            std::int64_t exitCode);
  std::vector<PendingDialog> takePendingDialogs(
      const std::function<bool(const PendingDialog&)>& matches);

  // Each dialog waits for its agent's answer on a thread of its own, so a
  // dialog that nobody answers never holds up the next one.
  std::shared_ptr<VendElasticQueue> agentCalls_;
  mutable Mutex mutex_;
  sdbus::IConnection* connection_ GUARDED_BY(mutex_) = nullptr;
  // Oldest first; the last one is asked.
  std::vector<Agent> agents_ GUARDED_BY(mutex_);
  std::uint64_t nextRegistration_ GUARDED_BY(mutex_) = 1;
  // Dialogs handed to an agent and not answered yet, by ticket: the same
  // dialog may be up twice.
  std::map<std::uint64_t, PendingDialog> pending_ GUARDED_BY(mutex_);
  std::uint64_t nextTicket_ GUARDED_BY(mutex_) = 1;
};

}  // namespace larder
