#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"
#include "tests/integration/ServiceHarness.h"

namespace larder::testing {

// Writes a catalogue for larder-store into a temporary folder, which goes
// with the object. Packages are made from bundle folders by running
// `larder-store pack`, so every item is packed the way the store documents.
class StoreCatalogueBuilder {
 public:
  struct Account {
    std::uint64_t accountID = 0;
    std::string orvaneID;
    std::string password;
    std::string storeFrontID = "143441";
    std::optional<PlistData> signingKey;  // absent: the store derives one
    std::optional<std::string> opaqueID;  // absent: the store uses the account id
  };

  struct Item {
    std::uint64_t wareID = 0;
    std::string bundleID;
    std::string title;
    std::string version = "1.0";
    // The bundle folder to pack; empty: a bundle named after the title is
    // made, with `payloadBytes` bytes of executable in it.
    std::string bundlePath;
    std::size_t payloadBytes = 4096;
    std::optional<std::string> actionParams;
    std::optional<PlistDictionary> preflight;
    bool accountLess = false;
    // Further entries of item.plist; they win over the ones above.
    PlistDictionary extraEntries;
  };

  StoreCatalogueBuilder();

  // The catalogue folder to hand to the store.
  [[nodiscard]] std::string directory() const { return scratch_.directory() + "/catalogue"; }
  // A folder for anything else a test needs to lay out.
  [[nodiscard]] std::string scratchDirectory() const { return scratch_.directory() + "/scratch"; }

  void addAccount(const Account& account);
  // Packs the item's bundle and writes its entry; the package's path.
  std::string addItem(const Item& item);
  // store.plist: extra bag entries and the hash chunk size.
  void setStoreSettings(const PlistDictionary& bagExtras,
                        std::optional<std::uint64_t> chunkSize = std::nullopt);
  // store.plist exactly as given, for settings beyond those two
  // ("extraUpdateItems", ...) and for malformed ones.
  void writeStoreSettings(const PlistDictionary& settings) const;
  // Any file below the catalogue, for entries a test wants malformed.
  void writeFile(const std::string& relativePath, std::string_view contents) const;

  // A bundle folder "<scratch>/bundles/<name>.app" with bundle.plist, a
  // purchase record, and an executable of `payloadBytes` bytes that differ
  // from bundle to bundle.
  [[nodiscard]] std::string makeBundle(const std::string& name, const std::string& bundleID,
                                       const std::string& version, std::uint64_t wareID,
                                       std::size_t payloadBytes) const;
  // Runs `larder-store pack`; throws with its error output on failure.
  static void pack(const std::string& bundlePath, const std::string& packagePath);

 private:
  void writePlist(const std::string& relativePath, const PlistValue& value) const;

  TemporaryPlatform scratch_;
  PlistArray accounts_;
};

}  // namespace larder::testing
