#include "larder-store/StoreItem.h"
#include "store-runtime/core/VendStringHelpers.h"

#include <sys/stat.h>

#include <charconv>
#include <filesystem>

namespace larder {
namespace {

namespace fs = std::filesystem;

// A name that stays inside the item's folder.
bool isPlainFileName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

bool isRegularFile(const std::string& path) {
  std::error_code code;
  return fs::is_regular_file(path, code);
}

const std::string* nonEmptyString(const PlistValue& value) {
  const std::string* text = value.string();
  return text && !text->empty() ? text : nullptr;
}

PlistDate modificationDate(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return {};
  return PlistDate{static_cast<double>(status.st_mtim.tv_sec)};
}

bool fail(std::string* error, std::string why) {
  if (error) *error = std::move(why);
  return false;
}

bool readWareID(const PlistValue& entry, const std::string& folder, StoreItem& item,
                std::string* error) {
  const auto fromFolder = unsignedDecimalNumber(fs::path(folder).filename().string());
  const PlistValue& given = entry["ware-id"];
  if (given.isNull()) {
    if (!fromFolder || *fromFolder == 0)
      return fail(error, "no ware-id and the folder is no number");
    item.wareID = *fromFolder;
    return true;
  }
  if (!given.isInteger() || given.uint64Value() == 0) {
    return fail(error, "ware-id is not a positive integer");
  }
  item.wareID = given.uint64Value();
  if (fromFolder != item.wareID) return fail(error, "ware-id differs from the folder's name");
  return true;
}

bool readTexts(const PlistValue& entry, StoreItem& item, std::string* error) {
  for (const auto& [key, field] :
       {std::pair{"bundle-id", &item.bundleID}, std::pair{"title", &item.title},
        std::pair{"version", &item.version}}) {
    const std::string* text = nonEmptyString(entry[key]);
    if (!text) return fail(error, std::string("no ") + key);
    *field = *text;
  }
  const PlistValue& params = entry["action-params"];
  if (!params.isNull() && !params.isString()) return fail(error, "action-params is not a string");
  item.actionParams =
      params.isString() ? *params.string() : StoreItem::defaultActionParams(item.wareID);
  return true;
}

bool readFiles(const PlistValue& entry, StoreItem& item, std::string* error) {
  const std::string* package = nonEmptyString(entry["package"]);
  if (!package || !isPlainFileName(*package)) return fail(error, "no plain file name in package");
  item.packageName = *package;
  if (!isRegularFile(item.packagePath())) return fail(error, "the package file is missing");
  const PlistValue& thumbnail = entry["thumbnail"];
  if (thumbnail.isNull()) return true;
  if (!thumbnail.string() || !isPlainFileName(*thumbnail.string()) ||
      !isRegularFile(item.folder + "/" + *thumbnail.string())) {
    return fail(error, "thumbnail names no file of the item");
  }
  item.thumbnailName = *thumbnail.string();
  return true;
}

bool readOptions(const PlistValue& entry, StoreItem& item, std::string* error) {
  const PlistValue& date = entry["release-date"];
  if (!date.isNull() && !date.isDate()) return fail(error, "release-date is not a date");
  item.releaseDate = date.isDate() ? *date.date() : modificationDate(item.packagePath());

  const PlistValue& accountLess = entry["accountLess"];
  if (!accountLess.isNull() && !accountLess.isBoolean()) {
    return fail(error, "accountLess is not a boolean");
  }
  item.accountLess = accountLess.boolValue();

  const PlistValue& incompatible = entry["incompatible"];
  if (!incompatible.isNull() && !incompatible.isBoolean()) {
    return fail(error, "incompatible is not a boolean");
  }
  item.incompatible = incompatible.boolValue();

  const PlistValue& preflight = entry["preflight"];
  if (preflight.isNull()) return true;
  if (!preflight.isDictionary()) return fail(error, "preflight is not a dictionary");
  StoreItem::Preflight answer;
  if (!preflight["allowed"].isNull()) {
    if (!preflight["allowed"].isBoolean()) return fail(error, "preflight.allowed is not a boolean");
    answer.allowed = preflight["allowed"].boolValue();
  }
  if (!preflight["minimumSystemVersion"].isNull()) {
    const std::string* version = preflight["minimumSystemVersion"].string();
    if (!version) return fail(error, "preflight.minimumSystemVersion is not a string");
    answer.minimumSystemVersion = *version;
  }
  item.preflight = answer;
  return true;
}

}  // namespace

std::optional<std::string> StoreItem::assetPath(std::string_view name) const {
  if (name == packageName) return packagePath();
  if (thumbnailName && name == *thumbnailName) return folder + "/" + *thumbnailName;
  return std::nullopt;
}

Result<StoreItem> StoreItem::fromDictionary(const PlistValue& dictionary,
                                            const std::string& folder) {
  std::string why = "item.plist is not a dictionary";
  StoreItem item;
  item.folder = folder;
  if (!dictionary.isDictionary() || !readWareID(dictionary, folder, item, &why) ||
      !readTexts(dictionary, item, &why) || !readFiles(dictionary, item, &why) ||
      !readOptions(dictionary, item, &why)) {
    return VendError::withDomain(std::string(kErrorDomain), 1, why);
  }
  return item;
}

std::string StoreItem::defaultActionParams(std::uint64_t wareID) {
  return "productType=C&price=0&pricingParameters=STDRDL&itemId=" + std::to_string(wareID);
}

}  // namespace larder
