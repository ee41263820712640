#include "store-runtime/services/VendPropertyListProvider.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {
namespace {
constexpr std::string_view kSpeaker = "VendPropertyListProvider";
}

bool VendPropertyListProvider::parseData(const PlistData& data, OptionalError* error) {
  auto answer = VendStoreAnswer::propertyList(data, error);
  if (!answer) return false;
  if (shouldProcessProtocol_ && !processProtocol(*answer, error)) return false;
  if (shouldProcessDialogs_) processDialog(*answer);
  if (shouldProcessDownloads_) processDownloads(*answer);
  setOutput(std::move(*answer));
  return true;
}

bool VendPropertyListProvider::processProtocol(const PlistValue& answer,
                                               OptionalError* error) const {
  const std::string* failureType = answer["failureType"].string();
  if (!failureType) return true;
  const std::string* message = answer["customerMessage"].string();
  VendError failure =
      VendStoreAnswer::error(response().statusCode > 0 ? response().statusCode : 0,
                             message ? *message : "The store refused: " + *failureType);
  failure.userInfo["failureType"] = *failureType;
  if (error) *error = std::move(failure);
  return false;
}

void VendPropertyListProvider::processDialog(const PlistValue& answer) const {
  const PlistDictionary* dialog = answer["dialog"].dictionary();
  if (!dialog) return;
  TILL_LOG(2, "%@: Showing the store's dialog %@", kSpeaker, answer["dialog"]);
  // The store's dialogs inform; nothing here depends on the button chosen.
  VendUIService(storeClient(), VendRuntime::shared())
      .displayDialog(VendDialog::dialogWithDictionary(*dialog), nullptr, [](std::int64_t) {});
}

void VendPropertyListProvider::processDownloads(const PlistValue& answer) {
  const PlistArray* entries = answer["downloads"].array();
  if (!entries) return;
  for (const PlistValue& entry : *entries) {
    const PlistDictionary* dictionary = entry.dictionary();
    auto download = dictionary ? TillDownload::fromDictionary(*dictionary) : nullptr;
    if (!download) {
      TILL_LOG(1, "%@: Skipping a malformed download of the store's answer", kSpeaker);
      continue;
    }
    downloads_.push_back(download);
    if (!shouldTriggerDownloads_) continue;
    download->setDownloadType(TillDownload::kInstall);
    VendDownloadService(storeClient(), VendRuntime::shared())
        .performDownload(download, 0,
                         [download](std::int64_t result, const OptionalError& failure) {
                           TILL_LOG(2, "%@: Download of %@ ended with result %@, error %@",
                                    kSpeaker, download->metadata().title(), result,
                                    failure ? failure->descriptionText() : "none");
                         });
  }
}

void VendPropertyListProvider::configureFromProvider(const VendDataProvider& other) {
  if (const auto* settings = dynamic_cast<const VendPropertyListProvider*>(&other)) {
    shouldProcessProtocol_ = settings->shouldProcessProtocol_;
    shouldProcessDialogs_ = settings->shouldProcessDialogs_;
    shouldProcessDownloads_ = settings->shouldProcessDownloads_;
    shouldTriggerDownloads_ = settings->shouldTriggerDownloads_;
  }
}

void VendPropertyListProvider::migrateOutputFromSubProvider(const VendDataProvider& subProvider) {
  VendDataProvider::migrateOutputFromSubProvider(subProvider);
  if (const auto* sub = dynamic_cast<const VendPropertyListProvider*>(&subProvider)) {
    downloads_.insert(downloads_.end(), sub->downloads_.begin(), sub->downloads_.end());
  }
}

}  // namespace larder
