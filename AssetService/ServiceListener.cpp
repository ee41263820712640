#include "AssetService/ServiceListener.h"

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>

#include "AssetService/DBusRemoteObjectFactory.h"
#include "AssetService/DialogAgentRegistry.h"
#include "AssetService/NotificationsInterface.h"
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

}  // namespace

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

void ServiceListener::setNotificationsInterface(
    std::shared_ptr<NotificationsInterface> notifications) {
  notifications_ = std::move(notifications);
}

void ServiceListener::resume() {
  connection_ = connectToBus();
  remoteObjects_ = std::make_shared<DBusRemoteObjectFactory>(*connection_);
  object_ = sdbus::createObject(*connection_, std::string(ServiceRequests::kObjectPath));
  for (const RequestDescriptor& request : RequestTable::requests()) {
    object_->registerMethod(
        std::string(ServiceRequests::kInterfaceName), std::string(request.member),
        std::string(request.inSignature), std::string(request.outSignature),
        [this, &request](sdbus::MethodCall call) { dispatch(request, std::move(call)); });
  }
  if (dialogAgents_) dialogAgents_->exportOn(*object_, *connection_);
  if (storeRuntime_) storeRuntime_->exportOn(*object_);
  if (notifications_) notifications_->exportOn(*object_);
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
