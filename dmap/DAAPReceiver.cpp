#include "dmap/DAAPReceiver.h"

#include "dmap/DAAPItem.h"

namespace larder {

void DAAPReceiver::setObject(DAAPValue value, const DAAPKey& key) const {
  if (item_) return item_->setObject(std::move(value), key);
  if (value.isNull()) {
    const auto found = dictionary_->find(key.view());
    if (found != dictionary_->end()) dictionary_->erase(found);
    return;
  }
  dictionary_->insert_or_assign(key, std::move(value));
}

void DAAPReceiver::setValue(DAAPValue value, const DAAPKey& key) const {
  if (item_) return item_->setValue(std::move(value), key);
  setObject(std::move(value), key);
}

DAAPValue DAAPReceiver::objectForKey(std::string_view key) const {
  if (item_) return item_->objectForKey(key);
  return lookup(*dictionary_, key);
}

}  // namespace larder
