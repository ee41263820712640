#include "tools/larderctl/CallArguments.h"

#include <CLI/CLI.hpp>
#include <charconv>
#include <cmath>

#include "client/DBusValueCodec.h"
#include "platform/plist/JsonConversion.h"

namespace larder {
namespace {

// Whole words only: "12abc" is not 12.
template <typename Number>
std::optional<Number> numberFrom(const std::string& word) {
  Number value{};
  const char* end = word.data() + word.size();
  const auto [stop, error] = std::from_chars(word.data(), end, value);
  if (word.empty() || error != std::errc() || stop != end) return std::nullopt;
  return value;
}

std::optional<PlistValue> valueFrom(const std::string& type, const std::string& word) {
  if (type == "s" || type == "o") return PlistValue(word);
  if (type == "b") {
    if (word == "true" || word == "yes" || word == "1") return PlistValue(true);
    if (word == "false" || word == "no" || word == "0") return PlistValue(false);
    return std::nullopt;
  }
  if (type == "x") {
    if (auto number = numberFrom<std::int64_t>(word)) return PlistValue(*number);
    return std::nullopt;
  }
  if (type == "t") {
    if (auto number = numberFrom<std::uint64_t>(word)) return PlistValue(*number);
    return std::nullopt;
  }
  if (type == "d") {
    if (auto number = numberFrom<double>(word); number && std::isfinite(*number))
      return PlistValue(*number);
    return std::nullopt;
  }
  const nlohmann::json document = nlohmann::json::parse(word, nullptr, false);
  if (document.is_discarded()) return std::nullopt;
  return JsonConversion::fromJson(document);
}

std::string typeName(const std::string& type) {
  if (type == "s") return "a string";
  if (type == "o") return "an object path";
  if (type == "b") return "true or false";
  if (type == "x") return "a whole number";
  if (type == "t") return "a whole number from 0 to 18446744073709551615";
  if (type == "d") return "a number";
  return "JSON";
}

}  // namespace

PlistArray CallArguments::parse(const RequestSignature& request,
                                const std::vector<std::string>& words) {
  const std::vector<std::string> types = DBusValueCodec::splitSignature(request.inSignature);
  if (types.size() != words.size()) {
    throw CLI::ValidationError(std::string(request.member) + " takes " +
                               std::to_string(types.size()) + " argument(s) of signature '" +
                               std::string(request.inSignature) + "', not " +
                               std::to_string(words.size()));
  }
  PlistArray arguments;
  for (std::size_t index = 0; index < types.size(); ++index) {
    std::optional<PlistValue> value = valueFrom(types[index], words[index]);
    if (!value) {
      throw CLI::ValidationError("argument " + std::to_string(index + 1) + " of " +
                                 std::string(request.member) + " (" + types[index] + ") must be " +
                                 typeName(types[index]) + ", not '" + words[index] + "'");
    }
    arguments.push_back(std::move(*value));
  }
  return arguments;
}

}  // namespace larder
