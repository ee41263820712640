#include "client/StoreRuntimeProtocol.h"

#include <vector>

namespace larder {

namespace {

const std::vector<BusMethod>& methodTable() {
  static const std::vector<BusMethod> table{
      {"SignIn", "ss", {"accountName", "password"}, "bta{sv}", {"success", "accountID", "error"}},
      {"SignOut", "", {}, "", {}},
      {"PrimaryAccount", "", {}, "a{sv}", {"account"}},
      {"Purchase",
       "ts",
       {"itemIdentifier", "buyParameters"},
       "ba{sv}aa{sv}",
       {"success", "error", "downloads"}},
      {"Downloads", "x", {"typeMask"}, "aa{sv}", {"downloads"}},
  };
  return table;
}

}  // namespace

std::span<const BusMethod> StoreRuntimeProtocol::methods() {
  return methodTable();
}

const BusMethod* StoreRuntimeProtocol::findMethod(std::string_view member) {
  return findBusMethod(methodTable(), member);
}

}  // namespace larder
