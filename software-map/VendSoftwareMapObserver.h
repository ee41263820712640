#pragma once

#include <cstdint>

#include "store-runtime/records/LedgerSoftwareProduct.h"

namespace larder {

// States told to software map observers.
enum SoftwareProductState : std::int64_t {
  kSoftwareProductAdded = 0,
  kSoftwareProductRemoved = 1,
  kSoftwareProductChanged = 2,
};

// Receiver of software map changes. Implementations must not block: a
// client's observer sends its call and returns.
class VendSoftwareMapObserver {
 public:
  virtual ~VendSoftwareMapObserver() = default;
  virtual void softwareProductUpdatedState(const LedgerSoftwareProductRef& product,
                                           std::int64_t state) = 0;
};

}  // namespace larder
