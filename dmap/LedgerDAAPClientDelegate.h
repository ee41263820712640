#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "dmap/DAAPValue.h"
#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"

namespace larder {

class DAAPClient;

// The owner of a `DAAPClient`: it holds the local copy of the library and
// its revision, says what it already has, and takes what changed. The
// client holds it weakly.
class LedgerDAAPClientDelegate {
 public:
  virtual ~LedgerDAAPClientDelegate() = default;

  // Before each items request, on the polling queue: the token pairs
  // (`DAAPClient::tokenPairWithCloudID`) of the items held. Nothing counts
  // as none.
  virtual std::optional<std::vector<PlistDictionary>>
  daapClientTokenPairsForLocalDatabaseWithClient(DAAPClient& client) = 0;

  // After each items request, on the polling queue, also when the request
  // gave nothing: the items (already filtered by media kind), the server's
  // revision and the deleted ids (numbers).
  virtual void daapClientUpdatedItemsWithLatestVersionDeletedItems(
      DAAPClient& client, const std::optional<DAAPArray>& updatedItems,
      std::optional<std::int64_t> latestVersion, const std::optional<DAAPArray>& deletedItems) = 0;

  // After each request of the session, on the thread of its reply, with
  // the event number (`DAAPClient::Event`), its info (which always holds
  // "reason") and the outcome. Optional: the default does nothing.
  virtual void daapClientHandledEventEventInfoWithSuccessError(DAAPClient& /*client*/,
                                                               std::int64_t /*event*/,
                                                               const DAAPDictionary& /*eventInfo*/,
                                                               bool /*success*/,
                                                               const OptionalError& /*error*/) {}
};

}  // namespace larder
