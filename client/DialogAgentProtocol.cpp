#include "client/DialogAgentProtocol.h"

#include <vector>

namespace larder {

namespace {

const std::vector<BusMethod>& registryMethodTable() {
  static const std::vector<BusMethod> table{
      {"RegisterDialogAgent", "o", {"agent"}, "", {}},
      {"UnregisterDialogAgent", "o", {"agent"}, "", {}},
      {"DisplayDialog", "a{sv}", {"dialog"}, "xa{sv}", {"exitCode", "values"}},
  };
  return table;
}

const std::vector<BusMethod>& agentMethodTable() {
  static const std::vector<BusMethod> table{
      {"DisplayDialog", "a{sv}", {"dialog"}, "xa{sv}", {"exitCode", "values"}},
      {"DismissDialog", "sx", {"identifier", "exitCode"}, "", {}, true},
  };
  return table;
}

}  // namespace

std::span<const BusMethod> DialogAgentProtocol::registryMethods() {
  return registryMethodTable();
}

std::span<const BusMethod> DialogAgentProtocol::agentMethods() {
  return agentMethodTable();
}

const BusMethod* DialogAgentProtocol::findRegistryMethod(std::string_view member) {
  return findBusMethod(registryMethodTable(), member);
}

}  // namespace larder
