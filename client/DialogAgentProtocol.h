#pragma once

#include <cstdint>
#include <span>
#include <string_view>

#include "client/BusMethod.h"
#include "platform/value/PlistValue.h"

namespace larder {

// How the service and the dialog agents of a session talk: an agent
// registers its object with the service, which then calls it to show each
// dialog and waits for the person's answer.
class DialogAgentProtocol {
 public:
  // The registry, on the service object.
  static constexpr std::string_view kRegistryInterfaceName = "com.orvane.larderd.DialogAgents";
  // On each agent object.
  static constexpr std::string_view kAgentInterfaceName = "com.orvane.larderd.VendDialogAgent";

  // The "kind" of a dialog that asks for an account name and password; the
  // agent answers it with the values it collected.
  static constexpr std::int64_t kSignInKind = 1;

  // An agent's answer to DisplayDialog: the exit code is the role of the
  // button the person chose.
  enum Button : std::int64_t { kCancel = 0, kOK = 1, kOther = 2 };
  struct Answer {
    std::int64_t exitCode = kCancel;
    // Extra answers: "accountName" and "password" for a sign-in dialog.
    PlistDictionary values;
  };

  static std::span<const BusMethod> registryMethods();
  static std::span<const BusMethod> agentMethods();
  static const BusMethod* findRegistryMethod(std::string_view member);
};

}  // namespace larder
