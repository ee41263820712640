#include "store-runtime/host/PolkitAuthority.h"

#include <unistd.h>

#include <sdbus-c++/sdbus-c++.h>
#include <chrono>
#include <fstream>
#include <map>
#include <sstream>

namespace larder {

namespace {

constexpr std::string_view kErrorDomain = "PolkitAuthority";
constexpr std::int64_t kCallFailedCode = 1;
// A person may take a while to type a password; a quiet check answers at
// once.
constexpr auto kInteractiveTimeout = std::chrono::minutes(5);
constexpr auto kQuietTimeout = std::chrono::seconds(25);

using Subject = sdbus::Struct<std::string, std::map<std::string, sdbus::Variant>>;
using Reply = sdbus::Struct<bool, bool, std::map<std::string, std::string>>;

// Field 22 of /proc/self/stat, counted after the command name, which may
// hold spaces and parentheses of its own.
std::uint64_t processStartTime() {
  std::ifstream file("/proc/self/stat");
  std::string line;
  std::getline(file, line);
  const std::size_t end = line.rfind(')');
  if (end == std::string::npos) return 0;
  std::istringstream fields(line.substr(end + 2));
  std::string field;
  // State is field 3; start time is field 22.
  for (int index = 3; index < 22 && fields >> field; ++index) {
  }
  std::uint64_t startTime = 0;
  fields >> startTime;
  return startTime;
}

Subject thisProcess() {
  return Subject{std::string("unix-process"),
                 std::map<std::string, sdbus::Variant>{
                     {"pid", sdbus::Variant(static_cast<std::uint32_t>(::getpid()))},
                     {"start-time", sdbus::Variant(processStartTime())}}};
}

}  // namespace

PolkitAuthority::PolkitAuthority(std::unique_ptr<sdbus::IConnection> connection)
    : connection_(std::move(connection)) {}

PolkitAuthority::~PolkitAuthority() = default;

bool PolkitAuthority::isPresent(sdbus::IConnection& connection) {
  try {
    auto bus = sdbus::createProxy(connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    bool owned = false;
    bus->callMethod("NameHasOwner")
        .onInterface("org.freedesktop.DBus")
        .withArguments(std::string(kServiceName))
        .storeResultsTo(owned);
    return owned;
  } catch (const sdbus::Error&) {
    return false;
  }
}

Result<PolkitAuthority::Answer> PolkitAuthority::checkAuthorization(const std::string& action,
                                                                    bool interactive) {
  try {
    auto authority = sdbus::createProxy(*connection_, kServiceName, kObjectPath);
    Reply reply;
    authority->callMethod("CheckAuthorization")
        .onInterface(kInterface)
        .withTimeout(
            interactive ? std::chrono::duration_cast<std::chrono::microseconds>(kInteractiveTimeout)
                        : std::chrono::microseconds(kQuietTimeout))
        .withArguments(thisProcess(), action, std::map<std::string, std::string>{},
                       interactive ? kAllowUserInteraction : std::uint32_t{0}, std::string())
        .storeResultsTo(reply);
    const auto& details = std::get<2>(reply);
    return Answer{std::get<0>(reply), std::get<1>(reply), details.contains("polkit.dismissed")};
  } catch (const sdbus::Error& error) {
    return VendError::withDomain(
        std::string(kErrorDomain), kCallFailedCode,
        "CheckAuthorization of " + action + " failed: " + error.getMessage());
  }
}

}  // namespace larder
