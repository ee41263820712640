#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "dmap/DAAPValue.h"
#include "dmap/LedgerDAAPClientDelegate.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/services/VendServiceProxy.h"

namespace larder {

class DispatchQueue;
class VendURLBagObserver;
class VendURLOperation;

// One polling session against the cloud library service. It logs in, asks
// for the library's revision and, when that differs from the revision the
// owner holds, fetches what changed: new or changed items and deleted ids,
// which go to the delegate. Every request is a POST signed by the store's
// transaction service, whose answer is checked by the same service, and
// travels as a store URL operation. The client keeps nothing on disk.
//
// Polls of all clients of the process run one at a time on one serial
// queue; the two repeating timers (polling and forced refresh) live on the
// main run loop and only enqueue a poll. The service's settings come from
// the URL bag ("purchase-daap") and the preference overrides
// (`DAAPClientPreferences`), read at each use.
//
// Hold the client in the `std::shared_ptr` that `initWithServiceName`
// gives: polls, timers and the bag observer refer back to it.
class DAAPClient : public std::enable_shared_from_this<DAAPClient> {
 public:
  enum Event : std::int64_t {
    kEventLogin = 1,
    kEventGetLatestVersion = 2,
    kEventGetDatabases = 3,
    kEventGetItems = 4,
    kEventGetArtworkURLs = 5,  // named, never sent
  };

  // The states of a session; see docs/dmap.md.
  enum class State {
    Stopped,        // no bag observer, no timers
    WaitingForBag,  // started; no successful bag update yet
    NoSession,      // timers run or are about to; no session id
    Session,        // a session id, revisions not known to agree
    InStep,         // the server's revision is the one the owner holds
  };

  using TokenPairs = std::vector<PlistDictionary>;
  using PollCompletionHandler =
      std::function<void(bool success, const std::optional<DAAPArray>& updatedItems,
                         const std::optional<DAAPArray>& deletedItems)>;
  using ReplyBlock = std::function<void(const DAAPValue& value, const OptionalError& error)>;

  static constexpr std::string_view kClassName = "DAAPClient";
  static constexpr std::string_view kPollingQueueLabel = "LedgerDAAPClient Polling Queue";
  static constexpr std::string_view kURLBagKey = "purchase-daap";
  static constexpr std::string_view kBaseURLKey = "base-url";
  static constexpr std::string_view kPollingFrequencyKey = "update-polling-frequency-secs";
  static constexpr std::string_view kForcedRefreshFrequencyKey = "forced-refresh-frequency-minutes";
  static constexpr std::string_view kDMAPContentType = "application/x-dmap-tagged";
  static constexpr std::string_view kFormContentType = "application/x-www-form-urlencoded";
  // The request reason of every request of a poll.
  static constexpr std::int64_t kPollReason = 1;
  // Seconds.
  static constexpr double kDefaultPollingFrequency = 3600;
  // Minutes: the forced refresh period is read in minutes and turned into
  // seconds for its timer (one week by default).
  static constexpr double kDefaultForcedRefreshFrequency = 10080;

  static std::shared_ptr<DAAPClient> initWithServiceName(
      std::string serviceName, VendStoreClient storeClient,
      std::weak_ptr<LedgerDAAPClientDelegate> delegate, RunLoop& runLoop = RunLoop::main());

  // Only through `initWithServiceName`.
  struct ConstructionKey {
   private:
    ConstructionKey() = default;
    friend class DAAPClient;
  };
  DAAPClient(ConstructionKey key, std::string serviceName, VendStoreClient storeClient,
             std::weak_ptr<LedgerDAAPClientDelegate> delegate, RunLoop& runLoop);
  ~DAAPClient();
  DAAPClient(const DAAPClient&) = delete;
  DAAPClient& operator=(const DAAPClient&) = delete;

  // The owner's revision; nothing counts as 0.
  void startUpdatingWithLocalVersion(std::optional<std::int64_t> localVersion);
  // Drops the bag observer and both timers. The session stays.
  void stopUpdating();
  // Forgets the session id and the server's revision.
  void invalidateSession();
  // Enqueues one poll. The handler, if any, runs on the polling queue.
  void pollForUpdatesWithForcedUpdate(bool forcedUpdate, PollCompletionHandler handler = nullptr);
  // The URL bag observer's operation; acts only on success.
  void urlBagDidUpdateWithSuccess(bool success, const OptionalError& error);

  // Extended media kinds wanted; empty means all. Set before starting.
  void setMediaKinds(std::vector<std::int64_t> mediaKinds);
  [[nodiscard]] std::vector<std::int64_t> mediaKinds() const;

  // { "clientID": cloud id, "tokenCode": purchased token }, or nothing
  // unless both are given.
  static std::optional<PlistDictionary> tokenPairWithCloudID(
      std::optional<std::uint64_t> cloudID, std::optional<std::uint32_t> purchasedToken);
  // "Login", "GetLatestVersion", ... or "Unknown (<n>)".
  static std::string nameForEvent(std::int64_t event);

  [[nodiscard]] const std::string& serviceName() const { return serviceName_; }
  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }
  [[nodiscard]] std::shared_ptr<LedgerDAAPClientDelegate> delegate() const;
  // Held weakly. Null clears it: an owner that goes away before the client
  // does is told nothing more, even by a poll already under way.
  void setDelegate(const std::shared_ptr<LedgerDAAPClientDelegate>& delegate);
  [[nodiscard]] std::optional<std::int64_t> localVersion() const;
  [[nodiscard]] std::optional<std::int64_t> latestVersion() const;
  [[nodiscard]] std::optional<std::int64_t> sessionID() const;
  [[nodiscard]] State state() const;
  // The repeating timers on the run loop, while they exist.
  [[nodiscard]] std::optional<RunLoop::TimerId> pollingTimer() const;
  [[nodiscard]] std::optional<RunLoop::TimerId> forcedRefreshTimer() const;

  // The requests of a session. Each is synchronous: it sends its request
  // and waits for the reply, so it must not run on a thread that the
  // reply needs (the runtime's service queue). A poll calls the first,
  // second and fourth; the databases listing is for owners that want it.
  void loginWithReason(std::int64_t reason);
  // The server's revision, or nothing.
  std::optional<std::int64_t> getLatestDatabaseVersionWithReason(std::int64_t reason);
  // The databases listing, or nothing.
  std::optional<DAAPArray> getDatabasesWithLocalVersion(std::optional<std::int64_t> localVersion,
                                                        std::optional<std::int64_t> latestVersion,
                                                        std::int64_t reason);
  // The new and changed items, or nothing; the deleted ids through
  // `deletedItems` (which may be null).
  std::optional<DAAPArray> itemsWithLocalVersion(std::int64_t localVersion,
                                                 std::optional<std::int64_t> latestVersion,
                                                 const TokenPairs& tokenPairs, std::int64_t reason,
                                                 std::optional<DAAPArray>* deletedItems);

  // The body of an items request. Token pairs that are not dictionaries
  // with both numbers are left out.
  static PlistData itemsRequestBody(std::uint32_t utcTime, std::int64_t sessionID,
                                    std::int64_t latestVersion, std::int64_t localVersion,
                                    const std::optional<std::string>& query,
                                    const TokenPairs& tokenPairs);

  // The "purchase-daap" dictionary of the bag, read at each use.
  std::optional<PlistDictionary> serverConfig();
  // Seconds between polls: preference, bag, else 3600.
  double pollingFrequency();
  // Minutes between forced refreshes: preference, bag, else 10080.
  double forcedRefreshFrequency();
  std::optional<std::string> baseURL();
  // The base URL with the action appended as path; "items" gets
  // "includePreorders=1". Nothing without a base URL.
  std::optional<std::string> daapURLWithAction(std::string_view action);
  // A POST with the client's headers; no URL when `url` is nothing.
  [[nodiscard]] VendURLRequest daapURLRequestWithURL(const std::optional<std::string>& url,
                                                     std::int64_t reason) const;
  // Signs, sends and checks one request; the reply has the decoded DMAP
  // document, the raw bytes of any other answer, or the error. Every path
  // replies exactly once.
  void performDAAPRequestWithAction(const std::string& action, std::optional<PlistData> body,
                                    std::optional<std::string> contentType, std::int64_t reason,
                                    ReplyBlock replyBlock);
  [[nodiscard]] std::optional<std::string> daapMediaKindsQueryString() const;

  void pollingTimerFired();
  void forcedRefreshTimerFired();
  void sendDelegateEvent(std::int64_t event, const DAAPDictionary& eventInfo, std::int64_t reason,
                         bool success, const OptionalError& error);

  // The one polling queue of the process, made on first use.
  static const std::shared_ptr<DispatchQueue>& pollingQueue();

 private:
  using Timer = std::optional<RunLoop::TimerId>;

  void poll(bool forcedUpdate, const PollCompletionHandler& handler);
  // A timer's poll. A tick adds none while the previous tick's poll still
  // waits its turn, so that a store that hangs doesn't pile polls up.
  void enqueueTickPoll(bool forcedUpdate, std::atomic<bool>& queued);
  std::optional<DAAPArray> filteredItems(const std::optional<DAAPArray>& items) const;
  // Performs the request and waits until `handler` has run with the reply.
  void performAndWait(const std::string& action, std::optional<PlistData> body,
                      std::optional<std::string> contentType, std::int64_t reason,
                      const ReplyBlock& handler);
  void sendSignedRequest(const std::string& action, const std::optional<VendURLRequest>& request,
                         const OptionalError& signingError, const ReplyBlock& replyBlock);
  void handleOutput(const VendURLOperation& operation, const std::string& action,
                    const ReplyBlock& replyBlock);
  // On the run loop: makes the timers that don't exist yet.
  void installTimers();
  RunLoop::TimerId makeTimer(double seconds, void (DAAPClient::*fired)());
  // A period from the preference, else from the bag, else the default.
  double configuredPeriod(std::string_view preferenceKey, std::string_view bagKey, double fallback);
  [[nodiscard]] std::string mediaKindsFormPart() const;
  PlistValue urlBagValue(std::string_view key);
  void setSessionID(std::optional<std::int64_t> sessionID);
  void setLatestVersion(std::optional<std::int64_t> latestVersion);
  void setLocalVersion(std::optional<std::int64_t> localVersion);

  const std::string serviceName_;
  const VendStoreClient storeClient_;
  std::weak_ptr<LedgerDAAPClientDelegate> delegate_ GUARDED_BY(mutex_);
  RunLoop& runLoop_;
  VendServiceProxy serviceProxy_;
  std::shared_ptr<VendURLBagObserver> bagObserver_;

  mutable Mutex mutex_;
  std::optional<std::int64_t> localVersion_ GUARDED_BY(mutex_);
  std::optional<std::int64_t> latestVersion_ GUARDED_BY(mutex_);
  std::optional<std::int64_t> sessionID_ GUARDED_BY(mutex_);
  std::vector<std::int64_t> mediaKinds_ GUARDED_BY(mutex_);
  bool updating_ GUARDED_BY(mutex_) = false;
  bool bagSeen_ GUARDED_BY(mutex_) = false;
  Timer pollingTimer_ GUARDED_BY(mutex_);
  Timer forcedRefreshTimer_ GUARDED_BY(mutex_);
  std::atomic<bool> pollingTickQueued_{false};
  std::atomic<bool> forcedRefreshTickQueued_{false};
};

}  // namespace larder
