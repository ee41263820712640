#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "notifications/center/UserNotification.h"
#include "platform/error/Result.h"
#include "platform/system/Mutex.h"

namespace larder {

class DeliveredNotificationList;
class DispatchQueue;
class NotificationServer;

// The notifications of one poster: those delivered, kept in a list that
// survives a restart of the service (the desktop's notification server
// keeps nothing), and shown on the desktop's notification server while one
// is on the session bus. Safe from any thread; delivering and removing
// return without waiting for the server.
class UserNotificationCenter : public std::enable_shared_from_this<UserNotificationCenter> {
 public:
  enum Type : std::int64_t {
    // The store application's own list; nothing of it is shown.
    kApplicationCenter = 1,
    // The service's notifications, shown on the desktop.
    kSystemCenter = 2,
  };

  // The identifier of the service's own center.
  static constexpr std::string_view kServiceIdentifier = "com.orvane.larderd";

  // The errors of `activate`.
  static constexpr std::string_view kErrorDomain = "UserNotificationCenter";
  static constexpr std::int64_t kUnknownNotificationCode = 1;
  static constexpr std::int64_t kUnknownActionCode = 2;

  // Told what the user did with a notification. Called on the center's
  // signal thread, never with a lock of the center held.
  class Delegate {
   public:
    virtual ~Delegate() = default;
    // The contents were clicked, or the main button or one of its menu
    // entries was used (see activationType, alternateActionIndex).
    virtual void didActivateNotification(UserNotificationCenter& center,
                                         const UserNotification& notification) = 0;
    // The second button of an alert was used.
    virtual void didDismissAlert(UserNotificationCenter& center,
                                 const UserNotification& notification) = 0;
    // The alert was put away for now: it is off the screen and still in
    // the list.
    virtual void didSnoozeAlert(UserNotificationCenter& center,
                                const UserNotification& notification) = 0;
    // Asked before a notification is shown; false keeps it in the list only.
    virtual bool shouldPresentNotification(UserNotificationCenter& center,
                                           const UserNotification& notification) = 0;
  };

  // The one center of this identifier and type in the process, made on first
  // use; its list is read from the state folder then.
  static std::shared_ptr<UserNotificationCenter> centerForIdentifier(const std::string& identifier,
                                                                     Type type);
  // A center of its own, outside the process's set, keeping its list in
  // `listPath`, and without a server until one is set: for tests.
  static std::shared_ptr<UserNotificationCenter> makeForTesting(const std::string& identifier,
                                                                Type type, std::string listPath);

  ~UserNotificationCenter();
  UserNotificationCenter(const UserNotificationCenter&) = delete;
  UserNotificationCenter& operator=(const UserNotificationCenter&) = delete;

  [[nodiscard]] const std::string& identifier() const { return identifier_; }
  [[nodiscard]] Type type() const { return type_; }

  void setDelegate(std::weak_ptr<Delegate> delegate);

  // Gives the notification its identifier and delivery date, records it and
  // asks the server to show it. Returns the recorded notification.
  UserNotification deliverNotification(UserNotification notification);
  [[nodiscard]] std::vector<UserNotification> deliveredNotifications() const;
  // Takes it out of the list (matched by identifier) and off the screen.
  void removeDeliveredNotification(const UserNotification& notification);
  // Those on screen at the moment.
  [[nodiscard]] std::vector<UserNotification> displayedNotifications() const;
  // Takes it off the screen; it stays in the list.
  void removeDisplayedNotification(const UserNotification& notification);
  // Replaces the whole list; what leaves it leaves the screen too.
  void setDeliveredNotifications(std::vector<UserNotification> notifications);

  // What the user does, as the notification server reports it. An action key
  // is "default" (the contents), "action" (the main button), "other" (the
  // second button), "alternate-N" (menu entry N) or "snooze" (put away for
  // now). Unknown identifiers and
  // keys are errors; the delegate is told of the rest.
  Result<void> activate(const std::string& notificationIdentifier, const std::string& actionKey);

  // Returns once the changes made so far are in the list file.
  void finishPendingWrites();
  // The same for every center of the process, at a stop of the service.
  static void finishPendingWritesOfAllCenters();

  // Replaces the connection to the desktop's notification server (tests;
  // the service keeps the session bus's). Null: nothing is shown.
  void setServer(std::shared_ptr<NotificationServer> server);

 private:
  // What an action key asks for.
  struct Action {
    enum Kind { kContents, kMainButton, kMenuEntry, kOtherButton, kSnooze };
    Kind kind = kContents;
    std::int64_t menuIndex = UserNotification::kNoAlternateAction;
  };

  // Records are never changed in place: a change puts a changed copy in
  // the list's slot, so that a copy of the list to write is a copy of
  // pointers, made quickly under the lock the posters wait for.
  using Record = std::shared_ptr<const UserNotification>;

  UserNotificationCenter(std::string identifier, Type type, std::string listPath);
  static std::shared_ptr<UserNotificationCenter> make(const std::string& identifier, Type type,
                                                      std::string listPath);

  static std::optional<Action> parseAction(const std::string& actionKey);
  // Takes the notification out of the list if it is there; a copy of it.
  Record takeLocked(const std::string& notificationIdentifier) REQUIRES(mutex_);
  // The slot of the notification in the list, or null.
  Record* findLocked(const std::string& notificationIdentifier) REQUIRES(mutex_);
  Record* findShownLocked(std::uint32_t serverIdentifier) REQUIRES(mutex_);
  // The list changed: it goes to its file soon, in one write for the
  // changes that come before the write starts.
  void listChangedLocked() REQUIRES(mutex_);

  // Work of the server queue.
  void present(const UserNotification& notification) EXCLUDES(mutex_);
  void serverDidInvokeAction(std::uint32_t serverIdentifier, const std::string& actionKey)
      EXCLUDES(mutex_);
  void serverDidClose(std::uint32_t serverIdentifier, std::uint32_t reason) EXCLUDES(mutex_);
  // Asks the server to take it off the screen, on the server queue.
  void closeOnServerLocked(const UserNotification& notification) REQUIRES(mutex_);

  const std::string identifier_;
  const Type type_;
  // Shared with the writes in the store queue, which must not keep the
  // center alive.
  const std::shared_ptr<DeliveredNotificationList> list_;
  // Calls of the server, which may be slow or absent, in the order they
  // were asked for; and the signals of the server after them.
  const std::shared_ptr<DispatchQueue> serverQueue_;
  // Writes of the list file.
  const std::shared_ptr<DispatchQueue> storeQueue_;
  // Calls of the delegate, so that they never wait for the server.
  const std::shared_ptr<DispatchQueue> delegateQueue_;

  mutable Mutex mutex_;
  std::vector<Record> notifications_ GUARDED_BY(mutex_);
  std::weak_ptr<Delegate> delegate_ GUARDED_BY(mutex_);
  std::shared_ptr<NotificationServer> server_ GUARDED_BY(mutex_);
  // Changes of the list since the center was made.
  std::uint64_t revision_ GUARDED_BY(mutex_) = 0;
  bool writeScheduled_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
