#pragma once

#include <string>
#include <vector>

#include "platform/error/VendError.h"

namespace larder {

// Told of the progress of an OS update scan: percent done, and at the end
// finished with 100 and the scan's error, if any.
class VendOSUpdateScanObserver {
 public:
  virtual ~VendOSUpdateScanObserver() = default;
  virtual void osUpdateScanForTags(const std::vector<std::string>& tags, float percentComplete,
                                   bool isFinished, const OptionalError& error) = 0;
  [[nodiscard]] virtual bool isSameObserverAs(const VendOSUpdateScanObserver& other) const {
    return this == &other;
  }
};

}  // namespace larder
