#pragma once

#include <optional>

#include "platform/error/VendError.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/TillPurchaseResponse.h"

namespace larder {

// Hears how the purchase of each app update of a run the user started
// ended. Called on the run's threads.
class VendUpdateDelegate {
 public:
  virtual ~VendUpdateDelegate() = default;
  virtual void appUpdateFinishedPurchase(const LedgerUpdateRef& update, bool success,
                                         const OptionalError& error,
                                         const std::optional<TillPurchaseResponse>& response) = 0;
};

}  // namespace larder
