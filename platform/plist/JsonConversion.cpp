#include "platform/plist/JsonConversion.h"

#include <array>
#include <cmath>
#include <ctime>

namespace larder {

namespace {

std::string base64(const PlistData& data) {
  static constexpr std::string_view kAlphabet =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  text.reserve((data.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < data.size(); i += 3) {
    std::uint32_t chunk = static_cast<std::uint32_t>(data[i]) << 16u;
    if (i + 1 < data.size()) chunk |= static_cast<std::uint32_t>(data[i + 1]) << 8u;
    if (i + 2 < data.size()) chunk |= data[i + 2];
    for (std::size_t j = 0; j < 4; ++j) {
      bool present = i + j <= data.size() && (j < 2 || i + j - 1 < data.size());
      text += present ? kAlphabet[(chunk >> (18 - 6 * j)) & 0x3Fu] : '=';
    }
  }
  return text;
}

}  // namespace

std::string JsonConversion::isoDate(PlistDate date) {
  const auto seconds = static_cast<std::time_t>(std::floor(date.secondsSince1970));
  std::tm utc{};
  if (::gmtime_r(&seconds, &utc) == nullptr) return {};
  std::array<char, 32> text{};
  const std::size_t length = std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%SZ", &utc);
  return std::string(text.data(), length);
}

nlohmann::json JsonConversion::toJson(const PlistValue& value, DateStyle dates) {
  switch (value.type()) {
    case PlistValue::Type::Null:
      return nullptr;
    case PlistValue::Type::Boolean:
      return value.boolValue();
    case PlistValue::Type::Integer:
      return value.int64Value();
    case PlistValue::Type::UnsignedInteger:
      return value.uint64Value();
    case PlistValue::Type::Real:
      return value.doubleValue();
    case PlistValue::Type::String:
      return *value.string();
    case PlistValue::Type::Data:
      return base64(*value.data());
    case PlistValue::Type::Date:
      return dates == DateStyle::ISO8601 ? nlohmann::json(isoDate(*value.date()))
                                         : nlohmann::json(value.date()->secondsSince1970);
    case PlistValue::Type::Uid:
      return value.uid()->value;
    case PlistValue::Type::Array: {
      nlohmann::json array = nlohmann::json::array();
      for (const PlistValue& element : *value.array()) array.push_back(toJson(element, dates));
      return array;
    }
    case PlistValue::Type::Dictionary: {
      nlohmann::json object = nlohmann::json::object();
      for (const auto& [key, element] : *value.dictionary()) object[key] = toJson(element, dates);
      return object;
    }
  }
  return nullptr;
}

PlistValue JsonConversion::fromJson(const nlohmann::json& json) {
  switch (json.type()) {
    case nlohmann::json::value_t::boolean:
      return json.get<bool>();
    case nlohmann::json::value_t::number_integer:
      return json.get<std::int64_t>();
    case nlohmann::json::value_t::number_unsigned:
      return json.get<std::uint64_t>();
    case nlohmann::json::value_t::number_float:
      return json.get<double>();
    case nlohmann::json::value_t::string:
      return json.get<std::string>();
    case nlohmann::json::value_t::array: {
      PlistArray array;
      for (const auto& element : json) array.push_back(fromJson(element));
      return array;
    }
    case nlohmann::json::value_t::object: {
      PlistDictionary dictionary;
      for (const auto& [key, element] : json.items()) dictionary.emplace(key, fromJson(element));
      return dictionary;
    }
    default:
      return {};
  }
}

}  // namespace larder
