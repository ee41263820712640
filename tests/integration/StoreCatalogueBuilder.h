#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <stdexcept>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
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

  StoreCatalogueBuilder() {
    std::filesystem::create_directories(directory() + "/items");
    std::filesystem::create_directories(scratchDirectory());
  }

  // The catalogue folder to hand to the store.
  [[nodiscard]] std::string directory() const { return scratch_.directory() + "/catalogue"; }
  // A folder for anything else a test needs to lay out.
  [[nodiscard]] std::string scratchDirectory() const { return scratch_.directory() + "/scratch"; }

  void addAccount(const Account& account) {
    PlistDictionary entry{{"accountID", account.accountID},
                          {"orvaneID", account.orvaneID},
                          {"password", account.password},
                          {"storeFrontID", account.storeFrontID}};
    if (account.signingKey) entry.emplace("signingKey", *account.signingKey);
    if (account.opaqueID) entry.emplace("opaqueID", *account.opaqueID);
    accounts_.emplace_back(std::move(entry));
    writeFile("accounts.plist", PropertyListSerialization::writeXml(accounts_));
  }

  // Packs the item's bundle and writes its entry; the package's path.
  std::string addItem(const Item& item) {
    const std::string bundle =
        item.bundlePath.empty()
            ? makeBundle(item.title, item.bundleID, item.version, item.wareID, item.payloadBytes)
            : item.bundlePath;
    const std::string folder = "items/" + std::to_string(item.wareID);
    const std::string packageName = std::filesystem::path(bundle).stem().string() + ".tar";
    std::filesystem::create_directories(directory() + "/" + folder);
    const std::string packagePath = directory() + "/" + folder + "/" + packageName;
    pack(bundle, packagePath);
    PlistDictionary entry{{"ware-id", item.wareID},
                          {"bundle-id", item.bundleID},
                          {"title", item.title},
                          {"version", item.version},
                          {"release-date", PlistDate{1700000000}},
                          {"package", packageName}};
    if (item.actionParams) entry.emplace("action-params", *item.actionParams);
    if (item.preflight) entry.emplace("preflight", *item.preflight);
    if (item.accountLess) entry.emplace("accountLess", true);
    for (const auto& [key, value] : item.extraEntries) entry[key] = value;
    writeFile(folder + "/item.plist", PropertyListSerialization::writeXml(entry));
    return packagePath;
  }

  // store.plist: extra bag entries and the hash chunk size.
  void setStoreSettings(const PlistDictionary& bagExtras,
                        std::optional<std::uint64_t> chunkSize = std::nullopt) {
    PlistDictionary settings{{"bag", bagExtras}};
    if (chunkSize) settings.emplace("chunkSize", *chunkSize);
    writeStoreSettings(settings);
  }
  // store.plist exactly as given, for settings beyond those two
  // ("extraUpdateItems", ...) and for malformed ones.
  void writeStoreSettings(const PlistDictionary& settings) const {
    writeFile("store.plist", PropertyListSerialization::writeXml(settings));
  }
  // Any file below the catalogue, for entries a test wants malformed.
  void writeFile(const std::string& relativePath, std::string_view contents) const {
    if (!FileIO::writeAtomically(directory() + "/" + relativePath, contents)) {
      throw std::runtime_error("cannot write " + relativePath);
    }
  }

  // A bundle folder "<scratch>/bundles/<name>.app" with bundle.plist, a
  // purchase record, and an executable of `payloadBytes` bytes that differ
  // from bundle to bundle.
  [[nodiscard]] std::string makeBundle(const std::string& name, const std::string& bundleID,
                                       const std::string& version, std::uint64_t wareID,
                                       std::size_t payloadBytes) const {
    namespace fs = std::filesystem;
    const std::string folder = scratchDirectory() + "/bundles";
    fs::create_directories(folder);
    const std::string path = scratch_.installBundle({folder, name, bundleID, version, wareID});
    const std::string executable = path + "/bin/" + name;
    // Bytes that depend on the ware id, so that two bundles never share a package.
    std::string bytes(payloadBytes, '\0');
    std::uint64_t state = wareID * 0x9E3779B97F4A7C15ULL + 1;
    for (char& byte : bytes) {
      state ^= state << 13U;
      state ^= state >> 7U;
      state ^= state << 17U;
      byte = static_cast<char>(state & 0xFFU);
    }
    if (!FileIO::writeAtomically(executable, bytes)) {
      throw std::runtime_error("cannot write " + executable);
    }
    fs::permissions(executable, fs::perms::owner_all | fs::perms::group_read |
                                    fs::perms::group_exec | fs::perms::others_read |
                                    fs::perms::others_exec);
    return path;
  }

  // Runs `larder-store pack`; throws with its error output on failure.
  static void pack(const std::string& bundlePath, const std::string& packagePath) {
    const std::string errorPath = packagePath + ".pack-errors";
    const int status = ChildProcess({LARDER_STORE_PATH, "pack", bundlePath, packagePath}, {},
                                    "/dev/null", errorPath)
                           .wait();
    const std::string errors = readFile(errorPath);
    std::error_code code;
    std::filesystem::remove(errorPath, code);
    if (status != 0) {
      throw std::runtime_error("larder-store pack " + bundlePath + " failed: " + errors);
    }
  }

 private:
  TemporaryPlatform scratch_;
  PlistArray accounts_;
};

}  // namespace larder::testing
