#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "larder-store/PackageDigest.h"
#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// One item of the catalogue: "items/<ware-id>/item.plist" and the package
// beside it.
struct StoreItem {
  struct Preflight {
    bool allowed = true;
    std::string minimumSystemVersion = "0";
  };

  std::uint64_t wareID = 0;
  std::string bundleID;
  std::string title;
  std::string version;
  std::string actionParams;
  PlistDate releaseDate;
  std::string folder;       // absolute path of the item's folder
  std::string packageName;  // file name inside `folder`
  std::optional<std::string> thumbnailName;
  // Present when the item asks for a preflight check before its download.
  std::optional<Preflight> preflight;
  bool accountLess = false;
  // The update check lists the item among the updates that cannot be
  // installed on the client's machine.
  bool incompatible = false;
  PackageDigest digest;  // filled by the catalogue

  [[nodiscard]] std::string packagePath() const { return folder + "/" + packageName; }
  // The file a request for `name` in the item's assets means, if any.
  [[nodiscard]] std::optional<std::string> assetPath(std::string_view name) const;
  // What the preflight route answers for this item.
  [[nodiscard]] Preflight preflightAnswer() const { return preflight.value_or(Preflight{}); }

  // Reads an item.plist found in `folder`; the folder's name must be the
  // ware id when the dictionary gives one, and is the ware id when it does
  // not. An error of kErrorDomain says what is malformed.
  static constexpr std::string_view kErrorDomain = "StoreItem";
  static Result<StoreItem> fromDictionary(const PlistValue& dictionary, const std::string& folder);

  // "itemId=<ware-id>&..." for an item whose catalogue entry names no buy
  // parameters.
  static std::string defaultActionParams(std::uint64_t wareID);
};

}  // namespace larder
