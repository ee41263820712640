#include "running-apps/RunningApplicationFacts.h"

#include <algorithm>

#include "platform/value/PlistValue.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

PlistDictionary facts() {
  return PlatformStateFile::named(RunningApplicationFacts::kFileName).readDictionary();
}

bool arrayHolds(const PlistValue& array, std::string_view text) {
  const PlistArray* values = array.array();
  if (!values) return false;
  return std::any_of(values->begin(), values->end(), [&](const PlistValue& value) {
    return value.string() && *value.string() == text;
  });
}

bool setArrayMember(std::string_view key, std::string_view bundleIdentifier, bool member) {
  return PlatformStateFile::named(RunningApplicationFacts::kFileName)
      .updateDictionary([&](PlistDictionary& dictionary) {
        PlistArray values;
        if (const PlistArray* old = dictionary[std::string(key)].array()) values = *old;
        std::erase_if(values, [&](const PlistValue& value) {
          return value.string() && *value.string() == bundleIdentifier;
        });
        if (member) values.emplace_back(bundleIdentifier);
        dictionary[std::string(key)] = std::move(values);
      });
}

}  // namespace

std::optional<std::string> RunningApplicationFacts::foremost() {
  const PlistValue all(facts());
  const std::string* value = all["foremost"].string();
  return value ? std::optional<std::string>(*value) : std::nullopt;
}

bool RunningApplicationFacts::setForemost(const std::optional<std::string>& bundleIdentifier) {
  return PlatformStateFile::named(kFileName).updateDictionary([&](PlistDictionary& dictionary) {
    if (bundleIdentifier) {
      dictionary["foremost"] = *bundleIdentifier;
    } else {
      dictionary.erase("foremost");
    }
  });
}

std::optional<std::string> RunningApplicationFacts::quittingLosesData(
    std::string_view bundleIdentifier) {
  const PlistDictionary all = facts();
  auto reasons = all.find("quittingLosesData");
  if (reasons == all.end()) return std::nullopt;
  const std::string* reason = reasons->second[bundleIdentifier].string();
  return reason ? std::optional<std::string>(*reason) : std::nullopt;
}

bool RunningApplicationFacts::setQuittingLosesData(std::string_view bundleIdentifier,
                                                   const std::optional<std::string>& reason) {
  return PlatformStateFile::named(kFileName).updateDictionary([&](PlistDictionary& dictionary) {
    PlistDictionary reasons;
    if (const PlistDictionary* old = dictionary["quittingLosesData"].dictionary()) reasons = *old;
    if (reason) {
      reasons[std::string(bundleIdentifier)] = *reason;
    } else {
      reasons.erase(std::string(bundleIdentifier));
    }
    dictionary["quittingLosesData"] = std::move(reasons);
  });
}

bool RunningApplicationFacts::isStopped(std::string_view bundleIdentifier) {
  const PlistDictionary all = facts();
  auto found = all.find("stopped");
  return found != all.end() && arrayHolds(found->second, bundleIdentifier);
}

bool RunningApplicationFacts::setStopped(std::string_view bundleIdentifier, bool stopped) {
  return setArrayMember("stopped", bundleIdentifier, stopped);
}

bool RunningApplicationFacts::isProxied(std::string_view bundleIdentifier) {
  const PlistDictionary all = facts();
  auto found = all.find("proxied");
  return found != all.end() && arrayHolds(found->second, bundleIdentifier);
}

bool RunningApplicationFacts::setProxied(std::string_view bundleIdentifier, bool proxied) {
  return setArrayMember("proxied", bundleIdentifier, proxied);
}

}  // namespace larder
