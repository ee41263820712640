#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "store-runtime/records/LedgerSoftwareProduct.h"

namespace larder {

// The service's own asset requests as the runtime hands them to
// operations; the service installs the implementation at start.
class VendAssetService {
 public:
  using ProductList = std::vector<std::shared_ptr<LedgerSoftwareProduct>>;
  virtual ~VendAssetService() = default;
  virtual void allProducts(std::function<void(ProductList)> reply) = 0;
};

}  // namespace larder
