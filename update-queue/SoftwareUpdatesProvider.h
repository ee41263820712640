#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/services/VendDataProvider.h"

namespace larder {

// Turns the store's answer to an update check into two lists of updates.
// The answer's other orders (failures, dialogs) are obeyed as in any
// property-list answer; downloads it may carry are not started. Each list
// stays absent unless the answer held it as an array, so that a caller can
// tell "no updates" from "the store said nothing about updates".
class SoftwareUpdatesProvider : public VendDataProvider {
 public:
  static constexpr std::string_view kAvailableUpdatesKey = "availableUpdates";
  static constexpr std::string_view kIncompatibleUpdatesKey = "incompatibleUpdates";

  using VendDataProvider::VendDataProvider;
  using UpdateList = std::vector<LedgerUpdateRef>;

  static std::shared_ptr<SoftwareUpdatesProvider> providerWithStoreClient(
      VendStoreClient storeClient) {
    return std::make_shared<SoftwareUpdatesProvider>(std::move(storeClient));
  }

  // The output is a dictionary with "availableUpdates" and
  // "incompatibleUpdates", each an array of the records' dictionaries and
  // present only when its list is.
  bool parseData(const PlistData& data, OptionalError* error) override;

  [[nodiscard]] const std::optional<UpdateList>& availableUpdates() const {
    return availableUpdates_;
  }
  [[nodiscard]] const std::optional<UpdateList>& incompatibleUpdates() const {
    return incompatibleUpdates_;
  }

  // The records of the items that make one, in the store's order; anything
  // else is dropped without a word.
  static UpdateList copyUpdatesFromItems(const PlistArray& items);

  // The records of an output made by `parseData`; nullopt when the output
  // lacks the list.
  static std::optional<UpdateList> updatesFromOutput(const PlistValue& output,
                                                     std::string_view key);

 private:
  void takeListsFrom(const PlistDictionary& answer);
  [[nodiscard]] PlistDictionary makeOutput() const;

  std::optional<UpdateList> availableUpdates_;
  std::optional<UpdateList> incompatibleUpdates_;
};

}  // namespace larder
