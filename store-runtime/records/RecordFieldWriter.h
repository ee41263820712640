#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/KeyedArchive.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Writes the fields of a record into its dictionary, archive or wire form
// alike. Absent values are left out rather than written as placeholders, so
// a reader can tell "not known" from any real value.
class RecordFieldWriter {
 public:
  explicit RecordFieldWriter(PlistDictionary& target) : target_(target) {}

  // A record's wire form: the fields `putFields` writes.
  template <typename Record>
  static PlistDictionary dictionary(const Record& record,
                                    void (*putFields)(RecordFieldWriter&, const Record&)) {
    PlistDictionary target;
    RecordFieldWriter writer(target);
    putFields(writer, record);
    return target;
  }
  // Its keyed-archive form: the same fields plus "$class".
  template <typename Record>
  static PlistDictionary archive(std::string_view className, const Record& record,
                                 void (*putFields)(RecordFieldWriter&, const Record&)) {
    PlistDictionary target = KeyedArchive::record(className);
    RecordFieldWriter writer(target);
    putFields(writer, record);
    return target;
  }

  template <typename T>
  void put(std::string_view key, T value) {
    target_.insert_or_assign(std::string(key), PlistValue(std::move(value)));
  }
  template <typename T>
  void put(std::string_view key, const std::optional<T>& value) {
    if (value) put(key, *value);
  }
  void put(std::string_view key, const PlistValue& value) {
    if (!value.isNull()) target_.insert_or_assign(std::string(key), value);
  }
  void put(std::string_view key, const std::vector<std::string>& texts) {
    put(key, PlistArray(texts.begin(), texts.end()));
  }

 private:
  PlistDictionary& target_;
};

}  // namespace larder
