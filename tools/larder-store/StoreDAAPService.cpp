#include "larder-store/StoreDAAPService.h"

#include <limits>
#include <span>
#include <string>

#include "dmap/DAAPItemsRequest.h"
#include "dmap/DAAPMediaKindQuery.h"
#include "larder-store/StoreAccount.h"
#include "larder-store/StoreAnswers.h"
#include "larder-store/StoreCloudLibrary.h"
#include "larder-store/StoreDAAPAnswers.h"
#include "larder-store/StoreRequestSignature.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "StoreDAAPService";
constexpr std::string_view kPlistType = "application/x-plist";

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

std::optional<std::uint32_t> number32(std::string_view text) {
  const auto number = unsignedDecimalNumber(text);
  if (!number || *number > std::numeric_limits<std::uint32_t>::max()) return std::nullopt;
  return static_cast<std::uint32_t>(*number);
}

std::optional<std::uint32_t> formNumber(const httplib::Request& request, const char* name) {
  if (!request.has_param(name)) return std::nullopt;
  return number32(request.get_param_value(name));
}

}  // namespace

PlistDictionary StoreDAAPService::bagExtras(std::string_view baseURL) const {
  PlistDictionary extras;
  if (auto entry = catalogue_.cloudLibrary().bagEntry(baseURL)) {
    extras.emplace("purchase-daap", std::move(*entry));
  }
  for (const auto& [key, value] : catalogue_.bagExtras()) extras[key] = value;
  return extras;
}

void StoreDAAPService::sendDMAP(httplib::Response& response, const PlistData& document,
                                const StoreAccount& signer) {
  response.status = 200;
  response.set_content(reinterpret_cast<const char*>(document.data()), document.size(),
                       std::string(kDMAPType));
  response.set_header(std::string(VendRequestSigner::kSignatureHeader),
                      VendRequestSigner(signer.signingKey).answerSignature(200, document));
}

void StoreDAAPService::sendFailure(httplib::Response& response, int status,
                                   std::string_view failureType, std::string_view message,
                                   const StoreAccount* signer) {
  response.status = status;
  response.set_content(
      PropertyListSerialization::writeXml(StoreAnswers::failure(failureType, message)),
      std::string(kPlistType));
  if (signer) {
    response.set_header(
        std::string(VendRequestSigner::kSignatureHeader),
        VendRequestSigner(signer->signingKey).answerSignature(status, bytesOf(response.body)));
  }
}

const StoreAccount* StoreDAAPService::admit(const httplib::Request& request,
                                            httplib::Response& response) const {
  const auto signature = StoreRequestSignature::check(request, catalogue_.accounts());
  if (signature.outcome != StoreRequestSignature::Outcome::Valid) {
    TILL_LOG(2, "%@: refusing %@: no valid signature", kSpeaker, request.path);
    sendFailure(response, 401, "invalid-signature", "The request's signature is not valid.",
                nullptr);
    return nullptr;
  }
  if (!catalogue_.cloudLibrary().isPresent()) {
    sendFailure(response, 404, "no-library", "This store has no cloud library.", signature.signer);
    return nullptr;
  }
  return signature.signer;
}

bool StoreDAAPService::admitSession(std::optional<std::uint32_t> sessionID,
                                    const StoreAccount& signer, httplib::Response& response) const {
  if (sessionID && catalogue_.cloudLibrary().hasSession(*sessionID, signer.accountID)) return true;
  sendFailure(response, 403, "invalid-session", "Log in to the cloud library first.", &signer);
  return false;
}

void StoreDAAPService::answerLogin(const httplib::Request& request,
                                   httplib::Response& response) const {
  const StoreAccount* signer = admit(request, response);
  if (!signer) return;
  const std::uint32_t session = catalogue_.cloudLibrary().login(signer->accountID);
  TILL_LOG(2, "%@: %@ logged in to the cloud library, session %u", kSpeaker, signer->orvaneID,
           session);
  sendDMAP(response, StoreDAAPAnswers::login(session), *signer);
}

void StoreDAAPService::answerUpdate(const httplib::Request& request,
                                    httplib::Response& response) const {
  const StoreAccount* signer = admit(request, response);
  if (!signer || !admitSession(formNumber(request, "session-id"), *signer, response)) return;
  if (request.has_param("query") && !DAAPMediaKindQuery::parse(request.get_param_value("query"))) {
    sendFailure(response, 400, "invalid-request", "The query is not a media kind query.", signer);
    return;
  }
  sendDMAP(response, StoreDAAPAnswers::update(catalogue_.cloudLibrary().currentRevision()),
           *signer);
}

void StoreDAAPService::answerDatabases(const httplib::Request& request,
                                       httplib::Response& response) const {
  const StoreAccount* signer = admit(request, response);
  if (!signer || !admitSession(formNumber(request, "session-id"), *signer, response)) return;
  StoreCloudLibrary& library = catalogue_.cloudLibrary();
  sendDMAP(response, StoreDAAPAnswers::databases(library.currentRevision(), library.itemCount()),
           *signer);
}

void StoreDAAPService::answerItems(const httplib::Request& request,
                                   httplib::Response& response) const {
  const StoreAccount* signer = admit(request, response);
  if (!signer) return;
  const auto body = DAAPItemsRequest::parse(bytesOf(request.body));
  if (!body) {
    sendFailure(response, 400, "invalid-request", "The body is not an items request.", signer);
    return;
  }
  if (!admitSession(body->sessionID, *signer, response)) return;
  StoreCloudLibrary::ItemsQuery query;
  if (body->query) {
    query.mediaKinds = DAAPMediaKindQuery::parse(*body->query);
    if (!query.mediaKinds) {
      sendFailure(response, 400, "invalid-request", "The query is not a media kind query.", signer);
      return;
    }
  }
  query.latestVersion = body->latestVersion.value_or(0);
  query.localVersion =
      body->localVersion ? *body->localVersion : number32(request.matches[1].str()).value_or(0);
  query.held = body->tokenPairs;
  query.includePreorders = request.get_param_value("includePreorders") == "1";
  const auto changes = catalogue_.cloudLibrary().changes(query);
  TILL_LOG(2, "%@: revision %u to %u for %@: %lu items, %lu deleted", kSpeaker, query.localVersion,
           changes.revision, signer->orvaneID, static_cast<unsigned long>(changes.items.size()),
           static_cast<unsigned long>(changes.deleted.size()));
  sendDMAP(response, StoreDAAPAnswers::items(changes), *signer);
}

}  // namespace larder
