#include "client/DBusValueCodec.h"

#include <algorithm>
#include <array>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/Types.h>

#include "client/ServiceError.h"

namespace larder {

namespace {

[[noreturn]] void refuse(const std::string& why) {
  throw ServiceError::invalidArguments(why);
}

// Length of the complete type that starts at `signature[0]`.
std::size_t completeTypeLength(std::string_view signature) {
  if (signature.empty()) refuse("empty signature");
  switch (signature[0]) {
    case 'a':
      return 1 + completeTypeLength(signature.substr(1));
    case '(':
    case '{': {
      char open = signature[0];
      char close = open == '(' ? ')' : '}';
      std::size_t depth = 0;
      for (std::size_t i = 0; i < signature.size(); ++i) {
        if (signature[i] == open) ++depth;
        if (signature[i] == close && --depth == 0) return i + 1;
      }
      refuse("unbalanced signature");
    }
    default:
      return 1;
  }
}

// A property list keeps no unsigned kind below 2^63, so the keys of
// record fields that are uint64 say it: their values travel as `t`, as the
// documented types promise, whatever their size.
bool isUnsignedField(std::string_view key) {
  static constexpr std::array<std::string_view, 9> kKeys = {
      "accountID",           "accountIdentifier",  "daapItemIdentifier",
      "daapPurchasedToken",  "downloadAssetSize",  "itemIdentifier",
      "oaxenItemIdentifier", "publicationVersion", "ware-id"};
  return std::ranges::find(kKeys, key) != kKeys.end();
}

std::string signatureInDictionary(std::string_view key, const PlistValue& value) {
  const bool nonNegative = value.type() == PlistValue::Type::UnsignedInteger ||
                           (value.type() == PlistValue::Type::Integer && value.int64Value() >= 0);
  if (nonNegative && isUnsignedField(key)) return "t";
  return DBusValueCodec::naturalSignature(value);
}

template <typename T>
T readBasic(sdbus::Message& message) {
  T value{};
  message >> value;
  if (!message) refuse("argument missing");
  return value;
}

class Reader {
 public:
  explicit Reader(sdbus::Message& message) : message_(message) {}

  PlistValue read(std::string_view signature, std::size_t depth) {
    if (depth > DBusValueCodec::kMaxDepth) refuse("value nested too deeply");
    switch (signature[0]) {
      case 'y':
        return std::int64_t{readBasic<std::uint8_t>(message_)};
      case 'b':
        return readBasic<bool>(message_);
      case 'n':
        return std::int64_t{readBasic<std::int16_t>(message_)};
      case 'q':
        return std::int64_t{readBasic<std::uint16_t>(message_)};
      case 'i':
        return std::int64_t{readBasic<std::int32_t>(message_)};
      case 'u':
        return std::int64_t{readBasic<std::uint32_t>(message_)};
      case 'x':
        return readBasic<std::int64_t>(message_);
      case 't':
        return readBasic<std::uint64_t>(message_);
      case 'd':
        return readBasic<double>(message_);
      case 's':
        return readBasic<std::string>(message_);
      case 'o':
        return std::string(readBasic<sdbus::ObjectPath>(message_));
      case 'g':
        return std::string(readBasic<sdbus::Signature>(message_));
      case 'v':
        return readVariant(depth);
      case 'a':
        return readArray(signature.substr(1), depth);
      case '(':
        return readStruct(signature, depth);
      default:
        refuse("unsupported type " + std::string(signature));
    }
  }

 private:
  PlistValue readVariant(std::size_t depth) {
    std::string type;
    std::string contents;
    message_.peekType(type, contents);
    if (type != "v" || contents.empty()) refuse("variant expected");
    message_.enterVariant(contents);
    PlistValue value = read(contents, depth + 1);
    message_.exitVariant();
    return value;
  }

  PlistValue readArray(std::string_view element, std::size_t depth) {
    if (element == "y") return readBytes();
    if (element.front() == '{') return readDictionary(element, depth);
    message_.enterContainer(std::string(element));
    if (!message_) refuse("array expected");
    PlistArray items;
    while (!atContainerEnd()) items.push_back(read(element, depth + 1));
    message_.clearFlags();
    message_.exitContainer();
    return items;
  }

  PlistValue readBytes() {
    std::vector<std::uint8_t> bytes;
    message_ >> bytes;
    if (!message_) refuse("byte array expected");
    return PlistData(std::move(bytes));
  }

  PlistValue readDictionary(std::string_view entry, std::size_t depth) {
    std::string_view inner = entry.substr(1, entry.size() - 2);
    std::size_t keyLength = completeTypeLength(inner);
    std::string_view keyType = inner.substr(0, keyLength);
    std::string_view valueType = inner.substr(keyLength);
    message_.enterContainer(std::string(entry));
    if (!message_) refuse("dictionary expected");
    PlistDictionary dictionary;
    while (!atContainerEnd()) {
      message_.enterDictEntry(std::string(inner));
      PlistValue key = read(keyType, depth + 1);
      PlistValue value = read(valueType, depth + 1);
      message_.exitDictEntry();
      std::string keyText = key.string() ? *key.string() : std::to_string(key.int64Value());
      dictionary.insert_or_assign(std::move(keyText), std::move(value));
    }
    message_.clearFlags();
    message_.exitContainer();
    return dictionary;
  }

  PlistValue readStruct(std::string_view signature, std::size_t depth) {
    std::string_view inner = signature.substr(1, signature.size() - 2);
    message_.enterStruct(std::string(inner));
    if (!message_) refuse("structure expected");
    PlistArray fields;
    for (const std::string& type : DBusValueCodec::splitSignature(inner)) {
      fields.push_back(read(type, depth + 1));
    }
    message_.exitStruct();
    return fields;
  }

  bool atContainerEnd() {
    std::string type;
    std::string contents;
    message_.peekType(type, contents);
    return type.empty() || type[0] == '\0';
  }

  sdbus::Message& message_;
};

class Writer {
 public:
  explicit Writer(sdbus::Message& message) : message_(message) {}

  void write(std::string_view signature, const PlistValue& value) {
    switch (signature[0]) {
      case 'b':
        message_ << value.boolValue();
        return;
      case 'y':
        message_ << static_cast<std::uint8_t>(value.int64Value());
        return;
      case 'n':
        message_ << static_cast<std::int16_t>(value.int64Value());
        return;
      case 'q':
        message_ << static_cast<std::uint16_t>(value.int64Value());
        return;
      case 'i':
        message_ << static_cast<std::int32_t>(value.int64Value());
        return;
      case 'u':
        message_ << static_cast<std::uint32_t>(value.int64Value());
        return;
      case 'x':
        message_ << value.int64Value();
        return;
      case 't':
        message_ << (value.uid() ? value.uid()->value : value.uint64Value());
        return;
      case 'd':
        message_ << (value.date() ? value.date()->secondsSince1970 : value.doubleValue());
        return;
      case 's':
        // Not a conditional expression: one of a reference and a temporary
        // copies the text of every string written.
        if (const std::string* text = value.string()) {
          message_ << *text;
        } else {
          message_ << std::string();
        }
        return;
      case 'o':
        message_ << sdbus::ObjectPath(value.string() && !value.string()->empty() ? *value.string()
                                                                                 : "/");
        return;
      case 'v':
        writeVariant(value, DBusValueCodec::naturalSignature(value));
        return;
      case 'a':
        writeArray(signature.substr(1), value);
        return;
      default:
        refuse("cannot write type " + std::string(signature));
    }
  }

 private:
  void writeVariant(const PlistValue& value, const std::string& contents) {
    message_.openVariant(contents);
    write(contents, value);
    message_.closeVariant();
  }

  void writeArray(std::string_view element, const PlistValue& value) {
    if (element == "y") {
      const PlistData* data = value.data();
      if (data != nullptr) {
        message_ << *data;
      } else {
        message_ << PlistData{};
      }
      return;
    }
    if (element.front() == '{') {
      writeDictionary(element, value);
      return;
    }
    message_.openContainer(std::string(element));
    if (const PlistArray* items = value.array()) {
      for (const PlistValue& item : *items) {
        if (!item.isNull()) write(element, item);
      }
    }
    message_.closeContainer();
  }

  void writeDictionary(std::string_view entry, const PlistValue& value) {
    const std::string inner(entry.substr(1, entry.size() - 2));
    const std::string_view valueType = std::string_view(inner).substr(1);
    const bool variants = valueType == "v";
    message_.openContainer(std::string(entry));
    if (const PlistDictionary* dictionary = value.dictionary()) {
      for (const auto& [key, element] : *dictionary) {
        if (element.isNull()) continue;
        message_.openDictEntry(inner);
        message_ << key;
        if (variants) {
          writeVariant(element, signatureInDictionary(key, element));
        } else {
          write(valueType, element);
        }
        message_.closeDictEntry();
      }
    }
    message_.closeContainer();
  }

  sdbus::Message& message_;
};

}  // namespace

std::vector<std::string> DBusValueCodec::splitSignature(std::string_view signature) {
  std::vector<std::string> types;
  while (!signature.empty()) {
    std::size_t length = completeTypeLength(signature);
    if (length > signature.size()) refuse("truncated signature");
    types.emplace_back(signature.substr(0, length));
    signature.remove_prefix(length);
  }
  return types;
}

PlistValue DBusValueCodec::read(sdbus::Message& message, std::string_view signature) {
  return Reader(message).read(signature, 0);
}

PlistArray DBusValueCodec::readAll(sdbus::Message& message, std::string_view signature) {
  PlistArray values;
  Reader reader(message);
  for (const std::string& type : splitSignature(signature)) values.push_back(reader.read(type, 0));
  return values;
}

void DBusValueCodec::write(sdbus::Message& message, std::string_view signature,
                           const PlistValue& value) {
  Writer(message).write(signature, value);
}

void DBusValueCodec::writeAll(sdbus::Message& message, std::string_view signature,
                              const PlistArray& values) {
  Writer writer(message);
  std::size_t index = 0;
  for (const std::string& type : splitSignature(signature)) {
    writer.write(type, index < values.size() ? values[index] : PlistValue::null());
    ++index;
  }
}

std::string DBusValueCodec::naturalSignature(const PlistValue& value) {
  switch (value.type()) {
    case PlistValue::Type::Boolean:
      return "b";
    case PlistValue::Type::Integer:
      return "x";
    case PlistValue::Type::UnsignedInteger:
    case PlistValue::Type::Uid:
      return "t";
    case PlistValue::Type::Real:
    case PlistValue::Type::Date:
      return "d";
    case PlistValue::Type::Data:
      return "ay";
    case PlistValue::Type::Array:
      return "av";
    case PlistValue::Type::Dictionary:
      return "a{sv}";
    case PlistValue::Type::Null:
    case PlistValue::Type::String:
      return "s";
  }
  return "s";
}

void DBusValueCodec::reply(sdbus::MethodCall& call, std::string_view signature,
                           const PlistArray& values) {
  if (call.doesntExpectReply()) return;
  sdbus::MethodReply message = call.createReply();
  writeAll(message, signature, values);
  message.send();
}

}  // namespace larder
