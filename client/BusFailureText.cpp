#include "client/BusFailureText.h"

#include <cmath>
#include <initializer_list>
#include <sstream>

namespace larder {
namespace {

bool isOneOf(std::string_view name, std::initializer_list<std::string_view> names) {
  for (std::string_view candidate : names) {
    if (name == candidate) return true;
  }
  return false;
}

bool onSystemBus(std::string_view busName) {
  return busName == "system";
}

std::string unitCommand(std::string_view busName, std::string_view verb) {
  std::string command = onSystemBus(busName) ? "`systemctl " : "`systemctl --user ";
  command += verb;
  command += " larderd`";
  return command;
}

std::string seconds(double value) {
  std::ostringstream text;
  text << value;
  return text.str();
}

}  // namespace

std::string BusFailureText::forCall(std::string_view errorName, std::string_view message,
                                    const Call& call) {
  std::ostringstream text;
  if (isOneOf(errorName, {"org.freedesktop.DBus.Error.ServiceUnknown",
                          "org.freedesktop.DBus.Error.NameHasNoOwner"})) {
    text << "larderd is not running: nothing owns " << call.serviceName << " on the "
         << call.busName << " bus. Is larderd running? " << unitCommand(call.busName, "status");
  } else if (isOneOf(errorName,
                     {"org.freedesktop.DBus.Error.NoReply", "org.freedesktop.DBus.Error.Timeout",
                      "org.freedesktop.DBus.Error.TimedOut"})) {
    text << "larderd did not answer " << call.member << " within " << seconds(call.timeoutSeconds)
         << " s; give it longer with --timeout, or see what it is doing: `journalctl "
         << (onSystemBus(call.busName) ? "" : "--user ") << "-u larderd`";
  } else if (isOneOf(errorName, {"org.freedesktop.DBus.Error.UnknownMethod",
                                 "org.freedesktop.DBus.Error.UnknownInterface",
                                 "org.freedesktop.DBus.Error.UnknownObject"})) {
    text << "the running larderd does not know " << call.member << " (" << message
         << "); it may be older than this larderctl: " << unitCommand(call.busName, "restart");
  } else if (errorName == "org.freedesktop.DBus.Error.AccessDenied") {
    text << "the " << call.busName << " bus refused " << call.member << " to " << call.serviceName
         << ": " << message;
  } else if (errorName.starts_with("com.orvane.larderd.")) {
    // The service's own errors say what went wrong in their message.
    text << "larderd could not do " << call.member << ": " << message << " (" << errorName << ")";
  } else {
    text << "calling " << call.member << " on " << call.serviceName << " failed: " << message
         << " (" << errorName << ")";
  }
  return text.str();
}

std::string BusFailureText::forConnection(std::string_view message, std::string_view busName) {
  std::ostringstream text;
  text << "cannot connect to the " << busName << " bus: " << message << ". ";
  if (onSystemBus(busName)) {
    text << "Is the system's D-Bus running? `systemctl status dbus`";
  } else {
    text << "larderctl talks to the larderd of a login session: run it inside one, or point "
            "DBUS_SESSION_BUS_ADDRESS at the session's bus";
  }
  return text.str();
}

}  // namespace larder
