#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

class MetadataBundleIndex;
class MetadataQuery;

// One bundle in the results of a metadata query. The object stands for the bundle for as long
// as the query sees it, also when the bundle is renamed or moved to another watched folder, so
// its address can serve as a key. Its attributes are those of the query's last delivered event:
// they change on the query's queue, right before the event that tells of the change.
class MetadataItem {
 public:
  // Only the index makes items and only the query changes them.
  class Access {
    Access() = default;
    friend class MetadataBundleIndex;
    friend class MetadataQuery;
  };

  explicit MetadataItem(Access /*unused*/) {}
  MetadataItem(const MetadataItem&) = delete;
  MetadataItem& operator=(const MetadataItem&) = delete;

  // An absent value when the item has no such attribute.
  [[nodiscard]] PlistValue valueForAttribute(std::string_view name) const;
  // The "kHostItemPath" attribute.
  [[nodiscard]] std::string path() const;
  [[nodiscard]] std::shared_ptr<const PlistDictionary> attributes() const;

  void setAttributes(Access /*unused*/, std::shared_ptr<const PlistDictionary> attributes);

 private:
  mutable Mutex mutex_;
  std::shared_ptr<const PlistDictionary> attributes_ GUARDED_BY(mutex_) =
      std::make_shared<const PlistDictionary>();
};

}  // namespace larder
