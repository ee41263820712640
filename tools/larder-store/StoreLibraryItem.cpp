#include "larder-store/StoreLibraryItem.h"

#include <array>
#include <limits>
#include <span>
#include <string_view>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPContainerScope.h"

namespace larder {
namespace {

enum class FieldKind { Text, UInt32, UInt64, Date };

struct Field {
  std::string_view key;
  std::uint32_t code;
  FieldKind kind;
};

constexpr std::array kItemFields{
    Field{"name", "minm"_dmap, FieldKind::Text},
    Field{"artist", "asar"_dmap, FieldKind::Text},
    Field{"album", "asal"_dmap, FieldKind::Text},
    Field{"genre", "asgn"_dmap, FieldKind::Text},
    Field{"sort-name", "assn"_dmap, FieldKind::Text},
    Field{"display-version", "aePd"_dmap, FieldKind::Text},
    Field{"artwork-url", "aeCa"_dmap, FieldKind::Text},
    Field{"ware-id", "aeSI"_dmap, FieldKind::UInt64},
    Field{"publication-version", "aepv"_dmap, FieldKind::UInt64},
    Field{"purchase-date", "asdp"_dmap, FieldKind::Date},
    Field{"release-date", "ajEd"_dmap, FieldKind::Date},
};

// The one flavor of an item, when the entry has any of these.
constexpr std::array kFlavorFields{
    Field{"redownload-params", "aeRp"_dmap, FieldKind::Text},
    Field{"update-params", "ajUp"_dmap, FieldKind::Text},
    Field{"size", "asls"_dmap, FieldKind::UInt64},
};

constexpr std::uint8_t kItemKind = 2;
constexpr std::uint64_t kLargestUInt32 = std::numeric_limits<std::uint32_t>::max();

bool fits(const PlistValue& value, FieldKind kind) {
  switch (kind) {
    case FieldKind::Text:
      return value.isString();
    case FieldKind::UInt32:
      return value.isInteger() && value.int64Value() >= 0 && value.uint64Value() <= kLargestUInt32;
    case FieldKind::UInt64:
      return value.isInteger() &&
             (value.type() == PlistValue::Type::UnsignedInteger || value.int64Value() >= 0);
    case FieldKind::Date:
      return value.isDate() && value.date()->secondsSince1970 >= 0 &&
             value.date()->secondsSince1970 <= static_cast<double>(kLargestUInt32);
  }
  return false;
}

// Copies the entry's fields of `table` into `fields`; false (with *error)
// on the first of the wrong type.
bool takeFields(const PlistValue& entry, std::span<const Field> table, PlistDictionary& fields,
                std::string* error) {
  for (const Field& field : table) {
    const PlistValue& value = entry[field.key];
    if (value.isNull()) continue;
    if (!fits(value, field.kind)) {
      if (error) *error = "\"" + std::string(field.key) + "\" has the wrong type";
      return false;
    }
    fields.emplace(std::string(field.key), value);
  }
  return true;
}

void writeField(DAAPBuffer& buffer, const Field& field, const PlistValue& value) {
  switch (field.kind) {
    case FieldKind::Text:
      buffer.appendUTF8String(*value.string(), field.code);
      return;
    case FieldKind::UInt32:
      buffer.appendUInt32(static_cast<std::uint32_t>(value.uint64Value()), field.code);
      return;
    case FieldKind::UInt64:
      buffer.appendUInt64(value.uint64Value(), field.code);
      return;
    case FieldKind::Date:
      buffer.appendUInt32(static_cast<std::uint32_t>(value.date()->secondsSince1970), field.code);
      return;
  }
}

void writeFields(DAAPBuffer& buffer, std::span<const Field> table, const PlistDictionary& fields) {
  for (const Field& field : table) {
    const auto found = fields.find(field.key);
    if (found != fields.end()) writeField(buffer, field, found->second);
  }
}

bool hasAnyOf(std::span<const Field> table, const PlistDictionary& fields) {
  for (const Field& field : table) {
    if (fields.contains(field.key)) return true;
  }
  return false;
}

}  // namespace

Result<StoreLibraryItem> StoreLibraryItem::fromDictionary(const PlistValue& entry,
                                                          std::uint32_t revision) {
  const auto fail = [](std::string text) {
    return VendError::withDomain(std::string(kErrorDomain), 1, std::move(text));
  };
  if (!entry.isDictionary()) return fail("not a dictionary");
  const PlistValue& identifier = entry["id"];
  if (!fits(identifier, FieldKind::UInt64) || identifier.uint64Value() == 0) {
    return fail("\"id\" is not a positive integer");
  }
  const std::string* name = entry["name"].string();
  if (!name || name->empty()) return fail("\"name\" is not a non-empty string");
  StoreLibraryItem item;
  item.cloudID = identifier.uint64Value();
  item.token = revision;
  if (const PlistValue& token = entry["token"]; !token.isNull()) {
    if (!fits(token, FieldKind::UInt32)) return fail("\"token\" is not a 32-bit number");
    item.token = static_cast<std::uint32_t>(token.uint64Value());
  }
  if (const PlistValue& kind = entry["media-kind"]; !kind.isNull()) {
    if (!fits(kind, FieldKind::UInt32)) return fail("\"media-kind\" is not a 32-bit number");
    item.mediaKind = kind.int64Value();
  }
  if (const PlistValue& preorder = entry["pre-order"]; !preorder.isNull()) {
    if (!preorder.isBoolean()) return fail("\"pre-order\" is not a boolean");
    item.preorder = preorder.boolValue();
  }
  std::string fieldError;
  if (!takeFields(entry, kItemFields, item.fields, &fieldError) ||
      !takeFields(entry, kFlavorFields, item.fields, &fieldError)) {
    return fail(fieldError);
  }
  return item;
}

void StoreLibraryItem::writeTo(DAAPBuffer& buffer) const {
  DAAPContainerScope listingItem(buffer, "mlit"_dmap);
  buffer.appendUInt8(kItemKind, "mikd"_dmap);
  buffer.appendUInt64(cloudID, "miid"_dmap);
  buffer.appendUInt32(token, "aeto"_dmap);
  if (mediaKind) buffer.appendUInt32(static_cast<std::uint32_t>(*mediaKind), "aeMk"_dmap);
  writeFields(buffer, kItemFields, fields);
  if (hasAnyOf(kFlavorFields, fields)) writeFlavor(buffer);
}

void StoreLibraryItem::writeFlavor(DAAPBuffer& buffer) const {
  DAAPContainerScope flavors(buffer, "aefl"_dmap);
  DAAPContainerScope flavor(buffer, "aeif"_dmap);
  writeFields(buffer, kFlavorFields, fields);
}

}  // namespace larder
