#include "tools/larderctl/DialogAgent.h"

#include <sys/eventfd.h>
#include <utility>

#include <algorithm>
#include <stdexcept>

#include <sdbus-c++/Error.h>

#include "client/DBusValueCodec.h"
#include "client/DialogAgentProtocol.h"

namespace larder {

namespace {

int makeEventDescriptor() {
  const int descriptor = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (descriptor < 0) throw std::runtime_error("cannot make an event descriptor");
  return descriptor;
}

void sendAnswer(sdbus::MethodCall& call, const DialogAgentProtocol::Answer& answer) {
  DBusValueCodec::reply(call, "xa{sv}", {answer.exitCode, answer.values});
}

}  // namespace

DialogAgent::DialogAgent(sdbus::IConnection& connection, std::string objectPath)
    : objectPath_(std::move(objectPath)),
      wake_(makeEventDescriptor()),
      object_(sdbus::createObject(connection, objectPath_)) {
  const std::string interface(DialogAgentProtocol::kAgentInterfaceName);
  for (const BusMethod& method : DialogAgentProtocol::agentMethods()) {
    auto handler = method.member == "DisplayDialog" ? &DialogAgent::displayDialog
                                                    : &DialogAgent::dismissDialog;
    sdbus::Flags flags;
    if (method.noReply) flags.set(sdbus::Flags::METHOD_NO_REPLY);
    object_->registerMethod(
        interface, std::string(method.member), std::string(method.inSignature), method.inNames,
        std::string(method.outSignature), method.outNames,
        [this, handler](sdbus::MethodCall call) { (this->*handler)(call); }, flags);
  }
  object_->finishRegistration();
}

void DialogAgent::watchServiceRestarts(sdbus::IConnection& connection,
                                       const std::string& serviceName) {
  ownerWatch_ = connection.addMatch(
      "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
      "member='NameOwnerChanged',path='/org/freedesktop/DBus',arg0='" +
          serviceName + "'",
      [this](sdbus::Message& signal) {
        std::string name;
        std::string oldOwner;
        std::string newOwner;
        signal >> name >> oldOwner >> newOwner;
        if (newOwner.empty()) return;
        {
          MutexLock lock(mutex_);
          serviceRestarted_ = true;
        }
        wake();
      });
}

bool DialogAgent::takeServiceRestart() {
  MutexLock lock(mutex_);
  return std::exchange(serviceRestarted_, false);
}

void DialogAgent::wake() const {
  const std::uint64_t one = 1;
  [[maybe_unused]] auto written = ::write(wake_.get(), &one, sizeof one);
}

void DialogAgent::drainWake() const {
  std::uint64_t count = 0;
  [[maybe_unused]] auto read = ::read(wake_.get(), &count, sizeof count);
}

void DialogAgent::displayDialog(sdbus::MethodCall call) {
  PlistValue fields = DBusValueCodec::read(call, "a{sv}");
  Dialog dialog;
  dialog.fields = *fields.dictionary();
  if (const std::string* identifier = fields["identifier"].string()) {
    dialog.identifier = *identifier;
  }
  {
    MutexLock lock(mutex_);
    dialog.ticket = nextTicket_++;
    open_.emplace(dialog.ticket, OpenDialog{dialog, std::move(call)});
    queued_.push_back(std::move(dialog));
  }
  wake();
}

void DialogAgent::dismissDialog(sdbus::MethodCall call) {
  PlistArray arguments = DBusValueCodec::readAll(call, "sx");
  const std::string identifier = *arguments.at(0).string();
  const std::int64_t exitCode = arguments.at(1).int64Value();
  std::vector<OpenDialog> dismissed;
  {
    MutexLock lock(mutex_);
    for (auto entry = open_.begin(); entry != open_.end();) {
      if (entry->second.dialog.identifier == identifier) {
        dismissed.push_back(std::move(entry->second));
        entry = open_.erase(entry);
      } else {
        ++entry;
      }
    }
    std::erase_if(queued_, [&](const Dialog& queued) { return queued.identifier == identifier; });
    for (const OpenDialog& open : dismissed) dismissals_.push_back({open.dialog, exitCode});
  }
  // The service's call waits for an answer; the dismissal is it.
  for (OpenDialog& open : dismissed)
    sendAnswer(open.call, DialogAgentProtocol::Answer{exitCode, {}});
  if (!call.doesntExpectReply()) call.createReply().send();
  if (!dismissed.empty()) wake();
}

std::optional<DialogAgent::Dialog> DialogAgent::takeDialog() {
  MutexLock lock(mutex_);
  if (queued_.empty()) return std::nullopt;
  Dialog dialog = std::move(queued_.front());
  queued_.pop_front();
  return dialog;
}

std::vector<DialogAgent::Dismissal> DialogAgent::takeDismissals() {
  MutexLock lock(mutex_);
  return std::exchange(dismissals_, {});
}

bool DialogAgent::answer(std::uint64_t ticket, const DialogAgentProtocol::Answer& answer) {
  std::optional<OpenDialog> open;
  {
    MutexLock lock(mutex_);
    auto found = open_.find(ticket);
    if (found == open_.end()) return false;
    open = std::move(found->second);
    open_.erase(found);
  }
  sendAnswer(open->call, answer);
  return true;
}

}  // namespace larder
