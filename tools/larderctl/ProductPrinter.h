#pragma once

#include <cstdint>

#include "client/ServiceRequests.h"
#include "platform/value/PlistValue.h"

namespace larder {

// larderctl's output: aligned tables for people, JSON (one document per
// line for streams) for scripts.
class ProductPrinter {
 public:
  explicit ProductPrinter(bool json) : json_(json) {}

  void printProducts(const PlistValue& products) const;
  void printProduct(const PlistValue& product) const;
  void printChange(const PlistValue& product, std::int64_t state) const;
  void printReply(const PlistArray& reply) const;

 private:
  bool json_;
};

}  // namespace larder
