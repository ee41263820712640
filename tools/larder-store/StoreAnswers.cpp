#include "larder-store/StoreAnswers.h"

#include "store-runtime/core/VendStringHelpers.h"

namespace larder {
namespace {

constexpr std::int64_t kPackageAssetType = 10;

std::string joined(std::string_view baseURL, std::string_view path) {
  std::string url(baseURL);
  url += path;
  return url;
}

PlistArray hashArray(const std::vector<std::string>& hashes) {
  PlistArray array;
  array.reserve(hashes.size());
  for (const std::string& hash : hashes) array.emplace_back(hash);
  return array;
}

}  // namespace

PlistDictionary StoreAnswers::bag(std::string_view baseURL, const PlistDictionary& extras) {
  PlistDictionary bag{
      {"authenticate", joined(baseURL, kAuthenticatePath)},
      {"buy-product", joined(baseURL, kBuyProductPath)},
      {"item-lookup", joined(baseURL, kItemLookupPath)},
      {"ovp-licensing-invitation-url-pattern",
       "^" + regexEscaped(joined(baseURL, kInvitationsPrefix)) + ".+$"},
      {"available-software-updates-extended", joined(baseURL, kUpdateCheckPath)},
      {"available-software-updates-compress-request", true},
      {"da-do-not-update-list", PlistArray{}},
      {"orvane-id-lookup", joined(baseURL, kOrvaneIDLookupPath)},
  };
  for (const auto& [key, value] : extras) {
    const std::string* text = value.string();
    bag[key] = text && text->starts_with('/') ? PlistValue(joined(baseURL, *text)) : value;
  }
  return bag;
}

std::string StoreAnswers::assetURL(std::string_view baseURL, const StoreItem& item,
                                   std::string_view fileName) {
  // One path segment: the same unreserved characters stay as a query
  // component keeps them.
  return joined(baseURL, kAssetsPrefix) + std::to_string(item.wareID) + "/" +
         percentEncodedQueryComponent(fileName);
}

PlistDictionary StoreAnswers::download(const StoreItem& item, std::string_view baseURL) {
  PlistDictionary metadata{
      {"itemIdentifier", item.wareID},
      {"bundleIdentifier", item.bundleID},
      {"bundleVersion", item.version},
      {"title", item.title},
  };
  if (item.thumbnailName) {
    metadata.emplace("thumbnailImageURL", assetURL(baseURL, item, *item.thumbnailName));
  }
  if (item.preflight) {
    metadata.emplace("preflightPackageURL",
                     joined(baseURL, kPreflightPrefix) + std::to_string(item.wareID));
  }
  PlistDictionary asset{
      {"type", kPackageAssetType},
      {"URL", assetURL(baseURL, item, item.packageName)},
      {"fileSize", item.digest.fileSize},
      {"numberOfBytesToHash", item.digest.chunkSize},
      {"hashes", hashArray(item.digest.hashes)},
  };
  return {{"metadata", std::move(metadata)}, {"assets", PlistArray{std::move(asset)}}};
}

PlistDictionary StoreAnswers::lookupResult(const StoreItem& item) {
  return {
      {"id", item.wareID},
      {"bundleId", item.bundleID},
      {"title", item.title},
      {"version", item.version},
      {"offers",
       PlistArray{PlistDictionary{{"type", "redownload"}, {"buyParams", item.actionParams}}}},
  };
}

PlistDictionary StoreAnswers::preflight(const StoreItem& item) {
  const StoreItem::Preflight answer = item.preflightAnswer();
  return {{"allowed", answer.allowed}, {"minimumSystemVersion", answer.minimumSystemVersion}};
}

PlistDictionary StoreAnswers::failure(std::string_view failureType,
                                      std::string_view customerMessage) {
  return {{"failureType", failureType}, {"customerMessage", customerMessage}};
}

std::string StoreAnswers::regexEscaped(std::string_view text) {
  std::string escaped;
  for (const char character : text) {
    if (std::string_view("\\^$.|?*+()[]{}").find(character) != std::string_view::npos) {
      escaped.push_back('\\');
    }
    escaped.push_back(character);
  }
  return escaped;
}

}  // namespace larder
