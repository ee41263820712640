#include "platform/KeyedArchive.h"

#include "platform/PropertyListSerialization.h"

namespace larder {

namespace {

constexpr std::string_view kArchiverKey = "$archiver";
constexpr std::string_view kArchiverName = "larder.KeyedArchive";
constexpr std::string_view kVersionKey = "$version";
constexpr std::string_view kTopKey = "$top";
constexpr std::string_view kRootKey = "root";
constexpr std::string_view kEntriesKey = "$entries";
constexpr std::string_view kItemsKey = "$items";
constexpr std::size_t kMaxDepth = 128;

using AllowedClasses = std::set<std::string, std::less<>>;

// Walks the archive once, checking every class against the allowed set and
// moving each subtree into the result: the archive is consumed, never
// copied, since a store can hold tens of thousands of records.
class SecureDecoder {
 public:
  SecureDecoder(const AllowedClasses& allowed, std::string* error)
      : allowed_(allowed), error_(error) {}

  std::optional<PlistValue> decode(PlistValue&& encoded, std::size_t depth) {
    if (depth > kMaxDepth) return refuse("archive nested too deeply");
    switch (encoded.type()) {
      case PlistValue::Type::String:
        return admit(KeyedArchive::kStringClass, std::move(encoded));
      case PlistValue::Type::Boolean:
      case PlistValue::Type::Integer:
      case PlistValue::Type::UnsignedInteger:
      case PlistValue::Type::Real:
        return admit(KeyedArchive::kNumberClass, std::move(encoded));
      case PlistValue::Type::Data:
        return admit(KeyedArchive::kDataClass, std::move(encoded));
      case PlistValue::Type::Date:
        return admit(KeyedArchive::kDateClass, std::move(encoded));
      case PlistValue::Type::Dictionary:
        return decodeObject(std::move(encoded), depth);
      default:
        return refuse("archive holds a value of no class");
    }
  }

 private:
  std::optional<PlistValue> decodeObject(PlistValue&& encoded, std::size_t depth) {
    std::string_view className = KeyedArchive::classNameOf(encoded);
    if (className.empty()) return refuse("archived object without class");
    if (!allowed_.contains(className)) {
      return refuse("class " + std::string(className) + " is not allowed here");
    }
    PlistDictionary& object = *encoded.dictionary();
    if (className == KeyedArchive::kDictionaryClass) return decodeDictionary(object, depth);
    if (className == KeyedArchive::kArrayClass) return decodeArray(object, depth);
    return std::move(encoded);  // a record: its class decodes its fields
  }

  std::optional<PlistValue> decodeDictionary(PlistDictionary& object, std::size_t depth) {
    auto found = object.find(kEntriesKey);
    PlistDictionary* entries = found == object.end() ? nullptr : found->second.dictionary();
    if (!entries) return refuse("archived dictionary without entries");
    PlistDictionary decoded;
    for (auto& [key, value] : *entries) {
      std::optional<PlistValue> element = decode(std::move(value), depth + 1);
      if (!element) return std::nullopt;
      decoded.emplace_hint(decoded.end(), key, std::move(*element));
    }
    return PlistValue(std::move(decoded));
  }

  std::optional<PlistValue> decodeArray(PlistDictionary& object, std::size_t depth) {
    auto found = object.find(kItemsKey);
    PlistArray* items = found == object.end() ? nullptr : found->second.array();
    if (!items) return refuse("archived array without items");
    PlistArray decoded;
    decoded.reserve(items->size());
    for (PlistValue& value : *items) {
      std::optional<PlistValue> element = decode(std::move(value), depth + 1);
      if (!element) return std::nullopt;
      decoded.push_back(std::move(*element));
    }
    return PlistValue(std::move(decoded));
  }

  std::optional<PlistValue> admit(std::string_view className, PlistValue&& value) {
    if (!allowed_.contains(className)) {
      return refuse("class " + std::string(className) + " is not allowed here");
    }
    return std::move(value);
  }

  std::optional<PlistValue> refuse(const std::string& why) {
    if (error_) *error_ = why;
    return std::nullopt;
  }

  const AllowedClasses& allowed_;
  std::string* error_;
};

// The root object inside "$top", to be moved out of the archive.
PlistValue* rootOf(PlistValue& archive) {
  PlistDictionary* top = archive.dictionary();
  auto topEntry = top ? top->find(kTopKey) : PlistDictionary::iterator{};
  if (!top || topEntry == top->end() || !topEntry->second.dictionary()) return nullptr;
  PlistDictionary& roots = *topEntry->second.dictionary();
  auto rootEntry = roots.find(kRootKey);
  return rootEntry == roots.end() ? nullptr : &rootEntry->second;
}

}  // namespace

PlistValue KeyedArchive::dictionary(PlistDictionary entries) {
  return PlistDictionary{{std::string(kClassKey), std::string(kDictionaryClass)},
                         {std::string(kEntriesKey), std::move(entries)}};
}

PlistValue KeyedArchive::array(PlistArray items) {
  return PlistDictionary{{std::string(kClassKey), std::string(kArrayClass)},
                         {std::string(kItemsKey), std::move(items)}};
}

PlistDictionary KeyedArchive::record(std::string_view className) {
  return PlistDictionary{{std::string(kClassKey), std::string(className)}};
}

std::string_view KeyedArchive::classNameOf(const PlistValue& encoded) {
  const std::string* name = encoded[kClassKey].string();
  return name ? std::string_view(*name) : std::string_view();
}

PlistData KeyedArchive::archivedData(const PlistValue& root) {
  PlistDictionary archive{
      {std::string(kArchiverKey), std::string(kArchiverName)},
      {std::string(kVersionKey), 1},
      {std::string(kTopKey), PlistDictionary{{std::string(kRootKey), root}}},
  };
  return PropertyListSerialization::writeBinary(archive);
}

std::optional<PlistValue> KeyedArchive::unarchivedRoot(std::span<const std::uint8_t> data,
                                                       const AllowedClasses& allowed,
                                                       std::string* error) {
  std::optional<PlistValue> archive = PropertyListSerialization::read(data, error);
  if (!archive) return std::nullopt;
  const std::string* archiver = (*archive)[kArchiverKey].string();
  if (!archiver || *archiver != kArchiverName) {
    if (error) *error = "not a keyed archive";
    return std::nullopt;
  }
  PlistValue* root = rootOf(*archive);
  if (!root || root->isNull()) {
    if (error) *error = "keyed archive without root object";
    return std::nullopt;
  }
  return SecureDecoder(allowed, error).decode(std::move(*root), 0);
}

}  // namespace larder
