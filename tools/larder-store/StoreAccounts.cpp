#include "larder-store/StoreAccounts.h"

#include <openssl/evp.h>

#include <array>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

constexpr std::string_view kDefaultStoreFrontID = "1";

std::string stringOr(const PlistValue& value, std::string_view fallback) {
  const std::string* text = value.string();
  return text ? *text : std::string(fallback);
}

}  // namespace

StoreAccounts::StoreAccounts(const PlistValue& root) {
  const PlistArray* entries = root.array();
  if (!entries) {
    TILL_LOG(1, "%@: the accounts are not an array; no account can sign in", "StoreAccounts");
    return;
  }
  for (std::size_t index = 0; index < entries->size(); ++index) {
    if (auto account = accountFromEntry((*entries)[index], index)) {
      accounts_.push_back(std::move(*account));
    }
  }
}

StoreAccounts StoreAccounts::load(const std::string& path) {
  std::error_code code;
  if (!std::filesystem::exists(path, code)) {
    TILL_LOG(2, "%@: no %@, so no account can sign in", "StoreAccounts", path);
    return {};
  }
  const auto bytes = FileIO::read(path, 16u << 20u);
  const Result<PlistValue> root = bytes ? PropertyListSerialization::read(*bytes) : bytes.error();
  if (!root) {
    TILL_LOG(1, "%@: skipping %@: %@", "StoreAccounts", path, root.errorDescription());
    return {};
  }
  return StoreAccounts(*root);
}

std::optional<StoreAccount> StoreAccounts::accountFromEntry(const PlistValue& entry,
                                                            std::size_t index) const {
  const auto skip = [&](std::string_view why) {
    TILL_LOG(1, "%@: skipping account entry %lu: %@", "StoreAccounts",
             static_cast<unsigned long>(index), why);
    return std::nullopt;
  };
  if (!entry.isDictionary()) return skip("not a dictionary");
  StoreAccount account;
  account.accountID = entry["accountID"].isInteger() ? entry["accountID"].uint64Value() : 0;
  if (account.accountID == 0) return skip("no positive integer accountID");
  if (!entry["orvaneID"].string() || entry["orvaneID"].string()->empty()) {
    return skip("no orvaneID");
  }
  if (!entry["password"].string()) return skip("no password");
  account.orvaneID = *entry["orvaneID"].string();
  account.password = *entry["password"].string();
  account.storeFrontID = stringOr(entry["storeFrontID"], kDefaultStoreFrontID);
  if (const PlistData* key = entry["signingKey"].data(); key && !key->empty()) {
    account.signingKey = *key;
  } else if (!entry["signingKey"].isNull()) {
    return skip("signingKey is not non-empty data");
  } else {
    account.signingKey = derivedSigningKey(account.accountID, account.orvaneID, account.password);
  }
  const PlistValue& opaqueID = entry["opaqueID"];
  if (opaqueID.isNull()) {
    account.opaqueID = std::to_string(account.accountID);
  } else if (opaqueID.string() && !opaqueID.string()->empty()) {
    account.opaqueID = *opaqueID.string();
  } else {
    return skip("opaqueID is not a non-empty string");
  }
  if (accountWithID(account.accountID)) return skip("its accountID is taken");
  for (const StoreAccount& other : accounts_) {
    if (other.orvaneID == account.orvaneID) return skip("its orvaneID is taken");
    if (other.opaqueID == account.opaqueID) return skip("its opaqueID is taken");
  }
  return account;
}

const StoreAccount* StoreAccounts::authenticate(std::string_view name,
                                                std::string_view password) const {
  for (const StoreAccount& account : accounts_) {
    if (account.orvaneID == name) return account.password == password ? &account : nullptr;
  }
  return nullptr;
}

const StoreAccount* StoreAccounts::accountWithID(std::uint64_t accountID) const {
  for (const StoreAccount& account : accounts_) {
    if (account.accountID == accountID) return &account;
  }
  return nullptr;
}

const StoreAccount* StoreAccounts::accountWithOpaqueID(std::string_view opaqueID) const {
  for (const StoreAccount& account : accounts_) {
    if (account.opaqueID == opaqueID) return &account;
  }
  return nullptr;
}

PlistData StoreAccounts::derivedSigningKey(std::uint64_t accountID, std::string_view name,
                                           std::string_view password) {
  std::string material = "larder-store signing key\n";
  material += std::to_string(accountID) + "\n";
  material += name;
  material += '\n';
  material += password;
  std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
  unsigned int length = 0;
  EVP_Digest(material.data(), material.size(), digest.data(), &length, EVP_sha256(), nullptr);
  return PlistData(digest.begin(), digest.begin() + length);
}

}  // namespace larder
