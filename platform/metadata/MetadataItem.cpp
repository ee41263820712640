#include "platform/metadata/MetadataItem.h"

#include "platform/metadata/MetadataAttributes.h"

namespace larder {

PlistValue MetadataItem::valueForAttribute(std::string_view name) const {
  std::shared_ptr<const PlistDictionary> snapshot = attributes();
  auto found = snapshot->find(name);
  return found == snapshot->end() ? PlistValue() : found->second;
}

std::string MetadataItem::path() const {
  const PlistValue path = valueForAttribute(MetadataAttributes::kPath);
  return path.string() ? *path.string() : std::string();
}

std::shared_ptr<const PlistDictionary> MetadataItem::attributes() const {
  MutexLock lock(mutex_);
  return attributes_;
}

void MetadataItem::setAttributes(Access /*unused*/,
                                 std::shared_ptr<const PlistDictionary> attributes) {
  MutexLock lock(mutex_);
  attributes_ = std::move(attributes);
}

}  // namespace larder
