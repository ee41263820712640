#include "store-runtime/services/VendDataProvider.h"

namespace larder {

bool VendDataProvider::parseData(const PlistData& data, OptionalError* /*error*/) {
  output_ = data;
  return true;
}

}  // namespace larder
