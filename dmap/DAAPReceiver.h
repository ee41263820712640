#pragma once

#include "dmap/DAAPValue.h"

namespace larder {

// What the typed setters write into: a dictionary or an item. Both take
// `setObject` (a present value is stored, nothing removes the key) and
// `setValue`, which on an item reaches its properties first. Refers to its
// target; lives for one call.
class DAAPReceiver {
 public:
  DAAPReceiver(DAAPDictionary& dictionary) : dictionary_(&dictionary) {}  // NOLINT
  DAAPReceiver(DAAPItem& item) : item_(&item) {}                          // NOLINT

  void setObject(DAAPValue value, const DAAPKey& key) const;
  void setValue(DAAPValue value, const DAAPKey& key) const;
  // What the key holds now, for the log lines that show a stored value.
  [[nodiscard]] DAAPValue objectForKey(std::string_view key) const;

 private:
  DAAPDictionary* dictionary_ = nullptr;
  DAAPItem* item_ = nullptr;
};

}  // namespace larder
