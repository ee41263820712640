#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// What the metadata index knows of an application bundle. Every attribute is read afresh from
// the bundle on disk; nothing is cached between reads.
//
// | Attribute                             | Type    | Value                                      |
// |---------------------------------------|---------|--------------------------------------------|
// | "kHostItemPath"                       | string  | path of the bundle, as found in its        |
// |                                       |         | application folder                         |
// | "kHostItemContentType"                | string  | "com.orvane.application-bundle": the item  |
// |                                       |         | is a folder whose name ends in ".app"      |
// | "kHostItemHostBundleIdentifier"       | string  | bundle.plist HostBundleIdentifier          |
// | "kHostItemVersion"                    | string  | bundle.plist HostBundleShortVersionString, |
// |                                       |         | else HostBundleVersion                     |
// | "kHostItemQuaymartIsDeveloperSigned"  | integer | 1 when bundle.plist                        |
// |                                       |         | HostBundleDeveloperSigned is true, else 0  |
// | "kHostItemQuaymartHasPurchaseRecord"  | integer | 1 when purchase.plist is a readable        |
// |                                       |         | dictionary, else 0                         |
// | "kHostItemQuaymartWareID"             | real    | purchase.plist wareID                      |
// | "kHostItemQuaymartInstallerVersionID" | integer | purchase.plist installerVersionID          |
// | "_kHostItemQuaymartRefID"             | string  | purchase.plist opaqueAccountIDString       |
// | "kHostItemQuaymartPurchaseDate"       | date    | purchase.plist purchaseDate                |
//
// A value of the wrong type is absent. wareID and installerVersionID may also be strings that
// hold a whole decimal number, as some installers write them. A file that is missing, not a
// regular file (a pipe never blocks the reader), larger than 1 MiB or not a property list counts
// as absent, so a damaged bundle still has its path, content type and the two flags.
class MetadataAttributes {
 public:
  static constexpr std::string_view kPath = "kHostItemPath";
  static constexpr std::string_view kContentType = "kHostItemContentType";
  static constexpr std::string_view kBundleIdentifier = "kHostItemHostBundleIdentifier";
  static constexpr std::string_view kVersion = "kHostItemVersion";
  static constexpr std::string_view kIsDeveloperSigned = "kHostItemQuaymartIsDeveloperSigned";
  static constexpr std::string_view kHasPurchaseRecord = "kHostItemQuaymartHasPurchaseRecord";
  static constexpr std::string_view kWareID = "kHostItemQuaymartWareID";
  static constexpr std::string_view kInstallerVersionID = "kHostItemQuaymartInstallerVersionID";
  static constexpr std::string_view kAccountReference = "_kHostItemQuaymartRefID";
  static constexpr std::string_view kPurchaseDate = "kHostItemQuaymartPurchaseDate";

  static constexpr std::string_view kApplicationBundleContentType = "com.orvane.application-bundle";
  static constexpr std::size_t kMaxSourceFileBytes = 1u << 20u;

  struct Reading {
    PlistDictionary attributes;
    // False while bundle.plist is missing or damaged, as it is in a bundle still being copied in.
    bool hasInformationPropertyList = false;
  };

  // Attributes of the bundle folder at `path`; nullopt when `path` is not a folder (any more).
  static std::optional<Reading> readBundle(const std::string& path);

  // The same from contents already read: a null value stands for a file that could not be read.
  static PlistDictionary fromPropertyLists(const std::string& path, const PlistValue& info,
                                           const PlistValue& purchase);

  // True when the file of that name inside a bundle feeds its attributes.
  static bool isSourceFileName(std::string_view fileName);

  // True for a folder name that makes the folder an application bundle.
  static bool isBundleName(std::string_view name);
};

}  // namespace larder
