#include "AssetService/DBusRemoteObjectFactory.h"

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>

#include <vector>

#include "client/DBusValueCodec.h"
#include "client/ServiceRequests.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "DBusRemoteObjectFactory";

// An object that lives in a client. Calls are queued and sent in order on
// the factory's send queue, without waiting for an answer: the service's
// thread that tells of a change returns at once, a slow or vanished client
// holds up nobody, and a client that has gone simply never receives them.
class DBusCallbackObject {
 public:
  DBusCallbackObject(sdbus::IConnection& connection, std::shared_ptr<DispatchQueue> sendQueue,
                     std::string peer, std::string objectPath, std::string_view protocol)
      : target_(makeTarget(connection, std::move(peer), std::move(objectPath), protocol)),
        sendQueue_(std::move(sendQueue)) {}

  void send(std::string_view member, std::string_view signature, PlistArray values) const {
    auto owned = std::make_shared<const PlistArray>(std::move(values));
    std::vector<const PlistValue*> pointers;
    for (const PlistValue& value : *owned) pointers.push_back(&value);
    sendInPlace(member, signature, std::move(pointers), owned);
  }

  // The values are written where they stand, kept alive by `keepAlive`
  // until sent: a change told to a hundred observers is not copied a
  // hundred times.
  void sendInPlace(std::string_view member, std::string_view signature,
                   std::vector<const PlistValue*> values,
                   std::shared_ptr<const void> keepAlive) const {
    sendQueue_->async(
        [target = target_, member = std::string(member), signature = std::string(signature),
         values = std::move(values),
         keepAlive = std::move(keepAlive)] { target->call(member, signature, values); });
  }

  [[nodiscard]] bool isSameObjectAs(const DBusCallbackObject* other) const {
    return other && other->target_->peer == target_->peer &&
           other->target_->objectPath == target_->objectPath;
  }

 private:
  struct Target {
    std::string peer;
    std::string objectPath;
    std::string interfaceName;
    std::unique_ptr<sdbus::IProxy> proxy;

    void call(const std::string& member, const std::string& signature,
              const std::vector<const PlistValue*>& values) const {
      try {
        sdbus::MethodCall call = proxy->createMethodCall(interfaceName, member);
        std::size_t index = 0;
        for (const std::string& type : DBusValueCodec::splitSignature(signature)) {
          DBusValueCodec::write(call, type,
                                index < values.size() ? *values[index] : PlistValue::null());
          ++index;
        }
        call.dontExpectReply();
        proxy->callMethod(call);
      } catch (const sdbus::Error& error) {
        TILL_LOG(3, "%@: call to %@ %@ dropped: %@", kSpeaker, peer, objectPath, error.what());
      }
    }
  };

  static std::shared_ptr<const Target> makeTarget(sdbus::IConnection& connection, std::string peer,
                                                  std::string objectPath,
                                                  std::string_view protocol) {
    auto target = std::make_shared<Target>();
    target->proxy = sdbus::createProxy(connection, peer, objectPath);
    target->peer = std::move(peer);
    target->objectPath = std::move(objectPath);
    target->interfaceName =
        std::string(ServiceRequests::kCallbackInterfacePrefix) + std::string(protocol);
    return target;
  }

  std::shared_ptr<const Target> target_;
  std::shared_ptr<DispatchQueue> sendQueue_;
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

class DBusAvailableUpdatesObserver final : public VendAvailableUpdatesObserver, DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void availableUpdatesDidChangedWithUpdates(
      const std::shared_ptr<const AvailableUpdatesChange>& change) override {
    sendInPlace("AvailableUpdatesDidChangedWithUpdatesOsUpdatesBadgeCount", "aa{sv}aa{sv}t",
                {&change->wireUpdates(), &change->wireOSUpdates(), &change->wireBadgeCount()},
                change);
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

class DBusOSUpdateProgressObserver final : public VendOSUpdateProgressObserver, DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void osUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& osUpdates,
                                const LedgerSoftwareUpdateStatus& progress) override {
    send("OsUpdatesChangedProgress", "aa{sv}a{sv}",
         {wireForms(osUpdates), progress.toDictionary()});
  }
  [[nodiscard]] bool isSameObserverAs(const VendOSUpdateProgressObserver& other) const override {
    return isSameObjectAs(dynamic_cast<const DBusOSUpdateProgressObserver*>(&other));
  }
};

class DBusUpdateDelegate final : public VendUpdateDelegate, DBusCallbackObject {
 public:
  using DBusCallbackObject::DBusCallbackObject;
  void appUpdateFinishedPurchase(const LedgerUpdateRef& update, bool success,
                                 const OptionalError& error,
                                 const std::optional<TillPurchaseResponse>& response) override {
    send("AppUpdateFinishedPurchaseWithSuccessErrorResponse", "a{sv}ba{sv}a{sv}",
         {update ? update->toDictionary() : PlistDictionary{}, success,
          error ? error->toDictionary() : PlistDictionary{},
          response ? response->toDictionary() : PlistDictionary{}});
  }
};

}  // namespace

DBusRemoteObjectFactory::DBusRemoteObjectFactory(sdbus::IConnection& connection)
    : connection_(connection),
      sendQueue_(DispatchQueue::create("DBusRemoteObjectFactory send queue",
                                       DispatchQueue::Kind::Serial)) {}

// The calls queued so far go out while the connection is still there.
DBusRemoteObjectFactory::~DBusRemoteObjectFactory() {
  sendQueue_->sync([] {});
}

std::shared_ptr<VendSoftwareMapObserver> DBusRemoteObjectFactory::softwareMapObserver(
    const std::string& peer, const std::string& objectPath) {
  return std::make_shared<DBusSoftwareMapObserver>(connection_, sendQueue_, peer, objectPath,
                                                   "VendSoftwareMapObserver");
}
std::shared_ptr<VendAvailableUpdatesObserver> DBusRemoteObjectFactory::availableUpdatesObserver(
    const std::string& peer, const std::string& objectPath) {
  return std::make_shared<DBusAvailableUpdatesObserver>(connection_, sendQueue_, peer, objectPath,
                                                        "VendAvailableUpdatesObserver");
}
std::shared_ptr<VendOSUpdateScanObserver> DBusRemoteObjectFactory::osUpdateScanObserver(
    const std::string& peer, const std::string& objectPath) {
  return std::make_shared<DBusOSUpdateScanObserver>(connection_, sendQueue_, peer, objectPath,
                                                    "VendOSUpdateScanObserver");
}
std::shared_ptr<VendOSUpdateProgressObserver> DBusRemoteObjectFactory::osUpdateProgressObserver(
    const std::string& peer, const std::string& objectPath) {
  return std::make_shared<DBusOSUpdateProgressObserver>(connection_, sendQueue_, peer, objectPath,
                                                        "VendOSUpdateProgressObserver");
}

std::shared_ptr<VendUpdateDelegate> DBusRemoteObjectFactory::updateDelegate(
    const std::string& peer, const std::string& objectPath) {
  return std::make_shared<DBusUpdateDelegate>(connection_, sendQueue_, peer, objectPath,
                                              "VendUpdateDelegate");
}

}  // namespace larder
