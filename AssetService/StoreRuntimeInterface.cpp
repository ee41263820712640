#include "AssetService/StoreRuntimeInterface.h"

#include <map>
#include <string>
#include <vector>

#include <sdbus-c++/Error.h>

#include "client/DBusValueCodec.h"
#include "client/StoreRuntimeProtocol.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "store-runtime/services/VendTransactionService.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "StoreRuntimeInterface";

VendServiceProxy toolProxy() {
  return VendServiceProxy(
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication));
}

PlistDictionary errorDictionary(const OptionalError& error) {
  return error ? error->toDictionary() : PlistDictionary{};
}

void reply(sdbus::MethodCall& call, std::string_view signature, const PlistArray& values) {
  try {
    DBusValueCodec::reply(call, signature, values);
  } catch (const sdbus::Error& error) {
    TILL_LOG(2, "%@: Answer to %@ not delivered: %@", kSpeaker, call.getSender(),
             error.getMessage());
  }
}

PlistArray downloadList(const std::vector<std::shared_ptr<TillDownload>>& downloads) {
  PlistArray list;
  for (const auto& download : downloads) list.emplace_back(download->toDictionary());
  return list;
}

}  // namespace

void StoreRuntimeInterface::exportOn(sdbus::IObject& object) {
  exportBusMethods<StoreRuntimeInterface>(
      object, StoreRuntimeProtocol::kInterfaceName, StoreRuntimeProtocol::methods(),
      {{"SignIn", &StoreRuntimeInterface::signIn},
       {"SignOut", &StoreRuntimeInterface::signOut},
       {"PrimaryAccount", &StoreRuntimeInterface::primaryAccount},
       {"Purchase", &StoreRuntimeInterface::purchase},
       {"Downloads", &StoreRuntimeInterface::downloads}},
      shared_from_this());
  object.registerSignal(std::string(StoreRuntimeProtocol::kInterfaceName),
                        std::string(StoreRuntimeProtocol::kDownloadEndedSignal),
                        std::string(StoreRuntimeProtocol::kDownloadEndedSignature));
  MutexLock lock(objectMutex_);
  object_ = &object;
}

void StoreRuntimeInterface::withdraw() {
  MutexLock lock(objectMutex_);
  object_ = nullptr;
}

void StoreRuntimeInterface::signIn(sdbus::MethodCall call) {
  const PlistArray arguments = DBusValueCodec::readAll(call, "ss");
  toolProxy().accountService()->signIn(
      *arguments[0].string(), *arguments[1].string(),
      [call](bool success, std::uint64_t accountID, const OptionalError& error) mutable {
        reply(call, "bta{sv}", {success, accountID, errorDictionary(error)});
      });
}

void StoreRuntimeInterface::signOut(sdbus::MethodCall call) {
  toolProxy().accountService()->signOut();
  reply(call, "", {});
}

void StoreRuntimeInterface::primaryAccount(sdbus::MethodCall call) {
  toolProxy().accountService()->primaryAccount([call](std::optional<VendAccount> account) mutable {
    reply(call, "a{sv}", {account ? account->toDictionary() : PlistDictionary{}});
  });
}

void StoreRuntimeInterface::purchase(sdbus::MethodCall call) {
  const PlistArray arguments = DBusValueCodec::readAll(call, "ts");
  TillPurchase purchase = TillPurchase::purchaseWithBuyParameters(*arguments[1].string());
  purchase.setItemIdentifier(arguments[0].uint64Value());
  purchase.setPurchaseType(2);  // started by the user
  // The downloads are started here rather than by the purchase, so that the
  // client hears how each one ended instead of guessing from the disk.
  toolProxy().transactionService()->performPurchase(
      std::move(purchase), {}, VendTransactionService::kLeaveDownloadsToCaller,
      [self = shared_from_this(), call](const std::optional<TillPurchaseResponse>& response,
                                        bool success, const OptionalError& error) mutable {
        if (response) self->startDownloads(response->downloads());
        reply(call, "ba{sv}aa{sv}",
              {success, errorDictionary(error),
               response ? downloadList(response->downloads()) : PlistArray{}});
      });
}

void StoreRuntimeInterface::startDownloads(
    const std::vector<std::shared_ptr<TillDownload>>& downloads) {
  const std::shared_ptr<VendDownloadService> service = toolProxy().downloadService();
  for (const auto& download : downloads) {
    download->setDownloadType(TillDownload::kInstall);
    service->performDownload(
        download, 0,
        [self = shared_from_this(), download](std::int64_t result, const OptionalError& error) {
          self->announceDownloadEnded(*download, result == 1, error);
        });
  }
}

void StoreRuntimeInterface::announceDownloadEnded(const TillDownload& download, bool success,
                                                  const OptionalError& error) {
  TILL_LOG(2, "%@: Download of %@ ended: %@", kSpeaker, download.description(),
           error ? error->descriptionText() : std::string(success ? "installed" : "failed"));
  MutexLock lock(objectMutex_);
  if (!object_) return;
  try {
    sdbus::Signal signal =
        object_->createSignal(std::string(StoreRuntimeProtocol::kInterfaceName),
                              std::string(StoreRuntimeProtocol::kDownloadEndedSignal));
    DBusValueCodec::writeAll(signal, StoreRuntimeProtocol::kDownloadEndedSignature,
                             {download.toDictionary(), success, errorDictionary(error)});
    object_->emitSignal(signal);
  } catch (const sdbus::Error& failure) {
    TILL_LOG(2, "%@: The end of %@ not announced: %@", kSpeaker, download.description(),
             failure.getMessage());
  }
}

void StoreRuntimeInterface::downloads(sdbus::MethodCall call) {
  const std::int64_t mask = DBusValueCodec::read(call, "x").int64Value();
  toolProxy().downloadService()->downloadsWithTypeMask(
      mask, [call](const std::vector<std::shared_ptr<TillDownload>>& downloads) mutable {
        // Spelled out: a braced list of one array would be the array itself.
        reply(call, "aa{sv}", PlistArray{PlistValue(downloadList(downloads))});
      });
}

}  // namespace larder
