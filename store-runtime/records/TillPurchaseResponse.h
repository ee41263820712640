#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/TillDownload.h"

namespace larder {

// The store's answer to a purchase: the downloads that bring the software.
// Copies share the download records, which is what a caller that hands
// them on to the download layer wants.
class TillPurchaseResponse {
 public:
  static constexpr std::string_view kClassName = "TillPurchaseResponse";

  TillPurchaseResponse() = default;
  explicit TillPurchaseResponse(std::vector<std::shared_ptr<TillDownload>> downloads)
      : downloads_(std::move(downloads)) {}

  [[nodiscard]] const std::vector<std::shared_ptr<TillDownload>>& downloads() const {
    return downloads_;
  }
  void setDownloads(std::vector<std::shared_ptr<TillDownload>> downloads) {
    downloads_ = std::move(downloads);
  }

  // Keyed-archive form: "$class" and "downloads", an array of download
  // records. nullopt when a class is not ours or a download is refused.
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  static std::optional<TillPurchaseResponse> initWithCoder(const PlistValue& encoded);

  // Wire form, the store's answer: { "downloads": [download...] }. Reading
  // keeps every well-formed download and drops the others, so that one bad
  // entry of a bulk purchase does not lose the rest; `droppedDownloads`
  // says how many went. nullopt when "downloads" is missing or not an
  // array: that is not a purchase answer at all.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<TillPurchaseResponse> fromDictionary(
      const PlistDictionary& dictionary, std::size_t* droppedDownloads = nullptr);

  [[nodiscard]] std::string description() const;

 private:
  std::vector<std::shared_ptr<TillDownload>> downloads_;
};

}  // namespace larder
