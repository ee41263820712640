#include "notifications/center/UserNotificationCenter.h"

#include <algorithm>
#include <charconv>
#include <functional>
#include <map>
#include <set>
#include <utility>

#include "notifications/center/DeliveredNotificationList.h"
#include "notifications/center/FreedesktopNotificationServer.h"
#include "notifications/center/NotificationRequest.h"
#include "notifications/center/NotificationServer.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "platform/system/Uuid.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UserNotificationCenter";

// The process's centers, one per identifier and type.
struct CenterRegistry {
  using Key = std::pair<std::string, UserNotificationCenter::Type>;
  Mutex mutex;
  std::map<Key, std::shared_ptr<UserNotificationCenter>> centers GUARDED_BY(mutex);
};

CenterRegistry& centerRegistry() {
  // The log is made first so that it outlives the centers, which may still
  // log while they are torn down at exit.
  TillLogManager::sharedManager();
  static CenterRegistry registry;
  return registry;
}

// The file name of a center's list; an identifier is a reverse-DNS name,
// but one with a separator in it must still stay in the folder.
std::string listPathFor(const std::string& identifier) {
  std::string name = identifier;
  std::ranges::replace(name, '/', '_');
  if (name.empty() || name == "." || name == "..") name = "_" + name;
  return Environment::stateDirectory() + "/notifications/" + name + ".plist";
}

// Puts a changed copy of the record in its slot.
void change(std::shared_ptr<const UserNotification>& slot,
            const std::function<void(UserNotification&)>& changes) {
  auto changed = std::make_shared<UserNotification>(*slot);
  changes(*changed);
  slot = std::move(changed);
}

std::vector<UserNotification> values(
    const std::vector<std::shared_ptr<const UserNotification>>& records) {
  std::vector<UserNotification> result;
  result.reserve(records.size());
  for (const auto& record : records) result.push_back(*record);
  return result;
}

VendError activationError(std::int64_t code, std::string message) {
  return VendError::withDomain(std::string(UserNotificationCenter::kErrorDomain), code,
                               std::move(message));
}

}  // namespace

std::shared_ptr<UserNotificationCenter> UserNotificationCenter::centerForIdentifier(
    const std::string& identifier, Type type) {
  CenterRegistry& registry = centerRegistry();
  MutexLock lock(registry.mutex);
  std::shared_ptr<UserNotificationCenter>& center = registry.centers[{identifier, type}];
  if (!center) {
    const std::string listPath = listPathFor(identifier);
    DeliveredNotificationList(listPath).removeLeftovers();
    center = make(identifier, type, listPath);
    if (type == kSystemCenter) center->setServer(std::make_shared<FreedesktopNotificationServer>());
  }
  return center;
}

std::shared_ptr<UserNotificationCenter> UserNotificationCenter::makeForTesting(
    const std::string& identifier, Type type, std::string listPath) {
  return make(identifier, type, std::move(listPath));
}

std::shared_ptr<UserNotificationCenter> UserNotificationCenter::make(const std::string& identifier,
                                                                     Type type,
                                                                     std::string listPath) {
  // The constructor is private; make_shared cannot reach it.
  return std::shared_ptr<UserNotificationCenter>(
      new UserNotificationCenter(identifier, type, std::move(listPath)));
}

UserNotificationCenter::UserNotificationCenter(std::string identifier, Type type,
                                               std::string listPath)
    : identifier_(std::move(identifier)),
      type_(type),
      list_(std::make_shared<DeliveredNotificationList>(std::move(listPath))),
      serverQueue_(DispatchQueue::create("UserNotificationCenter.server." + identifier_,
                                         DispatchQueue::Kind::Serial)),
      storeQueue_(DispatchQueue::create("UserNotificationCenter.store." + identifier_,
                                        DispatchQueue::Kind::Serial)),
      delegateQueue_(DispatchQueue::create("UserNotificationCenter.delegate." + identifier_,
                                           DispatchQueue::Kind::Serial)) {
  std::vector<Record> stored;
  for (UserNotification& notification : list_->read()) {
    stored.push_back(std::make_shared<const UserNotification>(std::move(notification)));
  }
  MutexLock lock(mutex_);
  notifications_ = std::move(stored);
  TILL_LOG(3, "%@: Center %@ (type %@) holds %@ notifications", kSpeaker, identifier_,
           std::int64_t{type_}, notifications_.size());
}

UserNotificationCenter::~UserNotificationCenter() {
  // A change whose write had not started yet when the last owner let go;
  // the list drops the write when it has this revision already.
  std::vector<Record> last;
  std::uint64_t revision = 0;
  {
    MutexLock lock(mutex_);
    revision = revision_;
    if (revision > 0) last = std::move(notifications_);
  }
  if (revision == 0) return;
  if (Result<void> written = list_->write(last, revision); !written) {
    TILL_LOG(1, "%@: Could not write %@: %@", kSpeaker, list_->path(), written.errorDescription());
  }
}

void UserNotificationCenter::setDelegate(std::weak_ptr<Delegate> delegate) {
  MutexLock lock(mutex_);
  delegate_ = std::move(delegate);
}

void UserNotificationCenter::setServer(std::shared_ptr<NotificationServer> server) {
  std::shared_ptr<NotificationServer> replaced;
  {
    MutexLock lock(mutex_);
    replaced = std::exchange(server_, server);
  }
  // The old server stops here, outside the lock; its signals that are
  // already queued still find the records they name.
  replaced.reset();
  if (!server) return;
  // The server's threads only queue the signals: the center may be gone by
  // the time they run, and is never kept alive by them.
  NotificationServer::Handlers handlers{
      .actionInvoked =
          [weak = weak_from_this(), queue = serverQueue_](std::uint32_t serverIdentifier,
                                                          const std::string& actionKey) {
            queue->async([weak, serverIdentifier, actionKey] {
              if (auto self = weak.lock()) self->serverDidInvokeAction(serverIdentifier, actionKey);
            });
          },
      .closed =
          [weak = weak_from_this(), queue = serverQueue_](std::uint32_t serverIdentifier,
                                                          std::uint32_t reason) {
            queue->async([weak, serverIdentifier, reason] {
              if (auto self = weak.lock()) self->serverDidClose(serverIdentifier, reason);
            });
          },
  };
  // Connecting may wait for the bus: not on the caller's thread.
  serverQueue_->async([server = std::move(server), handlers = std::move(handlers)]() mutable {
    server->setHandlers(std::move(handlers));
  });
}

UserNotification UserNotificationCenter::deliverNotification(UserNotification notification) {
  notification.identifier = Uuid::generateString();
  // To the microsecond, which the list file keeps exactly.
  notification.actualDeliveryDate =
      std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
  notification.serverIdentifier = 0;
  notification.displayed = false;
  notification.activationType = UserNotification::kActivationNone;
  notification.alternateActionIndex = UserNotification::kNoAlternateAction;
  {
    MutexLock lock(mutex_);
    notifications_.push_back(std::make_shared<const UserNotification>(notification));
    listChangedLocked();
  }
  TILL_LOG(2, "%@: Delivered notification %@ \"%@\" in %@", kSpeaker, notification.identifier,
           notification.title, identifier_);
  if (type_ == kSystemCenter) {
    serverQueue_->async([weak = weak_from_this(), notification] {
      if (auto self = weak.lock()) self->present(notification);
    });
  }
  return notification;
}

void UserNotificationCenter::present(const UserNotification& notification) {
  std::shared_ptr<NotificationServer> server;
  std::shared_ptr<Delegate> delegate;
  {
    MutexLock lock(mutex_);
    // Removed while it waited for its turn.
    if (!findLocked(notification.identifier)) return;
    server = server_;
    delegate = delegate_.lock();
  }
  if (delegate && !delegate->shouldPresentNotification(*this, notification)) {
    TILL_LOG(3, "%@: Notification %@ kept in the list only, as the delegate asked", kSpeaker,
             notification.identifier);
    return;
  }
  if (!server) {
    TILL_LOG(3, "%@: No notification server set; notification %@ recorded, not shown", kSpeaker,
             notification.identifier);
    return;
  }
  Result<std::uint32_t> shown = server->notify(NotificationRequest::forNotification(notification));
  if (!shown) {
    if (shown.error().code == NotificationServer::kNoServerCode) {
      TILL_LOG(2,
               "%@: No notification server on the session bus; notification %@ recorded, not shown",
               kSpeaker, notification.identifier);
    } else {
      TILL_LOG(1, "%@: The notification server did not show notification %@: %@", kSpeaker,
               notification.identifier, shown.errorDescription());
    }
    return;
  }
  {
    MutexLock lock(mutex_);
    if (Record* record = findLocked(notification.identifier)) {
      change(*record, [&](UserNotification& shownRecord) {
        shownRecord.serverIdentifier = *shown;
        shownRecord.displayed = true;
      });
      listChangedLocked();
      TILL_LOG(3, "%@: Notification %@ shown as %@", kSpeaker, notification.identifier, *shown);
      return;
    }
  }
  // Removed while the server was showing it: it must not stay on screen
  // with nothing in the list to answer for it.
  if (Result<void> closed = server->closeNotification(*shown); !closed) {
    TILL_LOG(3, "%@: Could not close %@: %@", kSpeaker, *shown, closed.errorDescription());
  }
}

std::vector<UserNotification> UserNotificationCenter::deliveredNotifications() const {
  MutexLock lock(mutex_);
  return values(notifications_);
}

std::vector<UserNotification> UserNotificationCenter::displayedNotifications() const {
  MutexLock lock(mutex_);
  std::vector<UserNotification> displayed;
  for (const Record& record : notifications_) {
    if (record->displayed) displayed.push_back(*record);
  }
  return displayed;
}

void UserNotificationCenter::removeDeliveredNotification(const UserNotification& notification) {
  MutexLock lock(mutex_);
  const Record removed = takeLocked(notification.identifier);
  if (!removed) return;
  closeOnServerLocked(*removed);
  listChangedLocked();
}

void UserNotificationCenter::removeDisplayedNotification(const UserNotification& notification) {
  MutexLock lock(mutex_);
  Record* record = findLocked(notification.identifier);
  if (!record || !(*record)->displayed) return;
  closeOnServerLocked(**record);
  change(*record, [](UserNotification& closed) { closed.displayed = false; });
  listChangedLocked();
}

void UserNotificationCenter::setDeliveredNotifications(
    std::vector<UserNotification> notifications) {
  std::set<std::string, std::less<>> kept;
  std::vector<Record> records;
  records.reserve(notifications.size());
  for (UserNotification& notification : notifications) {
    // Every record of the list is reachable by its identifier.
    if (notification.identifier.empty()) notification.identifier = Uuid::generateString();
    kept.insert(notification.identifier);
    records.push_back(std::make_shared<const UserNotification>(std::move(notification)));
  }
  MutexLock lock(mutex_);
  for (const Record& old : notifications_) {
    if (!kept.contains(old->identifier)) closeOnServerLocked(*old);
  }
  notifications_ = std::move(records);
  listChangedLocked();
}

std::optional<UserNotificationCenter::Action> UserNotificationCenter::parseAction(
    const std::string& actionKey) {
  if (actionKey == NotificationRequest::kDefaultAction) return Action{Action::kContents};
  if (actionKey == NotificationRequest::kMainAction) return Action{Action::kMainButton};
  if (actionKey == NotificationRequest::kOtherAction) return Action{Action::kOtherButton};
  if (actionKey == NotificationRequest::kSnoozeAction) return Action{Action::kSnooze};
  const std::string_view prefix = NotificationRequest::kAlternateActionPrefix;
  if (!actionKey.starts_with(prefix)) return std::nullopt;
  const char* first = actionKey.data() + prefix.size();
  const char* last = actionKey.data() + actionKey.size();
  std::int64_t index = 0;
  // Digits only: no sign, no space, nothing after them.
  auto [end, error] = std::from_chars(first, last, index);
  if (first == last || *first < '0' || *first > '9' || error != std::errc() || end != last) {
    return std::nullopt;
  }
  return Action{Action::kMenuEntry, index};
}

Result<void> UserNotificationCenter::activate(const std::string& notificationIdentifier,
                                              const std::string& actionKey) {
  const std::optional<Action> action = parseAction(actionKey);
  std::shared_ptr<Delegate> delegate;
  UserNotification activated;
  {
    MutexLock lock(mutex_);
    Record* record = findLocked(notificationIdentifier);
    if (!record) {
      return activationError(
          kUnknownNotificationCode,
          "No notification " + notificationIdentifier + " in notification center " + identifier_);
    }
    if (!action) {
      return activationError(kUnknownActionCode,
                             "Unknown action \"" + actionKey + "\" for notification " +
                                 notificationIdentifier +
                                 " (known: default, action, other, alternate-N, snooze)");
    }
    const auto entries = static_cast<std::int64_t>((*record)->alternateActionButtonTitles.size());
    if (action->kind == Action::kMenuEntry && action->menuIndex >= entries) {
      return activationError(kUnknownActionCode, "Notification " + notificationIdentifier +
                                                     " has " + std::to_string(entries) +
                                                     " menu entries; no entry " +
                                                     std::to_string(action->menuIndex));
    }
    activated = **record;
    if (action->kind == Action::kContents) {
      activated.activationType = UserNotification::kContentsClicked;
    } else if (action->kind != Action::kOtherButton && action->kind != Action::kSnooze) {
      activated.activationType = UserNotification::kActionButtonClicked;
    }
    activated.alternateActionIndex = action->menuIndex;
    delegate = delegate_.lock();
    if (delegate) {
      // A used button ends an alert (the server has closed it); the second
      // button ends any notification. A click on the contents, the main
      // button of a banner or a snooze leaves it in the list.
      const bool button = action->kind == Action::kMainButton || action->kind == Action::kMenuEntry;
      const bool ends = action->kind == Action::kOtherButton ||
                        (button && activated.displayStyle == UserNotification::kAlert);
      if (ends) {
        closeOnServerLocked(activated);
        takeLocked(notificationIdentifier);
      } else if (action->kind == Action::kSnooze) {
        // Put away, not ended: it leaves the screen and stays listed.
        closeOnServerLocked(activated);
        change(*record, [](UserNotification& away) { away.displayed = false; });
      } else {
        change(*record, [&](UserNotification& stays) {
          stays.activationType = activated.activationType;
          stays.alternateActionIndex = activated.alternateActionIndex;
        });
      }
      listChangedLocked();
    }
  }
  if (!delegate) {
    TILL_LOG(2, "%@: Notification %@ activated with \"%@\"; no delegate to tell", kSpeaker,
             notificationIdentifier, actionKey);
    return {};
  }
  TILL_LOG(2, "%@: Notification %@ activated with \"%@\"", kSpeaker, notificationIdentifier,
           actionKey);
  delegateQueue_->async([self = shared_from_this(), delegate = std::move(delegate),
                         activated = std::move(activated), kind = action->kind] {
    if (kind == Action::kOtherButton) {
      delegate->didDismissAlert(*self, activated);
    } else if (kind == Action::kSnooze) {
      delegate->didSnoozeAlert(*self, activated);
    } else {
      delegate->didActivateNotification(*self, activated);
    }
  });
  return {};
}

void UserNotificationCenter::serverDidInvokeAction(std::uint32_t serverIdentifier,
                                                   const std::string& actionKey) {
  std::string notificationIdentifier;
  {
    MutexLock lock(mutex_);
    const Record* record = findShownLocked(serverIdentifier);
    // Another application's notification: the server's signals go to all.
    if (!record) return;
    notificationIdentifier = (*record)->identifier;
  }
  if (Result<void> activated = activate(notificationIdentifier, actionKey); !activated) {
    TILL_LOG(1, "%@: Ignored action from the notification server: %@", kSpeaker,
             activated.errorDescription());
  }
}

void UserNotificationCenter::serverDidClose(std::uint32_t serverIdentifier, std::uint32_t reason) {
  // Reasons: 1 expired, 2 dismissed by the user, 3 closed by a call, 4 other.
  TILL_LOG(3, "%@: The notification server closed %@ (reason %@)", kSpeaker, serverIdentifier,
           reason);
  MutexLock lock(mutex_);
  Record* record = findShownLocked(serverIdentifier);
  if (!record) return;
  change(*record, [](UserNotification& closed) { closed.displayed = false; });
  listChangedLocked();
}

void UserNotificationCenter::closeOnServerLocked(const UserNotification& notification) {
  if (notification.serverIdentifier == 0 || !notification.displayed || !server_) return;
  // The server is held by the work itself, so that a removal still
  // reaches the screen when the center goes right after it.
  serverQueue_->async([server = server_, serverIdentifier = notification.serverIdentifier] {
    if (Result<void> closed = server->closeNotification(serverIdentifier); !closed) {
      TILL_LOG(3, "%@: Could not close %@: %@", kSpeaker, serverIdentifier,
               closed.errorDescription());
    }
  });
}

UserNotificationCenter::Record* UserNotificationCenter::findLocked(
    const std::string& notificationIdentifier) {
  auto found = std::ranges::find_if(notifications_, [&](const Record& record) {
    return record->identifier == notificationIdentifier;
  });
  return found == notifications_.end() ? nullptr : &*found;
}

UserNotificationCenter::Record* UserNotificationCenter::findShownLocked(
    std::uint32_t serverIdentifier) {
  if (serverIdentifier == 0) return nullptr;
  // The newest first: a server that restarted hands its numbers out again.
  auto found =
      std::find_if(notifications_.rbegin(), notifications_.rend(), [&](const Record& record) {
        return record->displayed && record->serverIdentifier == serverIdentifier;
      });
  return found == notifications_.rend() ? nullptr : &*found;
}

UserNotificationCenter::Record UserNotificationCenter::takeLocked(
    const std::string& notificationIdentifier) {
  Record* slot = findLocked(notificationIdentifier);
  if (!slot) return nullptr;
  Record taken = std::move(*slot);
  notifications_.erase(notifications_.begin() + (slot - notifications_.data()));
  return taken;
}

// The write queued last is the one that carries the last change, and the
// store queue is serial: once an empty task has run, it has too.
void UserNotificationCenter::finishPendingWrites() {
  storeQueue_->sync([] {});
}

void UserNotificationCenter::finishPendingWritesOfAllCenters() {
  std::vector<std::shared_ptr<UserNotificationCenter>> centers;
  {
    CenterRegistry& registry = centerRegistry();
    MutexLock lock(registry.mutex);
    for (const auto& [key, center] : registry.centers) centers.push_back(center);
  }
  for (const std::shared_ptr<UserNotificationCenter>& center : centers) {
    center->finishPendingWrites();
  }
}

void UserNotificationCenter::listChangedLocked() {
  ++revision_;
  if (writeScheduled_) return;
  writeScheduled_ = true;
  storeQueue_->async([weak = weak_from_this()] {
    std::vector<Record> snapshot;
    std::uint64_t revision = 0;
    std::shared_ptr<DeliveredNotificationList> list;
    {
      // Gone: its destructor wrote the list.
      std::shared_ptr<UserNotificationCenter> self = weak.lock();
      if (!self) return;
      MutexLock lock(self->mutex_);
      self->writeScheduled_ = false;
      snapshot = self->notifications_;
      revision = self->revision_;
      list = self->list_;
    }
    if (Result<void> written = list->write(snapshot, revision); !written) {
      TILL_LOG(1, "%@: Could not write %@: %@", kSpeaker, list->path(), written.errorDescription());
    }
  });
}

}  // namespace larder
