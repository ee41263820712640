#include "AssetService/ServiceListener.h"

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>

#include "AssetService/DialogAgentRegistry.h"
#include "AssetService/StoreRuntimeInterface.h"
#include "client/DBusValueCodec.h"
#include "client/DistributedNotificationProtocol.h"
#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/host/LedgerDistributedNotificationCenter.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "ServiceListener";

std::unique_ptr<sdbus::IConnection> connectToBus() {
  if (Environment::variable("LARDER_BUS") == "system") return sdbus::createSystemBusConnection();
  return sdbus::createSessionBusConnection();
}

// An object that lives in a client: each call is sent without waiting for
// an answer, so that a slow or vanished client holds up nobody, and a client
// that has gone simply never receives it.
class DBusCallbackObject {
 public:
  DBusCallbackObject(sdbus::IConnection& connection, std::string peer, std::string objectPath,
                     std::string_view protocol)
      : peer_(std::move(peer)),
        objectPath_(std::move(objectPath)),
        interfaceName_(std::string(ServiceRequests::kCallbackInterfacePrefix) +
                       std::string(protocol)),
        proxy_(sdbus::createProxy(connection, peer_, objectPath_)) {}

  void send(std::string_view member, std::string_view signature, const PlistArray& values) const {
    try {
      sdbus::MethodCall call = proxy_->createMethodCall(interfaceName_, std::string(member));
      DBusValueCodec::writeAll(call, signature, values);
      call.dontExpectReply();
      proxy_->callMethod(call);
    } catch (const sdbus::Error& error) {
      TILL_LOG(3, "%@: call to %@ %@ dropped: %@", kSpeaker, peer_, objectPath_, error.what());
    }
  }

  [[nodiscard]] bool isSameObjectAs(const DBusCallbackObject* other) const {
    return other && other->peer_ == peer_ && other->objectPath_ == objectPath_;
  }

 private:
  std::string peer_;
  std::string objectPath_;
  std::string interfaceName_;
  std::unique_ptr<sdbus::IProxy> proxy_;
};

PlistArray wireForms(const std::vector<SysupQuaymartUpdate>& updates) {
  PlistArray wire;
  for (const SysupQuaymartUpdate& update : updates) wire.emplace_back(update.toDictionary());
  return wire;
}

class DBusSoftwareMapObserver final : public VendSoftwareMapObserver, DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void softwareProductUpdatedState(const LedgerSoftwareProductRef& product,
                                   std::int64_t state) override {
    send("SoftwareProductUpdatedState", "a{sv}x", {product->toDictionary(), state});
  }
};

class DBusAvailableUpdatesObserver final : public VendAvailableUpdatesObserver,
                                           DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void availableUpdatesDidChangedWithUpdates(const std::vector<LedgerUpdateRef>& updates,
                                             const std::vector<SysupQuaymartUpdate>& osUpdates,
                                             std::uint64_t badgeCount) override {
    PlistArray appUpdates;
    for (const LedgerUpdateRef& update : updates) appUpdates.emplace_back(update->toDictionary());
    send("AvailableUpdatesDidChangedWithUpdatesOsUpdatesBadgeCount", "aa{sv}aa{sv}t",
         {std::move(appUpdates), wireForms(osUpdates), badgeCount});
  }
  [[nodiscard]] bool isSameObserverAs(const VendAvailableUpdatesObserver& other) const override {
    return isSameObjectAs(dynamic_cast<const DBusAvailableUpdatesObserver*>(&other));
  }
};

class DBusOSUpdateScanObserver final : public VendOSUpdateScanObserver, DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void osUpdateScanForTags(const std::vector<std::string>& tags, float percentComplete,
                           bool isFinished, const OptionalError& error) override {
    send("OsUpdateScanForTagsDidProgressWithPercentCompleteIsFinishedError", "asdba{sv}",
         {PlistArray(tags.begin(), tags.end()), static_cast<double>(percentComplete), isFinished,
          error ? error->toDictionary() : PlistDictionary{}});
  }
  [[nodiscard]] bool isSameObserverAs(const VendOSUpdateScanObserver& other) const override {
    return isSameObjectAs(dynamic_cast<const DBusOSUpdateScanObserver*>(&other));
  }
};

class DBusOSUpdateProgressObserver final : public VendOSUpdateProgressObserver,
                                           DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void osUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& osUpdates,
                                const LedgerSoftwareUpdateStatus& progress) override {
    send("OsUpdatesChangedProgress", "aa{sv}a{sv}", {wireForms(osUpdates), progress.toDictionary()});
  }
  [[nodiscard]] bool isSameObserverAs(const VendOSUpdateProgressObserver& other) const override {
    return isSameObjectAs(dynamic_cast<const DBusOSUpdateProgressObserver*>(&other));
  }
};

}  // namespace

class ServiceListener::RemoteObjects final : public RemoteObjectFactory {
 public:
  explicit RemoteObjects(sdbus::IConnection& connection) : connection_(connection) {}

  std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(
      const std::string& peer, const std::string& objectPath) override {
    return std::make_shared<DBusSoftwareMapObserver>(connection_, peer, objectPath,
                                                     "VendSoftwareMapObserver");
  }
  std::shared_ptr<VendAvailableUpdatesObserver> availableUpdatesObserver(
      const std::string& peer, const std::string& objectPath) override {
    return std::make_shared<DBusAvailableUpdatesObserver>(connection_, peer, objectPath,
                                                          "VendAvailableUpdatesObserver");
  }
  std::shared_ptr<VendOSUpdateScanObserver> osUpdateScanObserver(
      const std::string& peer, const std::string& objectPath) override {
    return std::make_shared<DBusOSUpdateScanObserver>(connection_, peer, objectPath,
                                                      "VendOSUpdateScanObserver");
  }
  std::shared_ptr<VendOSUpdateProgressObserver> osUpdateProgressObserver(
      const std::string& peer, const std::string& objectPath) override {
    return std::make_shared<DBusOSUpdateProgressObserver>(connection_, peer, objectPath,
                                                          "VendOSUpdateProgressObserver");
  }

 private:
  sdbus::IConnection& connection_;
};

ServiceListener::ServiceListener(std::string serviceName, SoftwareMap& softwareMap)
    : serviceName_(std::move(serviceName)), softwareMap_(softwareMap) {}

ServiceListener::~ServiceListener() {
  LedgerDistributedNotificationCenter::defaultCenter().setPoster(nullptr);
  if (storeRuntime_) storeRuntime_->withdraw();
  if (connection_) connection_->leaveEventLoop();
}

void ServiceListener::setDelegate(std::shared_ptr<AssetServiceDelegate> delegate) {
  delegate_ = std::move(delegate);
}

void ServiceListener::setDialogAgentRegistry(std::shared_ptr<DialogAgentRegistry> registry) {
  dialogAgents_ = std::move(registry);
}

void ServiceListener::setStoreRuntimeInterface(
    std::shared_ptr<StoreRuntimeInterface> storeRuntime) {
  storeRuntime_ = std::move(storeRuntime);
}

void ServiceListener::resume() {
  connection_ = connectToBus();
  remoteObjects_ = std::make_shared<RemoteObjects>(*connection_);
  object_ = sdbus::createObject(*connection_, std::string(ServiceRequests::kObjectPath));
  for (const RequestDescriptor& request : RequestTable::requests()) {
    object_->registerMethod(
        std::string(ServiceRequests::kInterfaceName), std::string(request.member),
        std::string(request.inSignature), std::string(request.outSignature),
        [this, &request](sdbus::MethodCall call) { dispatch(request, std::move(call)); });
  }
  if (dialogAgents_) dialogAgents_->exportOn(*object_, *connection_);
  if (storeRuntime_) storeRuntime_->exportOn(*object_);
  object_->registerSignal(std::string(DistributedNotificationProtocol::kInterfaceName),
                          std::string(DistributedNotificationProtocol::kSignal),
                          std::string(DistributedNotificationProtocol::kSignature));
  object_->finishRegistration();
  LedgerDistributedNotificationCenter::defaultCenter().setPoster(
      [this](const std::string& name, const std::string& object, const PlistDictionary& userInfo) {
        emitDistributedNotification(name, object, userInfo);
      });
  connection_->addMatch(
      "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
      "member='NameOwnerChanged',path='/org/freedesktop/DBus'",
      [this](sdbus::Message& signal) { peerDidChangeOwner(signal); }, sdbus::floating_slot);
  // The name is taken last, so that no client can reach the service before
  // every request is in place.
  connection_->requestName(serviceName_);
  connection_->enterEventLoopAsync();
}

void ServiceListener::emitDistributedNotification(const std::string& name,
                                                  const std::string& object,
                                                  const PlistDictionary& userInfo) {
  try {
    sdbus::Signal signal =
        object_->createSignal(std::string(DistributedNotificationProtocol::kInterfaceName),
                              std::string(DistributedNotificationProtocol::kSignal));
    DBusValueCodec::writeAll(signal, DistributedNotificationProtocol::kSignature,
                             {name, object, userInfo});
    object_->emitSignal(signal);
  } catch (const sdbus::Error& error) {
    TILL_LOG(2, "%@: notification %@ %@ not sent: %@", kSpeaker, name, object, error.what());
  }
}

void ServiceListener::stopServing() {
  if (!connection_) return;
  LedgerDistributedNotificationCenter::defaultCenter().setPoster(nullptr);
  if (storeRuntime_) storeRuntime_->withdraw();
  answerPendingCallsStopping();
  try {
    connection_->releaseName(serviceName_);
  } catch (const sdbus::Error& error) {
    TILL_LOG(3, "%@: could not release %@: %@", kSpeaker, serviceName_, error.what());
  }
  connection_->leaveEventLoop();
}

std::size_t ServiceListener::connectionCount() const {
  MutexLock lock(peersMutex_);
  return peers_.size();
}

std::shared_ptr<AssetServiceInterface> ServiceListener::interfaceForPeer(const std::string& peer) {
  MutexLock lock(peersMutex_);
  auto found = peers_.find(peer);
  if (found != peers_.end()) return found->second;
  auto interface = AssetServiceDelegate::clientInterface(peer, softwareMap_, remoteObjects_);
  peers_.emplace(peer, interface);
  TILL_LOG(3, "%@: accepted connection from %@", kSpeaker, peer);
  return interface;
}

void ServiceListener::peerDidChangeOwner(sdbus::Message& signal) {
  std::string name;
  std::string oldOwner;
  std::string newOwner;
  signal >> name >> oldOwner >> newOwner;
  if (!newOwner.empty()) return;
  if (dialogAgents_) dialogAgents_->peerDidLeave(name);
  MutexLock lock(peersMutex_);
  // Work the peer left queued still runs: its items hold the object.
  if (peers_.erase(name) > 0) TILL_LOG(3, "%@: connection from %@ ended", kSpeaker, name);
}

void ServiceListener::dispatch(const RequestDescriptor& request, sdbus::MethodCall call) {
  auto pending = std::make_shared<PendingCall>(std::move(call), request.member);
  PlistArray arguments;
  try {
    arguments = pending->readArguments(request.inSignature);
  } catch (const sdbus::Error& error) {
    pending->fail(error);
    return;
  }
  // Only now may a stop answer the call from another thread.
  if (!track(pending)) {
    pending->fail(ServiceError::stopping(request.member));
    return;
  }
  std::shared_ptr<AssetServiceInterface> interface = interfaceForPeer(pending->sender());
  ReplyHandler reply;
  if (pending->expectsReply()) {
    reply = [pending, signature = request.outSignature](const PlistArray& outArguments) {
      pending->reply(signature, outArguments);
    };
  }
  auto work = [&request, interface, arguments = std::move(arguments), reply, pending] {
    try {
      RequestTable::perform(request, *interface, arguments, reply);
      if (request.outSignature.empty() && reply) reply({});
    } catch (const ServiceError& error) {
      TILL_LOG(2, "%@: %@ refused: %@", kSpeaker, request.selector, error.getMessage());
      pending->fail(error);
    } catch (const std::exception& exception) {
      TILL_LOG(1, "%@: %@ failed: %@", kSpeaker, request.selector, exception.what());
      pending->fail(ServiceError::failed(exception.what()));
    }
  };
  if (request.direct) {
    work();
  } else {
    interface->requestQueue()->async(std::move(work));
  }
}

bool ServiceListener::track(const std::shared_ptr<PendingCall>& call) {
  MutexLock lock(pendingMutex_);
  if (stopping_) return false;
  if (!call->expectsReply()) return true;
  std::erase_if(pending_, [](const std::weak_ptr<PendingCall>& entry) {
    auto open = entry.lock();
    return !open || open->isAnswered();
  });
  pending_.push_back(call);
  return true;
}

void ServiceListener::answerPendingCallsStopping() {
  std::vector<std::weak_ptr<PendingCall>> open;
  {
    MutexLock lock(pendingMutex_);
    stopping_ = true;
    open.swap(pending_);
  }
  std::size_t answered = 0;
  for (const auto& entry : open) {
    auto call = entry.lock();
    if (call && call->fail(ServiceError::stopping(call->member()))) ++answered;
  }
  if (answered > 0) TILL_LOG(2, "%@: %@ open requests answered as stopping", kSpeaker, answered);
}

}  // namespace larder
