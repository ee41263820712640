#include "update-queue/LoadUpdateQueueOperation.h"

#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/services/VendStoreURLOperation.h"
#include "update-queue/SoftwareUpdatesProvider.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "LoadUpdateQueueOperation";
// The bag of the store that sells software.
constexpr std::int64_t kSoftwareStoreBagType = 1;

}  // namespace

LoadUpdateQueueOperation::LoadUpdateQueueOperation(VendStoreClient storeClient,
                                                   SoftwareMap& softwareMap)
    : VendOperation(std::move(storeClient)), softwareMap_(softwareMap) {
  setRequiredBagType(kSoftwareStoreBagType);
}

bool LoadUpdateQueueOperation::wantsCompressedBody() {
  // Only a number counts: a store that sends "true" as text gets plain bodies.
  PlistValue value = valueForURLBagKey(kCompressRequestBagKey);
  return value.isNumber() && value.boolValue();
}

std::vector<std::string> LoadUpdateQueueOperation::doNotUpdateList() {
  PlistValue value = valueForURLBagKey(kDoNotUpdateListBagKey);
  std::vector<std::string> skipList;
  if (const PlistArray* entries = value.array()) {
    for (const PlistValue& entry : *entries) {
      if (const std::string* text = entry.string()) skipList.push_back(*text);
    }
  }
  return skipList;
}

void LoadUpdateQueueOperation::run() {
  const bool compress = wantsCompressedBody();
  const std::vector<std::string> skipList = doNotUpdateList();
  bool compressed = false;
  std::optional<PlistData> body = softwareMap_.updateRequestBodyData(
      &compressed, true, false, false, nullptr, compress, skipList);
  if (!body) {
    TILL_LOG(2, "%@: No apps, so no update queue check", kSpeaker);
    setSuccess(true);
    return;
  }
  fetchUpdates(std::move(*body), compressed);
}

void LoadUpdateQueueOperation::fetchUpdates(PlistData body, bool compressed) {
  auto storeOperation = std::make_shared<VendStoreURLOperation>(storeClient());
  storeOperation->setDataProvider(SoftwareUpdatesProvider::providerWithStoreClient(storeClient()));
  // The inner operation ends before this one does, so the delegate it
  // holds can share this operation's lifetime.
  storeOperation->setDelegate(std::shared_ptr<VendOperationDelegate>(
      shared_from_this(), static_cast<VendStoreURLOperationDelegate*>(this)));
  storeOperation->setUrlBagKey(std::string(kUpdatesURLBagKey));

  VendURLRequest request;
  request.setBody(std::move(body));
  request.setCachePolicy(VendURLRequest::kReloadIgnoringLocalCacheData);
  request.setMethod("POST");
  // The headers follow what the body is, not what was asked for: the
  // writer falls back to a plain body when compressing fails.
  if (compressed) {
    request.setValue("gzip", "Content-Encoding");
    request.setValue("application/x-orvane-plist", "Content-Type");
  }
  storeOperation->setRequest(std::move(request));

  TILL_LOG(2, "%@: Fetching update queue", kSpeaker);
  OptionalError error;
  if (!runSubOperation(*storeOperation, &error)) setError(std::move(error));
  storeOperation->setDelegate(nullptr);
}

void LoadUpdateQueueOperation::operationFinishedWithOutput(VendOperation& /*operation*/,
                                                           const PlistValue& output) {
  if (!output.isDictionary()) return;
  availableUpdates_ = SoftwareUpdatesProvider::updatesFromOutput(
      output, SoftwareUpdatesProvider::kAvailableUpdatesKey);
  incompatibleUpdates_ = SoftwareUpdatesProvider::updatesFromOutput(
      output, SoftwareUpdatesProvider::kIncompatibleUpdatesKey);
  setSuccess(true);
}

}  // namespace larder
