#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/AssetServiceDelegate.h"
#include "AssetService/AssetServiceInterface.h"
#include "AssetService/PendingCall.h"
#include "AssetService/RequestTable.h"
#include "platform/system/Mutex.h"

namespace larder {

class DialogAgentRegistry;
class NotificationsInterface;
class StoreRuntimeInterface;
class SoftwareMap;

// The service on the bus: owns the bus name, exports the request table on
// the service object and routes each call to the object of its peer. A
// peer (unique bus name) is one client connection; its object ends when
// the peer leaves the bus, and nothing else does.
class ServiceListener {
 public:
  ServiceListener(std::string serviceName, SoftwareMap& softwareMap);
  ~ServiceListener();
  ServiceListener(const ServiceListener&) = delete;
  ServiceListener& operator=(const ServiceListener&) = delete;

  void setDelegate(std::shared_ptr<AssetServiceDelegate> delegate);
  // Exported beside the request table on the service object; told of every
  // peer that leaves the bus.
  void setDialogAgentRegistry(std::shared_ptr<DialogAgentRegistry> registry);
  // Exported beside the request table on the service object.
  void setStoreRuntimeInterface(std::shared_ptr<StoreRuntimeInterface> storeRuntime);
  void setNotificationsInterface(std::shared_ptr<NotificationsInterface> notifications);
  // Connects, exports the object, takes the name and starts delivering
  // requests on the bus thread. Throws sdbus::Error when the bus refuses.
  void resume();
  // Answers every call still open with the Stopping error, gives up the
  // name and stops reading the bus: no request is taken after it.
  void stopServing();

  [[nodiscard]] std::size_t connectionCount() const;

 private:
  void dispatch(const RequestDescriptor& request, sdbus::MethodCall call);
  std::shared_ptr<AssetServiceInterface> interfaceForPeer(const std::string& peer);
  void peerDidChangeOwner(sdbus::Message& signal);
  // The badge and other session-wide notifications, as a signal of the
  // service object.
  void emitDistributedNotification(const std::string& name, const std::string& object,
                                   const PlistDictionary& userInfo);
  // Keeps a call that wants a reply until it is answered; false once the
  // service is stopping.
  bool track(const std::shared_ptr<PendingCall>& call) EXCLUDES(pendingMutex_);
  void answerPendingCallsStopping() EXCLUDES(pendingMutex_);

  std::string serviceName_;
  SoftwareMap& softwareMap_;
  std::shared_ptr<AssetServiceDelegate> delegate_;
  std::shared_ptr<DialogAgentRegistry> dialogAgents_;
  std::shared_ptr<StoreRuntimeInterface> storeRuntime_;
  std::shared_ptr<NotificationsInterface> notifications_;
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  std::shared_ptr<RemoteObjectFactory> remoteObjects_;

  mutable Mutex peersMutex_;
  std::map<std::string, std::shared_ptr<AssetServiceInterface>, std::less<>> peers_
      GUARDED_BY(peersMutex_);

  Mutex pendingMutex_;
  std::vector<std::weak_ptr<PendingCall>> pending_ GUARDED_BY(pendingMutex_);
  bool stopping_ GUARDED_BY(pendingMutex_) = false;
};

}  // namespace larder
