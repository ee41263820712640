#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "client/DialogAgentProtocol.h"
#include "platform/system/FileDescriptor.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The bus side of `larderctl agent`: a dialog agent object that queues the
// dialogs the service sends and answers them when told. The service's calls
// arrive on the bus thread; the command reads the queue on its own thread,
// woken through `wakeDescriptor`.
//
// A dismissal from the service answers the dialog's call at once with the
// exit code it names, whether or not the dialog has been taken yet, and is
// reported through `takeDismissals`.
class DialogAgent {
 public:
  struct Dialog {
    std::uint64_t ticket = 0;
    std::string identifier;
    PlistDictionary fields;
  };
  // One dialog the service took down, queued or taken.
  struct Dismissal {
    Dialog dialog;
    std::int64_t exitCode = 0;
  };

  DialogAgent(sdbus::IConnection& connection, std::string objectPath);
  DialogAgent(const DialogAgent&) = delete;
  DialogAgent& operator=(const DialogAgent&) = delete;

  [[nodiscard]] const std::string& objectPath() const { return objectPath_; }
  // Readable while dialogs or dismissals wait; `drainWake` clears it.
  [[nodiscard]] int wakeDescriptor() const { return wake_.get(); }
  void drainWake() const;

  // Watches the bus for a new owner of `serviceName`: a service that was
  // restarted has forgotten its agents. Reported through
  // `takeServiceRestart` and the wake descriptor.
  void watchServiceRestarts(sdbus::IConnection& connection, const std::string& serviceName);
  // True once after each new owner.
  bool takeServiceRestart();

  std::optional<Dialog> takeDialog();
  std::vector<Dismissal> takeDismissals();
  // Answers a taken dialog; false when it was dismissed meanwhile and so
  // already answered.
  bool answer(std::uint64_t ticket, const DialogAgentProtocol::Answer& answer);

 private:
  void displayDialog(sdbus::MethodCall call);
  void dismissDialog(sdbus::MethodCall call);
  void wake() const;

  std::string objectPath_;
  FileDescriptor wake_;
  Mutex mutex_;
  std::uint64_t nextTicket_ GUARDED_BY(mutex_) = 1;
  std::deque<Dialog> queued_ GUARDED_BY(mutex_);
  struct OpenDialog {
    Dialog dialog;
    sdbus::MethodCall call;
  };
  // Every dialog not answered yet, queued or taken, by ticket.
  std::map<std::uint64_t, OpenDialog> open_ GUARDED_BY(mutex_);
  std::vector<Dismissal> dismissals_ GUARDED_BY(mutex_);
  bool serviceRestarted_ GUARDED_BY(mutex_) = false;
  std::unique_ptr<sdbus::IObject> object_;
  sdbus::Slot ownerWatch_;
};

}  // namespace larder
