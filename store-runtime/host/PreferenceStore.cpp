#include "store-runtime/host/PreferenceStore.h"

#include "platform/system/Environment.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::int64_t kInvalidDomainCode = 1;

PlistDictionary storedValues(std::string_view domain, PreferenceScope scope) {
  if (!PreferenceStore::isValidDomain(domain)) return {};
  return PlatformStateFile(PreferenceStore::pathFor(domain, scope)).readDictionary();
}

// A value that the scope's own file already holds as it is needs no write,
// and no wait for the disk: some values (the badge count) are stored at
// every change whether they changed or not. Only the file written counts,
// not the machine's fallback, so that a user's value outlives a later change
// of the machine's. A writer racing with this read is as if it had written
// just after the write that was left out.
bool isStoredAsItIs(std::string_view key, const PlistValue& value, std::string_view domain,
                    PreferenceScope scope) {
  PlistDictionary stored = storedValues(domain, scope);
  auto found = stored.find(key);
  if (value.isNull()) return found == stored.end();
  return found != stored.end() && found->second == value;
}

}  // namespace

bool PreferenceStore::isValidDomain(std::string_view domain) {
  return !domain.empty() && domain.front() != '.' &&
         domain.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::string PreferenceStore::pathFor(std::string_view domain, PreferenceScope scope) {
  std::string file = std::string(domain) + ".plist";
  if (scope == PreferenceScope::System) return Environment::rootedPath("/etc/larder/") + file;
  return Environment::userConfigDirectory() + "/" + file;
}

PlistValue PreferenceStore::valueForKey(std::string_view key, std::string_view domain,
                                        PreferenceScope scope) {
  PlistDictionary values = storedValues(domain, scope);
  if (auto found = values.find(key); found != values.end()) return std::move(found->second);
  if (scope != PreferenceScope::App) return {};
  return PlistValue(storedValues(domain, PreferenceScope::System))[key];
}

std::optional<bool> PreferenceStore::booleanForKey(std::string_view key, std::string_view domain,
                                                   PreferenceScope scope) {
  PlistValue value = valueForKey(key, domain, scope);
  if (!value.isBoolean()) return std::nullopt;
  return value.boolValue();
}

std::optional<double> PreferenceStore::numberForKey(std::string_view key, std::string_view domain,
                                                    PreferenceScope scope) {
  PlistValue value = valueForKey(key, domain, scope);
  if (!value.isInteger() && !value.isReal()) return std::nullopt;
  return value.doubleValue();
}

std::optional<std::string> PreferenceStore::stringForKey(std::string_view key,
                                                         std::string_view domain,
                                                         PreferenceScope scope) {
  PlistValue value = valueForKey(key, domain, scope);
  if (const std::string* text = value.string()) return *text;
  return std::nullopt;
}

std::optional<PlistDate> PreferenceStore::dateForKey(std::string_view key, std::string_view domain,
                                                     PreferenceScope scope) {
  PlistValue value = valueForKey(key, domain, scope);
  if (const PlistDate* date = value.date()) return *date;
  return std::nullopt;
}

PlistDictionary PreferenceStore::valuesForDomain(std::string_view domain, PreferenceScope scope) {
  PlistDictionary values = storedValues(domain, scope);
  if (scope == PreferenceScope::App) values.merge(storedValues(domain, PreferenceScope::System));
  return values;
}

Result<void> PreferenceStore::setValue(std::string_view key, PlistValue value,
                                       std::string_view domain, PreferenceScope scope) {
  if (!isValidDomain(domain)) {
    return VendError::withDomain(std::string(kErrorDomain), kInvalidDomainCode,
                                 "\"" + std::string(domain) + "\" is not a preference domain");
  }
  if (isStoredAsItIs(key, value, domain, scope)) return {};
  return PlatformStateFile(pathFor(domain, scope), PlatformStateFile::Format::Binary)
      .update([&](PlistValue& stored) {
        PlistDictionary values;
        if (PlistDictionary* existing = stored.dictionary()) values = std::move(*existing);
        if (value.isNull()) {
          values.erase(std::string(key));
        } else {
          values.insert_or_assign(std::string(key), std::move(value));
        }
        stored = PlistValue(std::move(values));
      });
}

Result<void> PreferenceStore::removeValue(std::string_view key, std::string_view domain,
                                          PreferenceScope scope) {
  return setValue(key, PlistValue(), domain, scope);
}

}  // namespace larder
