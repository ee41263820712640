#include "store-runtime/download/VendPreflightCheck.h"

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/http/VendHTTPTransfer.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendPreflightCheck";
constexpr std::size_t kMaxAnswerBytes = 1u << 20u;

VendPreflightCheck::Answer refused(VendError error) {
  TILL_LOG(1, "%@: %@", kSpeaker, error.descriptionText());
  return {false, PlistValue(error.toDictionary())};
}

VendPreflightCheck::Answer refused(std::uint64_t itemIdentifier, const std::string& why) {
  return refused(VendDownloadError::make(
      VendDownloadError::kPreflightFailed,
      "Preflight of item " + std::to_string(itemIdentifier) + " failed: " + why));
}

const std::string* stringEntry(const PlistValue& info, std::string_view key) {
  return info[key].string();
}

// Whether `system` satisfies `minimum`. A system known only by its major
// version is compared by major versions: "12" satisfies "12.3".
bool satisfies(const std::string& system, const std::string& minimum, bool majorOnly) {
  if (majorOnly) {
    const std::string minimumMajor = VendDevice::majorVersionOf(minimum);
    if (!minimumMajor.empty()) return compareVersionStrings(system, minimumMajor) >= 0;
  }
  return compareVersionStrings(system, minimum) >= 0;
}

}  // namespace

std::string VendPreflightCheck::systemVersionFrom(const PlistValue& systemVersionInfo,
                                                  bool& majorOnly) {
  majorOnly = false;
  if (const std::string* text = systemVersionInfo.string(); text && !text->empty()) return *text;
  for (std::string_view key : {"SystemVersion", "ProductVersion"}) {
    if (const std::string* text = stringEntry(systemVersionInfo, key); text && !text->empty()) {
      return *text;
    }
  }
  majorOnly = true;
  return VendDevice::osMajorVersionString();
}

VendPreflightCheck::Answer VendPreflightCheck::run(std::uint64_t itemIdentifier,
                                                   const std::string& url,
                                                   const PlistValue& systemVersionInfo,
                                                   const Settings& settings) {
  if (url.empty()) return refused(itemIdentifier, "there is no preflight URL");
  VendURLRequest request(url);
  request.setTimeoutInterval(settings.requestTimeout);
  VendHTTPTransfer::Options options;
  options.connectTimeout = settings.connectTimeout;
  options.maximumBodySize = kMaxAnswerBytes;
  const VendHTTPTransfer::Result result = VendHTTPTransfer::perform(request, options);
  if (result.error) {
    VendError error = *result.error;
    error.description = "Preflight of item " + std::to_string(itemIdentifier) + " at " + url +
                        " failed: " + error.description;
    return refused(std::move(error));
  }
  if (!result.response.isSuccess()) {
    return refused(itemIdentifier,
                   url + " answered HTTP " + std::to_string(result.response.statusCode));
  }
  auto answer = PropertyListSerialization::read(result.body);
  if (!answer || !answer->isDictionary()) {
    return refused(
        itemIdentifier,
        url + " did not answer with a dictionary" +
            (answer.errorDescription().empty() ? "" : " (" + answer.errorDescription() + ")"));
  }
  const PlistValue& allowed = (*answer)["allowed"];
  if (!allowed.isBoolean() && !allowed.isInteger()) {
    return refused(itemIdentifier, url + " gave no \"allowed\" verdict");
  }
  if (!allowed.boolValue())
    return refused(itemIdentifier, "the store does not allow it on this system");
  if (const std::string* minimum = (*answer)["minimumSystemVersion"].string();
      minimum && !minimum->empty()) {
    bool majorOnly = false;
    const std::string system = systemVersionFrom(systemVersionInfo, majorOnly);
    if (system.empty()) {
      TILL_LOG(1, "%@: The system version is unknown; not comparing it with %@ for item %llu",
               kSpeaker, *minimum, itemIdentifier);
    } else if (!satisfies(system, *minimum, majorOnly)) {
      return refused(itemIdentifier,
                     "it needs system version " + *minimum + " or later, this system is " + system);
    }
  }
  TILL_LOG(2, "%@: Item %llu may be installed", kSpeaker, itemIdentifier);
  return {true, PlistValue()};
}

}  // namespace larder
