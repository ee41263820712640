// Stand-ins for the system bus services the platform layer talks to,
// exported on a test's own bus: polkit's authority and logind's manager.
// Each records the calls it gets exactly as they came over the bus.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

#include "platform/system/Mutex.h"

namespace larder::testing {

// The calls a fake service was given, each as one line of text. A call is
// recorded before it is answered, so every call of a caller that has
// returned is in.
class CallRecord {
 public:
  void add(std::string call) {
    MutexLock lock(mutex_);
    calls_.push_back(std::move(call));
  }
  std::vector<std::string> calls() const {
    MutexLock lock(mutex_);
    return calls_;
  }

 private:
  mutable Mutex mutex_;
  std::vector<std::string> calls_ GUARDED_BY(mutex_);
};

class FakePolkitAuthority {
 public:
  // What the authority answers for an action.
  enum class Verdict {
    kYes,
    kNo,
    // Yes only when the caller lets polkit ask the user; a challenge otherwise.
    kAfterAuthentication,
    // The user closes the dialog.
    kDismissed,
  };

  struct Check {
    std::string subjectKind;
    std::uint32_t pid = 0;
    std::uint64_t startTime = 0;
    std::string action;
    std::map<std::string, std::string> details;
    std::uint32_t flags = 0;
    std::string cancellationId;
  };

  FakePolkitAuthority(const std::string& address, std::map<std::string, Verdict> verdicts)
      : verdicts_(std::move(verdicts)) {
    connection_ = sdbus::createSessionBusConnectionWithAddress(address);
    connection_->requestName("org.freedesktop.PolicyKit1");
    object_ = sdbus::createObject(*connection_, "/org/freedesktop/PolicyKit1/Authority");
    object_->registerMethod("CheckAuthorization")
        .onInterface("org.freedesktop.PolicyKit1.Authority")
        .implementedAs([this](const Subject& subject, const std::string& action,
                              const std::map<std::string, std::string>& details,
                              const std::uint32_t& flags, const std::string& cancellationId) {
          return check(subject, action, details, flags, cancellationId);
        });
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
  }
  ~FakePolkitAuthority() { connection_->leaveEventLoop(); }
  FakePolkitAuthority(const FakePolkitAuthority&) = delete;
  FakePolkitAuthority& operator=(const FakePolkitAuthority&) = delete;

  std::vector<Check> checks() const {
    MutexLock lock(mutex_);
    return checks_;
  }

 private:
  using Subject = sdbus::Struct<std::string, std::map<std::string, sdbus::Variant>>;
  using Reply = sdbus::Struct<bool, bool, std::map<std::string, std::string>>;

  Reply check(const Subject& subject, const std::string& action,
              const std::map<std::string, std::string>& details, std::uint32_t flags,
              const std::string& cancellationId) {
    Check call{std::get<0>(subject), 0, 0, action, details, flags, cancellationId};
    const auto& fields = std::get<1>(subject);
    if (auto pid = fields.find("pid"); pid != fields.end()) {
      call.pid = pid->second.get<std::uint32_t>();
    }
    if (auto start = fields.find("start-time"); start != fields.end()) {
      call.startTime = start->second.get<std::uint64_t>();
    }
    {
      MutexLock lock(mutex_);
      checks_.push_back(call);
    }
    auto found = verdicts_.find(action);
    const Verdict verdict = found == verdicts_.end() ? Verdict::kNo : found->second;
    const bool interactive = (flags & 1U) != 0;
    switch (verdict) {
      case Verdict::kYes:
        return Reply{true, false, {}};
      case Verdict::kAfterAuthentication:
        return interactive ? Reply{true, false, {}} : Reply{false, true, {}};
      case Verdict::kDismissed:
        return Reply{false, false, {{"polkit.dismissed", "true"}}};
      case Verdict::kNo:
        break;
    }
    return Reply{false, false, {}};
  }

  const std::map<std::string, Verdict> verdicts_;
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  mutable Mutex mutex_;
  std::vector<Check> checks_ GUARDED_BY(mutex_);
};

// logind's manager, as far as ending a session goes: every call is
// recorded as "TerminateSession <id>" or "Reboot <interactive>", and
// answered without doing anything.
class FakeLogind {
 public:
  explicit FakeLogind(const std::string& address) {
    connection_ = sdbus::createSessionBusConnectionWithAddress(address);
    connection_->requestName("org.freedesktop.login1");
    object_ = sdbus::createObject(*connection_, "/org/freedesktop/login1");
    object_->registerMethod("TerminateSession")
        .onInterface(kManager)
        .implementedAs(
            [this](const std::string& session) { record("TerminateSession " + session); });
    object_->registerMethod("Reboot").onInterface(kManager).implementedAs(
        [this](const bool& interactive) {
          record(std::string("Reboot ") + (interactive ? "true" : "false"));
        });
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
  }
  ~FakeLogind() { connection_->leaveEventLoop(); }
  FakeLogind(const FakeLogind&) = delete;
  FakeLogind& operator=(const FakeLogind&) = delete;

  std::vector<std::string> calls() const { return calls_.calls(); }

 private:
  static constexpr const char* kManager = "org.freedesktop.login1.Manager";

  void record(std::string call) { calls_.add(std::move(call)); }

  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  CallRecord calls_;
};

}  // namespace larder::testing
