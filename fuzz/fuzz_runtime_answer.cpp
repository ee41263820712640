// A store's answer as the runtime reads it: bytes to property list, then
// every record made from what stores send (purchase answers, downloads,
// update items, purchases as the reference store reads them).
#include <cstddef>
#include <cstdint>
#include <span>

#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/records/TillPurchaseResponse.h"

namespace {

void readItems(const larder::PlistValue& items) {
  const larder::PlistArray* entries = items.array();
  if (!entries) return;
  for (const larder::PlistValue& entry : *entries) {
    if (const larder::PlistDictionary* item = entry.dictionary()) {
      if (auto update = larder::LedgerUpdate::initWithDictionary(*item)) (void)update->dictionary();
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  larder::OptionalError error;
  auto answer = larder::VendStoreAnswer::dictionary(std::span(data, size), &error);
  if (!answer) return 0;
  if (auto response = larder::TillPurchaseResponse::fromDictionary(*answer)) {
    for (const auto& download : response->downloads()) (void)download->toDictionary();
  }
  if (auto download = larder::TillDownload::fromDictionary(*answer)) (void)download->toDictionary();
  if (auto purchase = larder::TillPurchase::fromDictionary(*answer)) (void)purchase->toDictionary();
  const larder::PlistValue wrapped(*answer);
  readItems(wrapped["items"]);
  readItems(wrapped["incompatible-items"]);
  return 0;
}
