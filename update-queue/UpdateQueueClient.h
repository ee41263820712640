#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "platform/error/VendError.h"
#include "store-runtime/records/LedgerUpdate.h"

namespace larder {

// A caller waiting for the update check in flight.
struct UpdateQueueClient {
  using UpdateList = std::vector<LedgerUpdateRef>;
  // Success, the available updates, the incompatible updates (absent when
  // the store's last answer had no such list), and the error of a failed
  // check. The records are the queue's own.
  using CompletionHandler = std::function<void(bool success, const UpdateList& availableUpdates,
                                               const std::optional<UpdateList>& incompatibleUpdates,
                                               const OptionalError& error)>;

  CompletionHandler queueCheckCompletionHandler;
};

}  // namespace larder
