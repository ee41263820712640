#include "tools/larderctl/PreferencesCommand.h"

#include <CLI/CLI.hpp>
#include <charconv>
#include <cmath>
#include <iostream>
#include <nlohmann/json.hpp>

#include "platform/plist/JsonConversion.h"
#include "store-runtime/records/RecordDateText.h"
#include "tools/larderctl/ExitStatus.h"

namespace larder {
namespace {

template <typename Number>
std::optional<Number> numberIn(const std::string& word) {
  Number value{};
  const char* end = word.data() + word.size();
  const auto [stop, error] = std::from_chars(word.data(), end, value);
  if (word.empty() || error != std::errc() || stop != end) return std::nullopt;
  if constexpr (std::is_floating_point_v<Number>) {
    if (!std::isfinite(value)) return std::nullopt;
  }
  return value;
}

std::optional<PlistValue> jsonIn(const std::string& word) {
  nlohmann::json json = nlohmann::json::parse(word, nullptr, false);
  if (json.is_discarded() || !json.is_structured()) return std::nullopt;
  return JsonConversion::fromJson(json);
}

std::optional<PlistValue> typedValue(const std::string& word, std::string_view type) {
  if (type == "string") return PlistValue(word);
  if (type == "bool") {
    if (word == "true" || word == "yes" || word == "1") return PlistValue(true);
    if (word == "false" || word == "no" || word == "0") return PlistValue(false);
    return std::nullopt;
  }
  if (type == "integer") return numberIn<std::int64_t>(word);
  if (type == "real") return numberIn<double>(word);
  if (type == "date") return RecordDateText::parse(word);
  return jsonIn(word);
}

PlistValue guessedValue(const std::string& word) {
  if (word == "true" || word == "false") return word == "true";
  if (auto integer = numberIn<std::int64_t>(word)) return *integer;
  if (auto real = numberIn<double>(word)) return *real;
  if (word.size() >= 10 && word[4] == '-') {
    if (auto date = RecordDateText::parse(word)) return *date;
  }
  if (word.starts_with('[') || word.starts_with('{')) {
    if (auto json = jsonIn(word)) return std::move(*json);
  }
  return word;
}

// "KEY in DOMAIN (scope S)", for the lines that say what went wrong.
std::string place(const PreferencesOptions& options) {
  return options.key + " in " + options.domain + " (scope " + options.scope + ")";
}

}  // namespace

PlistValue PreferencesCommand::valueOf(const std::string& word, std::string_view type) {
  if (type.empty()) return guessedValue(word);
  std::optional<PlistValue> value = typedValue(word, type);
  if (!value) {
    throw CLI::ValidationError("'" + word + "' is not a value of type " + std::string(type));
  }
  return std::move(*value);
}

PreferenceScope PreferencesCommand::scopeOf(const PreferencesOptions& options) {
  if (options.scope == "user") return PreferenceScope::User;
  if (options.scope == "system") return PreferenceScope::System;
  return PreferenceScope::App;
}

void PreferencesCommand::print(const PlistValue& value) const {
  const nlohmann::json json = JsonConversion::toJson(value, JsonConversion::DateStyle::ISO8601);
  if (json_) {
    std::cout << json.dump() << std::endl;
  } else if (json.is_string()) {
    std::cout << json.get<std::string>() << std::endl;
  } else {
    std::cout << json.dump(2) << std::endl;
  }
}

int PreferencesCommand::run(std::string_view action, const PreferencesOptions& options) const {
  if (!PreferenceStore::isValidDomain(options.domain)) {
    throw CLI::ValidationError("'" + options.domain +
                               "' is not a preference domain (a file name such as " +
                               "com.orvane.larderd)");
  }
  if (action == "set") return set(options);
  if (action == "delete") return remove(options);
  return get(options);
}

int PreferencesCommand::get(const PreferencesOptions& options) const {
  const PreferenceScope scope = scopeOf(options);
  if (options.key.empty()) {
    print(PreferenceStore::valuesForDomain(options.domain, scope));
    return kExitSuccess;
  }
  const PlistValue value = PreferenceStore::valueForKey(options.key, options.domain, scope);
  if (value.isNull()) {
    if (json_) std::cout << "null" << std::endl;
    std::cerr << "larderctl: no preference " << place(options) << std::endl;
    return kExitFailure;
  }
  print(value);
  return kExitSuccess;
}

int PreferencesCommand::set(const PreferencesOptions& options) const {
  const Result<void> stored = PreferenceStore::setValue(
      options.key, valueOf(options.value, options.type), options.domain, scopeOf(options));
  if (!stored) {
    std::cerr << "larderctl: cannot set " << place(options) << ": " << stored.errorDescription()
              << std::endl;
    return kExitFailure;
  }
  return kExitSuccess;
}

int PreferencesCommand::remove(const PreferencesOptions& options) const {
  const PreferenceScope scope = scopeOf(options);
  const bool present =
      !PreferenceStore::valueForKey(options.key, options.domain,
                                    scope == PreferenceScope::App ? PreferenceScope::User : scope)
           .isNull();
  if (!present) {
    std::cerr << "larderctl: no preference " << place(options) << std::endl;
    return kExitNothingToDo;
  }
  const Result<void> removed = PreferenceStore::removeValue(options.key, options.domain, scope);
  if (!removed) {
    std::cerr << "larderctl: cannot delete " << place(options) << ": " << removed.errorDescription()
              << std::endl;
    return kExitFailure;
  }
  return kExitSuccess;
}

}  // namespace larder
