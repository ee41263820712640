#pragma once

#include <vector>

#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// Told of the progress of OS update installs.
class VendOSUpdateProgressObserver {
 public:
  virtual ~VendOSUpdateProgressObserver() = default;
  virtual void osUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& osUpdates,
                                        const LedgerSoftwareUpdateStatus& progress) = 0;
  [[nodiscard]] virtual bool isSameObserverAs(const VendOSUpdateProgressObserver& other) const {
    return this == &other;
  }
};

}  // namespace larder
