#include "store-runtime/http/VendURLBag.h"

#include <algorithm>
#include <regex>

#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/http/VendStoreAnswer.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "VendURLBag";
constexpr std::chrono::seconds kDefaultLifetime{3600};
constexpr std::int64_t kMissingKeyCode = 30;

std::chrono::seconds lifetimeOf(const PlistDictionary& bag) {
  const auto found = bag.find("ttl");
  const PlistValue ttl = found == bag.end() ? PlistValue() : found->second;
  if (ttl.isNumber() && ttl.int64Value() > 0) return std::chrono::seconds(ttl.int64Value());
  return kDefaultLifetime;
}

}  // namespace

VendURLBag::VendURLBag(VendRuntimeConfiguration configuration)
    : configuration_(std::move(configuration)) {}

std::string VendURLBag::bagURLForType(std::int64_t bagType) const {
  if (bagType == 0 || configuration_.bagURL.empty()) return configuration_.bagURL;
  return urlByAddingStringToQueryString(configuration_.bagURL, "type=" + std::to_string(bagType));
}

VendURLBag::Entry& VendURLBag::entryForType(std::int64_t bagType) {
  MutexLock lock(mutex_);
  auto& entry = entries_[bagType];
  if (!entry) entry = std::make_unique<Entry>();
  return *entry;
}

VendURLBag::LoadResult VendURLBag::load(std::int64_t bagType, bool force) {
  Entry& entry = entryForType(bagType);
  MutexLock fetching(entry.fetchMutex);
  {
    MutexLock lock(mutex_);
    if (!force && entry.bag && std::chrono::steady_clock::now() < entry.expiry) {
      return {.success = true, .loaded = false, .error = std::nullopt};
    }
  }
  LoadResult result = fetch(bagType, entry);
  notifyObservers(bagType, result);
  return result;
}

VendURLBag::LoadResult VendURLBag::fetch(std::int64_t bagType, Entry& entry) {
  LoadResult result{.success = false, .loaded = true, .error = std::nullopt};
  const std::string url = bagURLForType(bagType);
  if (url.empty()) {
    result.error = VendStoreAnswer::error(VendStoreAnswer::kNoStore,
                                          "No store is configured (LARDER_STORE_URL)");
    return result;
  }
  VendURLRequest request(url);
  request.setTimeoutInterval(configuration_.requestTimeout);
  VendHTTPTransfer::Options options;
  options.connectTimeout = configuration_.connectTimeout;
  auto answer = VendHTTPTransfer::perform(request, options);
  if (answer.error) {
    result.error = answer.error;
  } else if (!answer.response.isSuccess()) {
    result.error = VendStoreAnswer::failure(answer.response, answer.body);
  } else if (auto bag = VendStoreAnswer::dictionary(answer.body, &result.error)) {
    MutexLock lock(mutex_);
    entry.expiry = std::chrono::steady_clock::now() + lifetimeOf(*bag);
    entry.bag = std::make_shared<const PlistDictionary>(std::move(*bag));
    result.success = true;
  }
  if (!result.success) {
    TILL_LOG(1, "%@: Loading the URL bag from %@ failed: %@", kSpeaker, url,
             result.error->descriptionText());
  }
  return result;
}

std::shared_ptr<const PlistDictionary> VendURLBag::cachedBag(std::int64_t bagType,
                                                             bool loadIfNeeded) {
  if (loadIfNeeded) load(bagType);
  Entry& entry = entryForType(bagType);
  MutexLock lock(mutex_);
  return entry.bag;
}

PlistValue VendURLBag::valueForKey(std::int64_t bagType, std::string_view key) {
  auto bag = cachedBag(bagType, true);
  if (!bag) return {};
  auto found = bag->find(key);
  return found == bag->end() ? PlistValue() : found->second;
}

std::optional<std::string> VendURLBag::urlForKey(std::int64_t bagType, std::string_view key,
                                                 OptionalError* error) {
  OptionalError failure;
  auto bag = cachedBag(bagType, true);
  const auto entry = bag ? bag->find(key) : PlistDictionary::const_iterator{};
  if (!bag) {
    failure = load(bagType).error;
  } else if (const std::string* url = entry != bag->end() ? entry->second.string() : nullptr) {
    return *url;
  } else {
    VendError missing;
    missing.code = kMissingKeyCode;
    missing.description = "The URL bag has no URL under \"" + std::string(key) + "\"";
    failure = missing;
  }
  if (error) *error = failure;
  return std::nullopt;
}

bool VendURLBag::isValid(std::int64_t bagType) {
  return cachedBag(bagType, true) != nullptr;
}

bool VendURLBag::regexWithKeyMatchesString(std::int64_t bagType, std::string_view key,
                                           std::string_view text) {
  const PlistValue pattern = valueForKey(bagType, key);
  const std::string* expression = pattern.string();
  if (!expression) return false;
  try {
    return std::regex_match(text.begin(), text.end(),
                            std::regex(*expression, std::regex::ECMAScript));
  } catch (const std::regex_error& error) {
    TILL_LOG(1, "%@: The bag's pattern under %@ is not a regular expression: %@", kSpeaker,
             std::string(key), error.what());
    return false;
  }
}

void VendURLBag::addObserver(std::int64_t bagType,
                             const std::shared_ptr<VendURLBagObserver>& observer) {
  if (!observer) return;
  MutexLock lock(observersMutex_);
  observers_.emplace_back(bagType, observer);
}

void VendURLBag::removeObserver(const std::shared_ptr<VendURLBagObserver>& observer) {
  MutexLock lock(observersMutex_);
  std::erase_if(observers_, [&](const auto& entry) { return entry.second == observer; });
}

void VendURLBag::notifyObservers(std::int64_t bagType, const LoadResult& result) {
  std::vector<std::shared_ptr<VendURLBagObserver>> observers;
  {
    MutexLock lock(observersMutex_);
    for (const auto& [observedType, observer] : observers_) {
      if (observedType == bagType) observers.push_back(observer);
    }
  }
  for (const auto& observer : observers)
    observer->urlBagDidUpdateWithSuccess(result.success, result.error);
}

}  // namespace larder
