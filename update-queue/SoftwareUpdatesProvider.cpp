#include "update-queue/SoftwareUpdatesProvider.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/services/VendPropertyListProvider.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "SoftwareUpdatesProvider";

PlistArray dictionariesOf(const SoftwareUpdatesProvider::UpdateList& updates) {
  PlistArray dictionaries;
  dictionaries.reserve(updates.size());
  for (const LedgerUpdateRef& update : updates) dictionaries.emplace_back(update->dictionary());
  return dictionaries;
}

const PlistArray* arrayIn(const PlistDictionary& dictionary, std::string_view key) {
  auto found = dictionary.find(key);
  return found == dictionary.end() ? nullptr : found->second.array();
}

}  // namespace

bool SoftwareUpdatesProvider::parseData(const PlistData& data, OptionalError* error) {
  VendPropertyListProvider inner(storeClient());
  inner.configureFromProvider(*this);
  inner.setShouldProcessDownloads(false);
  inner.setResponse(response());
  if (!inner.parseData(data, error)) return false;
  if (TillDebugLevel() != 0) {
    TILL_LOG(2, "%@: Writing update queue response", kSpeaker);
    TILL_LOG_PLIST(2, inner.output(), "UpdatesResponse");
  }
  if (const PlistDictionary* answer = inner.output().dictionary()) {
    takeListsFrom(*answer);
    migrateOutputFromSubProvider(inner);
  }
  setOutput(makeOutput());
  return true;
}

void SoftwareUpdatesProvider::takeListsFrom(const PlistDictionary& answer) {
  // A key of another type leaves its list as it was.
  if (const PlistArray* items = arrayIn(answer, "items")) {
    availableUpdates_ = copyUpdatesFromItems(*items);
  }
  if (const PlistArray* items = arrayIn(answer, "incompatible-items")) {
    incompatibleUpdates_ = copyUpdatesFromItems(*items);
  }
}

PlistDictionary SoftwareUpdatesProvider::makeOutput() const {
  PlistDictionary output;
  if (availableUpdates_) {
    output.emplace(kAvailableUpdatesKey, dictionariesOf(*availableUpdates_));
  }
  if (incompatibleUpdates_) {
    output.emplace(kIncompatibleUpdatesKey, dictionariesOf(*incompatibleUpdates_));
  }
  return output;
}

SoftwareUpdatesProvider::UpdateList SoftwareUpdatesProvider::copyUpdatesFromItems(
    const PlistArray& items) {
  UpdateList updates;
  updates.reserve(items.size());
  for (const PlistValue& item : items) {
    const PlistDictionary* dictionary = item.dictionary();
    if (!dictionary) continue;
    if (auto update = LedgerUpdate::initWithDictionary(*dictionary)) {
      updates.push_back(std::move(update));
    }
  }
  return updates;
}

std::optional<SoftwareUpdatesProvider::UpdateList> SoftwareUpdatesProvider::updatesFromOutput(
    const PlistValue& output, std::string_view key) {
  const PlistArray* items = output[key].array();
  if (!items) return std::nullopt;
  return copyUpdatesFromItems(*items);
}

}  // namespace larder
