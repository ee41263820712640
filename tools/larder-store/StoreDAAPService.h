#pragma once

#include <httplib.h>

#include <cstdint>
#include <optional>
#include <string_view>

#include "larder-store/StoreCatalogue.h"
#include "platform/value/PlistValue.h"

namespace larder {

struct StoreAccount;

// The cloud library routes, below the bag's "base-url" (docs/store.md):
// POST login, update, databases and databases/<revision>/items. Every
// request must be signed by a known account; every answer to a signed
// request is signed with the same key, failures included. Answers are
// DMAP (`application/x-dmap-tagged`), failures property lists.
class StoreDAAPService {
 public:
  explicit StoreDAAPService(const StoreCatalogue& catalogue) : catalogue_(catalogue) {}

  static constexpr std::string_view kLoginPath = "/daap/login";
  static constexpr std::string_view kUpdatePath = "/daap/update";
  static constexpr std::string_view kDatabasesPath = "/daap/databases";
  static constexpr std::string_view kItemsPattern = R"(/daap/databases/(\d+)/items)";
  static constexpr std::string_view kDMAPType = "application/x-dmap-tagged";

  // The catalogue's extra bag entries over the library's "purchase-daap".
  [[nodiscard]] PlistDictionary bagExtras(std::string_view baseURL) const;

  void answerLogin(const httplib::Request& request, httplib::Response& response) const;
  void answerUpdate(const httplib::Request& request, httplib::Response& response) const;
  void answerDatabases(const httplib::Request& request, httplib::Response& response) const;
  void answerItems(const httplib::Request& request, httplib::Response& response) const;

 private:
  // The account that signed the request for a library that exists; after
  // answering with the failure, null when there is none.
  const StoreAccount* admit(const httplib::Request& request, httplib::Response& response) const;
  // The session of a form request, when it is one this account holds;
  // otherwise answers the failure.
  bool admitSession(std::optional<std::uint32_t> sessionID, const StoreAccount& signer,
                    httplib::Response& response) const;
  static void sendDMAP(httplib::Response& response, const PlistData& document,
                       const StoreAccount& signer);
  static void sendFailure(httplib::Response& response, int status, std::string_view failureType,
                          std::string_view message, const StoreAccount* signer);

  const StoreCatalogue& catalogue_;
};

}  // namespace larder
