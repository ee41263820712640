#include "larder-store/StoreUpdateCheck.h"

#include <array>
#include <set>

#include "larder-store/StoreAnswers.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/download/VendFileManager.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "StoreUpdateCheck";
constexpr std::array<std::string_view, 2> kReportedLists{"local-software", "bundled-software"};

StoreReply invalidRequest(std::string_view message) {
  return {400, StoreAnswers::failure("invalid-request", message), std::nullopt};
}

std::optional<std::uint64_t> reportedWareID(const PlistValue& wareID) {
  if (const std::string* text = wareID.string()) return unsignedDecimalNumber(*text);
  if (wareID.isInteger()) return wareID.uint64Value();
  return std::nullopt;
}

}  // namespace

const StoreItem* StoreUpdateCheck::itemForEntry(const PlistValue& entry) const {
  if (const auto wareID = reportedWareID(entry["ware-id"])) {
    if (const StoreItem* item = catalogue_.itemWithID(*wareID)) return item;
  }
  const std::string* bundleID = entry["HostBundleIdentifier"].string();
  return bundleID ? catalogue_.itemWithBundleID(*bundleID) : nullptr;
}

bool StoreUpdateCheck::isNewerThanReported(const StoreItem& item, const PlistValue& entry) {
  const std::string* installed = entry["HostBundleShortVersionString"].string();
  return !installed || compareVersionStrings(item.version, *installed) > 0;
}

PlistDictionary StoreUpdateCheck::updateItem(const StoreItem& item, const PlistValue& entry) {
  PlistDictionary update{
      {"ware-id", item.wareID},
      {"bundle-id", item.bundleID},
      {"title", item.title},
      {"version", item.version},
      {"action-params", item.actionParams},
      {"release-date", item.releaseDate},
  };
  if (const std::string* installed = entry["HostBundleShortVersionString"].string()) {
    update.emplace("installed-version", *installed);
  }
  return update;
}

StoreReply StoreUpdateCheck::answer(const std::optional<std::string>& body) const {
  if (!body) return invalidRequest("The request's body cannot be decoded.");
  const auto report = PropertyListSerialization::read(*body);
  if (!report || !report->isDictionary()) {
    TILL_LOG(2, "%@: refusing a report that is no dictionary: %@", kSpeaker,
             report ? std::string("wrong shape") : report.errorDescription());
    return invalidRequest("The request is not a dictionary of installed software.");
  }
  PlistArray items;
  PlistArray incompatibleItems;
  std::set<std::uint64_t> listed;
  for (std::string_view list : kReportedLists) {
    const PlistArray* entries = (*report)[list].array();
    if (!entries) continue;
    for (const PlistValue& entry : *entries) {
      const StoreItem* item = itemForEntry(entry);
      if (!item || !isNewerThanReported(*item, entry) || !listed.insert(item->wareID).second) {
        continue;
      }
      (item->incompatible ? incompatibleItems : items).emplace_back(updateItem(*item, entry));
    }
  }
  TILL_LOG(2, "%@: %lu updates and %lu incompatible ones", kSpeaker,
           static_cast<unsigned long>(items.size()),
           static_cast<unsigned long>(incompatibleItems.size()));
  const PlistArray& extras = catalogue_.extraUpdateItems();
  items.insert(items.end(), extras.begin(), extras.end());
  return {200,
          PlistDictionary{{"items", std::move(items)},
                          {"incompatible-items", std::move(incompatibleItems)}},
          std::nullopt};
}

}  // namespace larder
