#include "store-runtime/records/TillPurchaseResponse.h"

#include "platform/plist/KeyedArchive.h"

namespace larder {

PlistDictionary TillPurchaseResponse::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  PlistArray downloads;
  downloads.reserve(downloads_.size());
  for (const auto& download : downloads_) {
    if (download) downloads.emplace_back(download->encodeWithCoder());
  }
  encoded.emplace("downloads", std::move(downloads));
  return encoded;
}

std::optional<TillPurchaseResponse> TillPurchaseResponse::initWithCoder(const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return std::nullopt;
  const PlistValue& stored = encoded["downloads"];
  if (stored.isNull()) return TillPurchaseResponse();
  const PlistArray* items = stored.array();
  if (!items) return std::nullopt;
  std::vector<std::shared_ptr<TillDownload>> downloads;
  for (const PlistValue& item : *items) {
    std::shared_ptr<TillDownload> download = TillDownload::initWithCoder(item);
    if (!download) return std::nullopt;
    downloads.push_back(std::move(download));
  }
  return TillPurchaseResponse(std::move(downloads));
}

PlistDictionary TillPurchaseResponse::toDictionary() const {
  PlistArray downloads;
  downloads.reserve(downloads_.size());
  for (const auto& download : downloads_) {
    if (download) downloads.emplace_back(download->toDictionary());
  }
  return PlistDictionary{{"downloads", std::move(downloads)}};
}

std::optional<TillPurchaseResponse> TillPurchaseResponse::fromDictionary(
    const PlistDictionary& dictionary, std::size_t* droppedDownloads) {
  const auto found = dictionary.find("downloads");
  const PlistArray* items = found == dictionary.end() ? nullptr : found->second.array();
  if (!items) return std::nullopt;
  std::size_t dropped = 0;
  std::vector<std::shared_ptr<TillDownload>> downloads;
  for (const PlistValue& item : *items) {
    const PlistDictionary* entry = item.dictionary();
    std::shared_ptr<TillDownload> download = entry ? TillDownload::fromDictionary(*entry) : nullptr;
    if (download) {
      downloads.push_back(std::move(download));
    } else {
      ++dropped;
    }
  }
  if (droppedDownloads) *droppedDownloads = dropped;
  return TillPurchaseResponse(std::move(downloads));
}

std::string TillPurchaseResponse::description() const {
  std::string text = "<TillPurchaseResponse: downloads=(";
  for (std::size_t i = 0; i < downloads_.size(); ++i) {
    if (i > 0) text += ", ";
    text += downloads_[i] ? downloads_[i]->description() : "(null)";
  }
  return text + ")>";
}

}  // namespace larder
