#include "dmap/DAAPClient.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <limits>
#include <sstream>
#include <utility>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPClientPreferences.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPItem.h"
#include "dmap/DAAPMediaKindQuery.h"
#include "dmap/DAAPParser.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendStoreURLOperation.h"
#include "store-runtime/services/VendTransactionService.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = DAAPClient::kClassName;
constexpr std::string_view kClientIDKey = "clientID";
constexpr std::string_view kTokenCodeKey = "tokenCode";
constexpr std::string_view kDAAPVersionHeader = "Client-DAAP-Version";
constexpr std::string_view kPurchaseDAAPVersionHeader = "Client-Cloud-Purchase-Daap-Version";
constexpr std::string_view kReasonHeader = "Client-Cloud-DAAP-Request-Reason";
constexpr std::string_view kGuidHeader = "X-Guid";
constexpr std::string_view kItemsComponent = "items";
constexpr std::string_view kPreordersQuery = "includePreorders=1";
constexpr std::uint8_t kItemKind = 2;
// What follows the `adsr` header of an items body without query and token
// pairs: mstc, mlid, musr and mder (12 bytes each), mikd (9) and the
// `aetl` header (8).
constexpr std::uint64_t kItemsBodyFixedSize = 65;
// An `aeti` header (8) and what follows it: aeto (12) and mild (16).
constexpr std::uint32_t kTokenEntrySize = 28;
constexpr std::uint64_t kTokenPairSize = 8 + kTokenEntrySize;
constexpr double kSecondsPerMinute = 60;
// Longer periods are as good as never, and would overflow the clock.
constexpr double kLongestPeriodSeconds = 100.0 * 365 * 24 * 3600;

// The bag holds its observers strongly; this one forwards to the client
// for as long as the client lives, without keeping it alive.
class BagObserver final : public VendURLBagObserver {
 public:
  explicit BagObserver(std::weak_ptr<DAAPClient> client) : client_(std::move(client)) {}
  void urlBagDidUpdateWithSuccess(bool success, const OptionalError& error) override {
    if (auto client = client_.lock()) client->urlBagDidUpdateWithSuccess(success, error);
  }

 private:
  std::weak_ptr<DAAPClient> client_;
};

DAAPKey key(std::string_view literal) {
  return DAAPKey::literal(literal);
}

// Numbers in form bodies; an absent one is written as 0, which the server
// reads as "none".
std::string numberText(std::optional<std::int64_t> number) {
  return std::to_string(number.value_or(0));
}

PlistData bytesOf(std::string_view text) {
  return {text.begin(), text.end()};
}

std::uint32_t nowSeconds() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint32_t>(std::chrono::duration_cast<std::chrono::seconds>(now).count());
}

// A preference or bag value as a period: a number, or text that reads as
// one. Anything that is not a positive finite number is no period, so a
// bad value cannot make a timer spin.
std::optional<double> periodOf(const PlistValue& value) {
  if (!value.isInteger() && !value.isReal() && !value.isString()) return std::nullopt;
  const double period = value.doubleValue();
  if (!std::isfinite(period) || period <= 0) return std::nullopt;
  return period;
}

std::optional<std::string> headerText(const PlistValue& value) {
  if (const std::string* text = value.string()) return *text;
  if (value.isInteger()) return std::to_string(value.int64Value());
  if (value.isReal()) {
    std::ostringstream text;
    text << value.doubleValue();
    return text.str();
  }
  return std::nullopt;
}

// `url` with `component` appended to its path, in front of any query or
// fragment, with exactly one "/" between.
std::string withPathComponent(std::string_view url, std::string_view component) {
  const auto schemeEnd = url.find("://");
  const auto pathSearchStart = schemeEnd == std::string_view::npos ? 0 : schemeEnd + 3;
  const auto tail = url.find_first_of("?#", pathSearchStart);
  std::string path(url.substr(0, tail));
  if (!path.ends_with('/')) path += '/';
  while (component.starts_with('/')) component.remove_prefix(1);
  path += component;
  if (tail != std::string_view::npos) path += url.substr(tail);
  return path;
}

std::string_view lastPathComponent(std::string_view url) {
  const auto schemeEnd = url.find("://");
  const auto pathSearchStart = schemeEnd == std::string_view::npos ? 0 : schemeEnd + 3;
  std::string_view path = url.substr(0, url.find_first_of("?#", pathSearchStart));
  while (path.ends_with('/')) path.remove_suffix(1);
  const auto slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::optional<DAAPArray> arrayAt(const DAAPValue& dictionary, std::string_view name) {
  const DAAPArray* array = dictionary[name].array();
  if (!array) return std::nullopt;
  return *array;
}

std::string kindsText(const std::vector<std::int64_t>& kinds) {
  std::string text = "(";
  for (std::size_t index = 0; index < kinds.size(); ++index) {
    if (index > 0) text += ", ";
    text += std::to_string(kinds[index]);
  }
  return text + ")";
}

void deliverAnswer(const VendURLResponse& response, const std::optional<PlistData>& verified,
                   const PlistData& raw, const std::string& action,
                   const DAAPClient::ReplyBlock& replyBlock) {
  if (!verified) {
    TILL_LOG(1,
             "%@: Warning, signature verification failed for the response to %@ - using raw "
             "data",
             kSpeaker, action);
    if (raw.empty()) {
      replyBlock({}, std::nullopt);
      return;
    }
  }
  const PlistData& body = verified ? *verified : raw;
  // HTTP header names are case-blind; the value must match exactly, so a
  // type with parameters is not DMAP here.
  const std::optional<std::string> type = response.valueForHeaderField("content-type");
  if (type && *type == DAAPClient::kDMAPContentType) {
    replyBlock(DAAPParser::decodeData(body), std::nullopt);
    return;
  }
  replyBlock(DAAPValue(body), std::nullopt);
}

}  // namespace

std::shared_ptr<DAAPClient> DAAPClient::initWithServiceName(
    std::string serviceName, VendStoreClient storeClient,
    std::weak_ptr<LedgerDAAPClientDelegate> delegate, RunLoop& runLoop) {
  auto client = std::make_shared<DAAPClient>(ConstructionKey(), std::move(serviceName),
                                             std::move(storeClient), std::move(delegate), runLoop);
  client->bagObserver_ = std::make_shared<BagObserver>(client);
  return client;
}

DAAPClient::DAAPClient(ConstructionKey /*key*/, std::string serviceName,
                       VendStoreClient storeClient,
                       std::weak_ptr<LedgerDAAPClientDelegate> delegate, RunLoop& runLoop)
    : serviceName_(std::move(serviceName)),
      storeClient_(std::move(storeClient)),
      delegate_(std::move(delegate)),
      runLoop_(runLoop),
      serviceProxy_(storeClient_) {}

DAAPClient::~DAAPClient() {
  if (pollingTimer_) runLoop_.cancelTimer(*pollingTimer_);
  if (forcedRefreshTimer_) runLoop_.cancelTimer(*forcedRefreshTimer_);
  if (bagObserver_) serviceProxy_.accountService()->removeURLBagObserver(bagObserver_);
}

const std::shared_ptr<DispatchQueue>& DAAPClient::pollingQueue() {
  static const std::shared_ptr<DispatchQueue> queue =
      DispatchQueue::create(std::string(kPollingQueueLabel), DispatchQueue::Kind::Serial);
  return queue;
}

// Session

void DAAPClient::startUpdatingWithLocalVersion(std::optional<std::int64_t> localVersion) {
  {
    MutexLock lock(mutex_);
    localVersion_ = localVersion.value_or(0);
    updating_ = true;
    bagSeen_ = false;
  }
  auto accounts = serviceProxy_.accountService();
  accounts->removeURLBagObserver(bagObserver_);  // a second start must not observe twice
  accounts->addURLBagObserver(bagObserver_);
  // The account service reads the settings from the store client's bag
  // and tells the observer of that bag's fetches: load that same bag.
  accounts->loadURLBagWithType(
      storeClient_.requiredBagType(),
      [weak = weak_from_this()](bool success, bool loaded, const OptionalError& error) {
        const auto self = weak.lock();
        // The runtime tells its bag observers of every fetch, this client
        // among them; so a load that fetched has been acted on already.
        // A load that the cached bag answered told nobody.
        if (!self || loaded) return;
        self->urlBagDidUpdateWithSuccess(success, error);
      });
}

void DAAPClient::stopUpdating() {
  serviceProxy_.accountService()->removeURLBagObserver(bagObserver_);
  Timer polling;
  Timer forcedRefresh;
  {
    MutexLock lock(mutex_);
    updating_ = false;
    polling = std::exchange(pollingTimer_, std::nullopt);
    forcedRefresh = std::exchange(forcedRefreshTimer_, std::nullopt);
  }
  if (polling) runLoop_.cancelTimer(*polling);
  if (forcedRefresh) runLoop_.cancelTimer(*forcedRefresh);
}

void DAAPClient::invalidateSession() {
  MutexLock lock(mutex_);
  sessionID_.reset();
  latestVersion_.reset();
}

void DAAPClient::urlBagDidUpdateWithSuccess(bool success, const OptionalError& /*error*/) {
  if (!success) return;
  {
    MutexLock lock(mutex_);
    bagSeen_ = true;
  }
  invalidateSession();
  pollForUpdatesWithForcedUpdate(false);
  // The periods are read on the run loop, not here: a bag observer is told
  // while the bag's fetch still holds it, and reading it now would wait
  // for that very fetch.
  runLoop_.perform([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->installTimers();
  });
}

void DAAPClient::installTimers() {
  bool needsPolling = false;
  bool needsForcedRefresh = false;
  {
    MutexLock lock(mutex_);
    if (!updating_) return;
    needsPolling = !pollingTimer_;
    needsForcedRefresh = !forcedRefreshTimer_;
  }
  if (!needsPolling && !needsForcedRefresh) return;
  const double pollingSeconds = needsPolling ? pollingFrequency() : 0;
  const double forcedRefreshSeconds =
      needsForcedRefresh ? forcedRefreshFrequency() * kSecondsPerMinute : 0;
  MutexLock lock(mutex_);
  if (!updating_) return;
  if (needsPolling && !pollingTimer_) {
    pollingTimer_ = makeTimer(pollingSeconds, &DAAPClient::pollingTimerFired);
  }
  if (needsForcedRefresh && !forcedRefreshTimer_) {
    forcedRefreshTimer_ = makeTimer(forcedRefreshSeconds, &DAAPClient::forcedRefreshTimerFired);
  }
}

RunLoop::TimerId DAAPClient::makeTimer(double seconds, void (DAAPClient::*fired)()) {
  const auto period = std::chrono::duration_cast<RunLoop::Clock::duration>(
      std::chrono::duration<double>(std::min(seconds, kLongestPeriodSeconds)));
  return runLoop_.addTimer(period, true, [weak = weak_from_this(), fired] {
    if (const auto self = weak.lock()) ((*self).*fired)();
  });
}

void DAAPClient::pollingTimerFired() {
  if (!delegate()) return;
  enqueueTickPoll(false, pollingTickQueued_);
}

void DAAPClient::forcedRefreshTimerFired() {
  if (!delegate()) return;
  enqueueTickPoll(true, forcedRefreshTickQueued_);
}

void DAAPClient::enqueueTickPoll(bool forcedUpdate, std::atomic<bool>& queued) {
  if (queued.exchange(true)) return;
  pollingQueue()->async([self = shared_from_this(), forcedUpdate, &queued] {
    queued = false;  // `queued` is a member of `self`, which this work keeps alive
    self->poll(forcedUpdate, nullptr);
  });
}

void DAAPClient::pollForUpdatesWithForcedUpdate(bool forcedUpdate, PollCompletionHandler handler) {
  pollingQueue()->async([self = shared_from_this(), forcedUpdate, handler = std::move(handler)] {
    self->poll(forcedUpdate, handler);
  });
}

void DAAPClient::poll(bool forcedUpdate, const PollCompletionHandler& handler) {
  const auto finish = [&handler](bool success, const std::optional<DAAPArray>& items,
                                 const std::optional<DAAPArray>& deleted) {
    if (handler) handler(success, items, deleted);
  };
  loginWithReason(kPollReason);
  if (!sessionID()) {
    finish(false, std::nullopt, std::nullopt);
    return;
  }
  const std::optional<std::int64_t> latest = getLatestDatabaseVersionWithReason(kPollReason);
  setLatestVersion(latest);
  const std::optional<std::int64_t> local = localVersion();
  if (!forcedUpdate && (!latest || !local || *latest == *local)) {
    TILL_LOG(1,
             "%@: pollForUpdate did not load items because localVersion=latestVersion (%@=%@), "
             "forcedUpdate=%i",
             kSpeaker, local, latest, forcedUpdate);
    finish(true, std::nullopt, std::nullopt);
    return;
  }
  const auto owner = delegate();
  const TokenPairs tokenPairs =
      owner ? owner->daapClientTokenPairsForLocalDatabaseWithClient(*this).value_or(TokenPairs{})
            : TokenPairs{};
  std::optional<DAAPArray> deleted;
  const std::optional<DAAPArray> items =
      itemsWithLocalVersion(local.value_or(0), latest, tokenPairs, kPollReason, &deleted);
  const std::optional<DAAPArray> filtered = filteredItems(items);
  // Asked again: the owner may have cleared itself while the request ran.
  if (const auto current = delegate()) {
    current->daapClientUpdatedItemsWithLatestVersionDeletedItems(*this, filtered, latest, deleted);
  }
  // The revision this poll saw, not the field, which a bag update may
  // have cleared meanwhile; without one the owner's revision stays.
  if (items && latest) setLocalVersion(latest);
  finish(true, filtered, deleted);
}

std::optional<DAAPArray> DAAPClient::filteredItems(const std::optional<DAAPArray>& items) const {
  const std::vector<std::int64_t> kinds = mediaKinds();
  if (!items || kinds.empty()) return items;
  DAAPArray kept;
  kept.reserve(items->size());
  for (const DAAPValue& element : *items) {
    const DAAPItemRef item = element.item();
    const DAAPValue kind = item ? item->objectForKey(DAAPMediaKindQuery::kMediaKindKey)
                                : element[DAAPMediaKindQuery::kMediaKindKey];
    if (!kind.isNull() && std::find(kinds.begin(), kinds.end(), kind.int64Value()) == kinds.end()) {
      TILL_LOG(1,
               "%@: Ignoring item %@ from DAAP as it's media kind (%@) is not of the requested "
               "type(s) %@",
               kSpeaker, element, kind, kindsText(kinds));
      continue;
    }
    kept.push_back(element);
  }
  return kept;
}

void DAAPClient::setMediaKinds(std::vector<std::int64_t> mediaKinds) {
  MutexLock lock(mutex_);
  mediaKinds_ = std::move(mediaKinds);
}

std::vector<std::int64_t> DAAPClient::mediaKinds() const {
  MutexLock lock(mutex_);
  return mediaKinds_;
}

std::optional<PlistDictionary> DAAPClient::tokenPairWithCloudID(
    std::optional<std::uint64_t> cloudID, std::optional<std::uint32_t> purchasedToken) {
  if (!cloudID || !purchasedToken) return std::nullopt;
  return PlistDictionary{{std::string(kClientIDKey), PlistValue(*cloudID)},
                         {std::string(kTokenCodeKey), PlistValue(std::int64_t{*purchasedToken})}};
}

std::string DAAPClient::nameForEvent(std::int64_t event) {
  switch (event) {
    case kEventLogin:
      return "Login";
    case kEventGetLatestVersion:
      return "GetLatestVersion";
    case kEventGetDatabases:
      return "GetDatabases";
    case kEventGetItems:
      return "GetItems";
    case kEventGetArtworkURLs:
      return "GetArtworkURLs";
    default:
      return "Unknown (" + std::to_string(event) + ")";
  }
}

// Fields

std::shared_ptr<LedgerDAAPClientDelegate> DAAPClient::delegate() const {
  MutexLock lock(mutex_);
  return delegate_.lock();
}

void DAAPClient::setDelegate(const std::shared_ptr<LedgerDAAPClientDelegate>& delegate) {
  MutexLock lock(mutex_);
  delegate_ = delegate;
}

std::optional<std::int64_t> DAAPClient::localVersion() const {
  MutexLock lock(mutex_);
  return localVersion_;
}

std::optional<std::int64_t> DAAPClient::latestVersion() const {
  MutexLock lock(mutex_);
  return latestVersion_;
}

std::optional<std::int64_t> DAAPClient::sessionID() const {
  MutexLock lock(mutex_);
  return sessionID_;
}

void DAAPClient::setSessionID(std::optional<std::int64_t> sessionID) {
  MutexLock lock(mutex_);
  sessionID_ = sessionID;
}

void DAAPClient::setLatestVersion(std::optional<std::int64_t> latestVersion) {
  MutexLock lock(mutex_);
  latestVersion_ = latestVersion;
}

void DAAPClient::setLocalVersion(std::optional<std::int64_t> localVersion) {
  MutexLock lock(mutex_);
  localVersion_ = localVersion;
}

DAAPClient::State DAAPClient::state() const {
  MutexLock lock(mutex_);
  if (!updating_) return State::Stopped;
  if (!bagSeen_) return State::WaitingForBag;
  if (!sessionID_) return State::NoSession;
  if (latestVersion_ && localVersion_ && *latestVersion_ == *localVersion_) return State::InStep;
  return State::Session;
}

std::optional<RunLoop::TimerId> DAAPClient::pollingTimer() const {
  MutexLock lock(mutex_);
  return pollingTimer_;
}

std::optional<RunLoop::TimerId> DAAPClient::forcedRefreshTimer() const {
  MutexLock lock(mutex_);
  return forcedRefreshTimer_;
}

// Requests

void DAAPClient::performAndWait(const std::string& action, std::optional<PlistData> body,
                                std::optional<std::string> contentType, std::int64_t reason,
                                const ReplyBlock& handler) {
  DispatchSemaphore replied;
  performDAAPRequestWithAction(action, std::move(body), std::move(contentType), reason,
                               [&](const DAAPValue& value, const OptionalError& error) {
                                 handler(value, error);
                                 replied.signal();
                               });
  replied.wait();
}

void DAAPClient::loginWithReason(std::int64_t reason) {
  performAndWait(
      "login", std::nullopt, std::nullopt, reason,
      [&](const DAAPValue& value, const OptionalError& error) {
        if (!value.isInteger()) {
          sendDelegateEvent(kEventLogin, {}, reason, false, error);
          TILL_LOG(1, "%@: DAAP Login failed with error %@", kSpeaker,
                   error ? error->descriptionText() : std::string("(null)"));
          return;
        }
        setSessionID(value.int64Value());
        sendDelegateEvent(kEventLogin, {{key("sessionID"), value}}, reason, true, std::nullopt);
        TILL_LOG(3, "%@: DAAP Login returned session ID %@", kSpeaker, value.int64Value());
      });
}

std::string DAAPClient::mediaKindsFormPart() const {
  const std::optional<std::string> query = daapMediaKindsQueryString();
  return query ? "&query=" + *query : std::string();
}

std::optional<std::int64_t> DAAPClient::getLatestDatabaseVersionWithReason(std::int64_t reason) {
  const std::string body = "session-id=" + numberText(sessionID()) +
                           "&revision-number=" + numberText(localVersion()) + mediaKindsFormPart();
  std::optional<std::int64_t> revision;
  performAndWait("update", bytesOf(body), std::string(kFormContentType), reason,
                 [&](const DAAPValue& value, const OptionalError& error) {
                   if (!value.isDictionary()) {
                     sendDelegateEvent(kEventGetLatestVersion, {}, reason, false, error);
                     return;
                   }
                   sendDelegateEvent(kEventGetLatestVersion, {{key("response"), value}}, reason,
                                     true, std::nullopt);
                   const DAAPValue& found = value["dmap.serverrevision"];
                   if (found.isInteger()) revision = found.int64Value();
                 });
  return revision;
}

std::optional<DAAPArray> DAAPClient::getDatabasesWithLocalVersion(
    std::optional<std::int64_t> localVersion, std::optional<std::int64_t> latestVersion,
    std::int64_t reason) {
  const std::string body = "session-id=" + numberText(sessionID()) +
                           "&revision-number=" + numberText(latestVersion) +
                           "&delta=" + numberText(localVersion);
  std::optional<DAAPArray> databases;
  performAndWait("databases", bytesOf(body), std::string(kFormContentType), reason,
                 [&](const DAAPValue& value, const OptionalError& error) {
                   if (!value.isDictionary()) {
                     sendDelegateEvent(kEventGetDatabases, {}, reason, false, error);
                     return;
                   }
                   sendDelegateEvent(kEventGetDatabases, {{key("response"), value}}, reason, true,
                                     std::nullopt);
                   databases = arrayAt(value, "dmap.listing");
                 });
  return databases;
}

std::optional<DAAPArray> DAAPClient::itemsWithLocalVersion(
    std::int64_t localVersion, std::optional<std::int64_t> latestVersion,
    const TokenPairs& tokenPairs, std::int64_t reason, std::optional<DAAPArray>* deletedItems) {
  PlistData body =
      itemsRequestBody(nowSeconds(), sessionID().value_or(0), latestVersion.value_or(0),
                       localVersion, daapMediaKindsQueryString(), tokenPairs);
  std::optional<DAAPArray> items;
  std::optional<DAAPArray> deleted;
  performAndWait(
      "databases/" + std::to_string(localVersion) + "/items", std::move(body),
      std::string(kDMAPContentType), reason,
      [&](const DAAPValue& value, const OptionalError& error) {
        if (!value.isDictionary()) {
          sendDelegateEvent(kEventGetItems, {}, reason, false, error);
          return;
        }
        DAAPDictionary info{{key("response"), value}, {key("localVersion"), localVersion}};
        if (latestVersion) info.insert_or_assign(key("latestVersion"), *latestVersion);
        sendDelegateEvent(kEventGetItems, info, reason, true, std::nullopt);
        items = arrayAt(value, "dmap.listing");
        deleted = arrayAt(value, "dmap.deletedidlisting");
      });
  if (deletedItems) *deletedItems = std::move(deleted);
  return items;
}

PlistData DAAPClient::itemsRequestBody(std::uint32_t utcTime, std::int64_t sessionID,
                                       std::int64_t latestVersion, std::int64_t localVersion,
                                       const std::optional<std::string>& query,
                                       const TokenPairs& tokenPairs) {
  const std::uint64_t querySize = query ? 8 + query->size() : 0;
  // No more pairs than a 32-bit container size can hold.
  const std::uint64_t pairCapacity =
      (std::numeric_limits<std::uint32_t>::max() - kItemsBodyFixedSize - querySize) /
      kTokenPairSize;
  std::vector<std::pair<std::uint64_t, std::uint32_t>> pairs;
  pairs.reserve(std::min<std::uint64_t>(tokenPairs.size(), pairCapacity));
  for (const PlistDictionary& pair : tokenPairs) {
    if (pairs.size() == pairCapacity) break;
    const auto cloudID = pair.find(kClientIDKey);
    const auto token = pair.find(kTokenCodeKey);
    if (cloudID == pair.end() || token == pair.end() || !cloudID->second.isInteger() ||
        !token->second.isInteger()) {
      continue;
    }
    pairs.emplace_back(cloudID->second.uint64Value(),
                       static_cast<std::uint32_t>(token->second.uint64Value()));
  }
  const std::uint64_t listSize = kTokenPairSize * pairs.size();
  DAAPBuffer buffer;
  buffer.reserve(8 + kItemsBodyFixedSize + querySize + listSize);
  buffer.appendHeader("adsr"_dmap,
                      static_cast<std::uint32_t>(kItemsBodyFixedSize + querySize + listSize));
  buffer.appendUInt32(utcTime, "mstc"_dmap);
  buffer.appendUInt32(static_cast<std::uint32_t>(sessionID), "mlid"_dmap);
  buffer.appendUInt8(kItemKind, "mikd"_dmap);
  buffer.appendUInt32(static_cast<std::uint32_t>(latestVersion), "musr"_dmap);
  buffer.appendUInt32(static_cast<std::uint32_t>(localVersion), "mder"_dmap);
  if (query) buffer.appendUTF8String(*query, "mque"_dmap);
  buffer.appendHeader("aetl"_dmap, static_cast<std::uint32_t>(listSize));
  for (const auto& [cloudID, token] : pairs) {
    buffer.appendHeader("aeti"_dmap, kTokenEntrySize);
    buffer.appendUInt32(token, "aeto"_dmap);
    buffer.appendUInt64(cloudID, "mild"_dmap);
  }
  return buffer.takeData();
}

// Configuration

PlistValue DAAPClient::urlBagValue(std::string_view key) {
  PlistValue value;
  serviceProxy_.accountServiceSynchronousBlock(
      [&](VendAccountService& service, DispatchSemaphore& done) {
        service.valueForURLBagKey(std::string(key), [&](PlistValue found) {
          value = std::move(found);
          done.signal();
        });
      });
  return value;
}

std::optional<PlistDictionary> DAAPClient::serverConfig() {
  const PlistValue value = urlBagValue(kURLBagKey);
  if (const PlistDictionary* config = value.dictionary()) return *config;
  return std::nullopt;
}

double DAAPClient::configuredPeriod(std::string_view preferenceKey, std::string_view bagKey,
                                    double fallback) {
  if (const auto period = periodOf(DAAPClientPreferences::valueForKey(preferenceKey))) {
    return *period;
  }
  if (const auto config = serverConfig()) {
    const auto found = config->find(bagKey);
    if (found != config->end()) {
      if (const auto period = periodOf(found->second)) return *period;
    }
  }
  return fallback;
}

double DAAPClient::pollingFrequency() {
  return configuredPeriod(DAAPClientPreferences::kDefaultsDAAPPollingIntervalKey,
                          kPollingFrequencyKey, kDefaultPollingFrequency);
}

double DAAPClient::forcedRefreshFrequency() {
  return configuredPeriod(DAAPClientPreferences::kDefaultsDAAPForcedRefreshIntervalKey,
                          kForcedRefreshFrequencyKey, kDefaultForcedRefreshFrequency);
}

std::optional<std::string> DAAPClient::baseURL() {
  const auto config = serverConfig();
  if (!config) return std::nullopt;
  const auto found = config->find(kBaseURLKey);
  const std::string* url = found == config->end() ? nullptr : found->second.string();
  if (!url || url->empty()) return std::nullopt;
  return *url;
}

std::optional<std::string> DAAPClient::daapURLWithAction(std::string_view action) {
  const std::optional<std::string> base = baseURL();
  if (!base) return std::nullopt;
  std::string url = withPathComponent(*base, action);
  if (lastPathComponent(url) == kItemsComponent) {
    url = urlByAddingStringToQueryString(url, kPreordersQuery);
  }
  return url;
}

VendURLRequest DAAPClient::daapURLRequestWithURL(const std::optional<std::string>& url,
                                                 std::int64_t reason) const {
  VendURLRequest request(url.value_or(std::string()));
  request.setMethod("POST");
  const PlistDictionary& daap = storeClient_.daap();
  for (const std::string_view header : {kDAAPVersionHeader, kPurchaseDAAPVersionHeader}) {
    const auto found = daap.find(header);
    if (found == daap.end()) continue;
    if (const auto text = headerText(found->second)) request.setValue(*text, header);
  }
  request.setValue(std::to_string(reason), kReasonHeader);
  request.setValue(VendDevice::guid(), kGuidHeader);
  return request;
}

std::optional<std::string> DAAPClient::daapMediaKindsQueryString() const {
  const std::vector<std::int64_t> kinds = mediaKinds();
  return DAAPMediaKindQuery::text(kinds);
}

void DAAPClient::performDAAPRequestWithAction(const std::string& action,
                                              std::optional<PlistData> body,
                                              std::optional<std::string> contentType,
                                              std::int64_t reason, ReplyBlock replyBlock) {
  std::optional<VendAccount> account;
  serviceProxy_.accountServiceSynchronousBlock(
      [&](VendAccountService& service, DispatchSemaphore& done) {
        service.primaryAccount([&](std::optional<VendAccount> primary) {
          account = std::move(primary);
          done.signal();
        });
      });
  if (!account) {
    TILL_LOG(1,
             "%@: Will not perform DAAP request for action %@ because no primary account is "
             "present",
             kSpeaker, action);
    replyBlock({}, VendError::withDomain(std::string(kClassName), 0,
                                         std::string("No primary account is present")));
    return;
  }
  VendURLRequest request = daapURLRequestWithURL(daapURLWithAction(action), reason);
  if (contentType) request.setValue(*contentType, "Content-Type");
  if (body) request.setBody(std::move(*body));
  auto transactions = serviceProxy_.transactionServiceWithErrorHandler(
      [replyBlock](const VendError& error) { replyBlock({}, error); });
  transactions->signURLRequest(
      std::move(request), serviceName_, std::nullopt,
      [self = shared_from_this(), action, replyBlock](
          const std::optional<VendURLRequest>& signedRequest, const OptionalError& error) {
        self->sendSignedRequest(action, signedRequest, error, replyBlock);
      });
}

void DAAPClient::sendSignedRequest(const std::string& action,
                                   const std::optional<VendURLRequest>& request,
                                   const OptionalError& signingError,
                                   const ReplyBlock& replyBlock) {
  OptionalError error = signingError;
  if (request) {
    auto operation = std::make_shared<VendStoreURLOperation>(storeClient_);
    operation->setRequest(*request);
    operation->setOutputHandler([self = shared_from_this(), action, replyBlock](
                                    VendURLOperation& finished, const PlistValue& /*output*/) {
      self->handleOutput(finished, action, replyBlock);
    });
    // On success the output handler has replied.
    if (operation->runSyncReturningError(&error)) return;
  }
  TILL_LOG(1, "%@ (%@): DAAP Request action %@ failed with error %@", kSpeaker, serviceName_,
           action, error ? error->descriptionText() : std::string("(null)"));
  replyBlock({}, error);
}

void DAAPClient::handleOutput(const VendURLOperation& operation, const std::string& action,
                              const ReplyBlock& replyBlock) {
  PlistData raw = operation.rawData();
  const std::optional<VendURLResponse>& response = operation.response();
  if (!response) {
    TILL_LOG(1, "%@: Warning, response is not a HTTP response (%@) - using raw data", kSpeaker,
             std::string("(null)"));
    replyBlock(DAAPValue(std::move(raw)), std::nullopt);
    return;
  }
  auto transactions = serviceProxy_.transactionServiceWithErrorHandler(
      [replyBlock](const VendError& error) { replyBlock({}, error); });
  transactions->signedBodyWithURLResponse(
      *response, serviceName_, raw, std::nullopt,
      [response = *response, raw, action, replyBlock](const std::optional<PlistData>& body,
                                                      const OptionalError& /*error*/) {
        deliverAnswer(response, body, raw, action, replyBlock);
      });
}

void DAAPClient::sendDelegateEvent(std::int64_t event, const DAAPDictionary& eventInfo,
                                   std::int64_t reason, bool success, const OptionalError& error) {
  const auto owner = delegate();
  if (!owner) return;
  DAAPDictionary info = eventInfo;
  info.insert_or_assign(key("reason"), DAAPValue(reason));
  owner->daapClientHandledEventEventInfoWithSuccessError(*this, event, info, success, error);
}

}  // namespace larder
