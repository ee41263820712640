#include "tests/integration/StoreCatalogueBuilder.h"

#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

// Bytes that depend on the seed, so that two bundles never share a package.
std::string payload(std::size_t size, std::uint64_t seed) {
  std::string bytes(size, '\0');
  std::uint64_t state = seed * 0x9E3779B97F4A7C15ULL + 1;
  for (char& byte : bytes) {
    state ^= state << 13U;
    state ^= state >> 7U;
    state ^= state << 17U;
    byte = static_cast<char>(state & 0xFFU);
  }
  return bytes;
}

}  // namespace

StoreCatalogueBuilder::StoreCatalogueBuilder() {
  fs::create_directories(directory() + "/items");
  fs::create_directories(scratchDirectory());
}

void StoreCatalogueBuilder::writePlist(const std::string& relativePath,
                                       const PlistValue& value) const {
  writeFile(relativePath, PropertyListSerialization::writeXml(value));
}

void StoreCatalogueBuilder::writeFile(const std::string& relativePath,
                                      std::string_view contents) const {
  if (!FileIO::writeAtomically(directory() + "/" + relativePath, contents)) {
    throw std::runtime_error("cannot write " + relativePath);
  }
}

void StoreCatalogueBuilder::addAccount(const Account& account) {
  PlistDictionary entry{{"accountID", account.accountID},
                        {"orvaneID", account.orvaneID},
                        {"password", account.password},
                        {"storeFrontID", account.storeFrontID}};
  if (account.signingKey) entry.emplace("signingKey", *account.signingKey);
  if (account.opaqueID) entry.emplace("opaqueID", *account.opaqueID);
  accounts_.emplace_back(std::move(entry));
  writePlist("accounts.plist", accounts_);
}

void StoreCatalogueBuilder::setStoreSettings(const PlistDictionary& bagExtras,
                                             std::optional<std::uint64_t> chunkSize) {
  PlistDictionary settings{{"bag", bagExtras}};
  if (chunkSize) settings.emplace("chunkSize", *chunkSize);
  writeStoreSettings(settings);
}

void StoreCatalogueBuilder::writeStoreSettings(const PlistDictionary& settings) const {
  writePlist("store.plist", settings);
}

std::string StoreCatalogueBuilder::makeBundle(const std::string& name, const std::string& bundleID,
                                              const std::string& version, std::uint64_t wareID,
                                              std::size_t payloadBytes) const {
  const std::string folder = scratchDirectory() + "/bundles";
  fs::create_directories(folder);
  const std::string path = scratch_.installBundle({folder, name, bundleID, version, wareID});
  const std::string executable = path + "/bin/" + name;
  if (!FileIO::writeAtomically(executable, payload(payloadBytes, wareID))) {
    throw std::runtime_error("cannot write " + executable);
  }
  fs::permissions(executable, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                  fs::perms::others_read | fs::perms::others_exec);
  return path;
}

void StoreCatalogueBuilder::pack(const std::string& bundlePath, const std::string& packagePath) {
  const std::string errorPath = packagePath + ".pack-errors";
  int status = 0;
  {
    ChildProcess packer({LARDER_STORE_PATH, "pack", bundlePath, packagePath}, {}, "/dev/null",
                        errorPath);
    status = packer.wait();
  }
  std::ifstream errors(errorPath);
  std::stringstream text;
  text << errors.rdbuf();
  std::error_code code;
  fs::remove(errorPath, code);
  if (status != 0) {
    throw std::runtime_error("larder-store pack " + bundlePath + " failed: " + text.str());
  }
}

std::string StoreCatalogueBuilder::addItem(const Item& item) {
  const std::string bundle =
      item.bundlePath.empty()
          ? makeBundle(item.title, item.bundleID, item.version, item.wareID, item.payloadBytes)
          : item.bundlePath;
  const std::string folder = "items/" + std::to_string(item.wareID);
  const std::string packageName = fs::path(bundle).stem().string() + ".tar";
  fs::create_directories(directory() + "/" + folder);
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
  writePlist(folder + "/item.plist", entry);
  return packagePath;
}

}  // namespace larder::testing
