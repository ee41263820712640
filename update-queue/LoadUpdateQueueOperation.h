#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/services/VendOperation.h"
#include "store-runtime/services/VendOperationDelegate.h"

namespace larder {

class SoftwareMap;

// One update check: sends the installed store software to the store and
// keeps the two lists of its answer. It does nothing to any cache; the
// update queue decides what the answer means.
class LoadUpdateQueueOperation : public VendOperation, public VendStoreURLOperationDelegate {
 public:
  using UpdateList = std::vector<LedgerUpdateRef>;

  static constexpr std::string_view kCompressRequestBagKey =
      "available-software-updates-compress-request";
  static constexpr std::string_view kDoNotUpdateListBagKey = "da-do-not-update-list";
  static constexpr std::string_view kUpdatesURLBagKey = "available-software-updates-extended";

  // The body comes from `softwareMap`, which must outlive the operation.
  LoadUpdateQueueOperation(VendStoreClient storeClient, SoftwareMap& softwareMap);

  // Absent until an answer held the list.
  [[nodiscard]] const std::optional<UpdateList>& availableUpdates() const {
    return availableUpdates_;
  }
  void setAvailableUpdates(std::optional<UpdateList> updates) {
    availableUpdates_ = std::move(updates);
  }
  [[nodiscard]] const std::optional<UpdateList>& incompatibleUpdates() const {
    return incompatibleUpdates_;
  }
  void setIncompatibleUpdates(std::optional<UpdateList> updates) {
    incompatibleUpdates_ = std::move(updates);
  }

  // The inner store operation's output: the only way to success after a
  // real exchange.
  void operationFinishedWithOutput(VendOperation& operation, const PlistValue& output) override;

 protected:
  void run() override;

 private:
  [[nodiscard]] bool wantsCompressedBody();
  [[nodiscard]] std::vector<std::string> doNotUpdateList();
  void fetchUpdates(PlistData body, bool compressed);

  SoftwareMap& softwareMap_;
  std::optional<UpdateList> availableUpdates_;
  std::optional<UpdateList> incompatibleUpdates_;
};

}  // namespace larder
