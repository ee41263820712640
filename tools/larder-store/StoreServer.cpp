#include "larder-store/StoreServer.h"

#include <charconv>
#include <memory>
#include <span>

#include "larder-store/AssetStream.h"
#include "larder-store/ByteRange.h"
#include "larder-store/StoreAnswers.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"

namespace larder {
namespace {

constexpr std::string_view kPlistType = "application/x-plist";
constexpr std::size_t kLargestRequestBody = 16u << 20u;
constexpr time_t kKeepAliveSeconds = 2;

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

// "a,b,c" as its non-empty parts.
std::vector<std::string_view> commaSeparated(std::string_view text) {
  std::vector<std::string_view> parts;
  while (!text.empty()) {
    const auto comma = text.find(',');
    if (comma != 0) parts.push_back(text.substr(0, comma));
    if (comma == std::string_view::npos) break;
    text.remove_prefix(comma + 1);
  }
  return parts;
}

// A Host header that can stand in a URL as it is.
bool isPlainHost(std::string_view host) {
  return !host.empty() && host.find_first_of("/ \t\r\n@?#") == std::string_view::npos;
}

AssetStream::Damage damageFor(std::optional<StoreFaults::Kind> fault) {
  if (fault == StoreFaults::Kind::Truncate) return AssetStream::Damage::Truncate;
  if (fault == StoreFaults::Kind::Corrupt) return AssetStream::Damage::Corrupt;
  return AssetStream::Damage::None;
}

}  // namespace

StoreServer::StoreServer(StoreCatalogue catalogue, StoreFaults faults)
    : catalogue_(std::move(catalogue)),
      faults_(std::move(faults)),
      purchases_(catalogue_),
      updateCheck_(catalogue_),
      orvaneIDLookup_(catalogue_),
      cloudLibrary_(catalogue_) {
  // httplib owns the task queue it asks for and deletes it when it stops.
  http_.new_task_queue = [] {
    return std::make_unique<httplib::ThreadPool>(kWorkerThreads).release();
  };
  http_.set_keep_alive_timeout(kKeepAliveSeconds);
  http_.set_payload_max_length(kLargestRequestBody);
  http_.set_pre_routing_handler([](const httplib::Request& request, httplib::Response&) {
    // httplib would cut every answer, plists and failures included, to the
    // requested range, without checking it against the size. Ranges are
    // the assets route's business alone, so they are taken away here; the
    // request is httplib's own non-const object, only handed out as const.
    const_cast<httplib::Request&>(request).ranges.clear();
    return httplib::Server::HandlerResponse::Unhandled;
  });
  http_.set_logger([](const httplib::Request& request, const httplib::Response& response) {
    TILL_LOG(3, "%@: %@ %@ -> %d", "StoreServer", request.method, request.target, response.status);
  });
  http_.set_error_handler(httplib::Server::HandlerWithResponse(
      [](const httplib::Request&, httplib::Response& response) {
        // Only answers that say nothing of their own get a failure dictionary.
        if (!response.body.empty() || response.content_length_ > 0) {
          return httplib::Server::HandlerResponse::Unhandled;
        }
        sendFailure(response, response.status, "request-failed",
                    "The store cannot answer this request.");
        return httplib::Server::HandlerResponse::Handled;
      }));
  installRoutes();
}

void StoreServer::installRoutes() {
  const auto exact = [](std::string_view path) { return std::string(path); };
  const auto below = [](std::string_view prefix, std::string_view rest) {
    return std::string(prefix) + std::string(rest);
  };
  auto handlerFor = [this](auto member) {
    return [this, member](const httplib::Request& request, httplib::Response& response) {
      (this->*member)(request, response);
    };
  };
  http_.Get(exact(StoreAnswers::kBagPath),
            route(StoreRoute::Bag, handlerFor(&StoreServer::answerBag)));
  http_.Post(exact(StoreAnswers::kAuthenticatePath),
             route(StoreRoute::Authenticate, handlerFor(&StoreServer::answerAuthenticate)));
  http_.Post(exact(StoreAnswers::kBuyProductPath),
             route(StoreRoute::BuyProduct, handlerFor(&StoreServer::answerBuyProduct)));
  http_.Get(exact(StoreAnswers::kItemLookupPath),
            route(StoreRoute::ItemLookup, handlerFor(&StoreServer::answerItemLookup)));
  http_.Get(below(StoreAnswers::kAssetsPrefix, R"((\d+)/([^/]+))"),
            route(StoreRoute::Assets, handlerFor(&StoreServer::answerAsset)));
  http_.Get(below(StoreAnswers::kPreflightPrefix, R"((\d+))"),
            route(StoreRoute::Preflight, handlerFor(&StoreServer::answerPreflight)));
  http_.Post(
      exact(StoreAnswers::kUpdateCheckPath),
      routeReadingBody(StoreRoute::UpdateCheck,
                       [this](const std::optional<std::string>& body, httplib::Response& response) {
                         send(response, updateCheck_.answer(body));
                       }));
  http_.Get(exact(StoreAnswers::kOrvaneIDLookupPath),
            route(StoreRoute::OrvaneIDLookup,
                  [this](const httplib::Request& request, httplib::Response& response) {
                    send(response, orvaneIDLookup_.answer(request));
                  }));
  installCloudLibraryRoutes();
  http_.Get(exact(StoreAnswers::kRequestsPath),
            [this](const httplib::Request&, httplib::Response& response) {
              answerRequestCounts(response);
            });
  http_.Get(exact(StoreAnswers::kSignedRequestsPath),
            [this](const httplib::Request&, httplib::Response& response) {
              send(response, {200, signedCounts_.toDictionary(), {}});
            });
}

void StoreServer::installCloudLibraryRoutes() {
  const auto service =
      [this](void (StoreDAAPService::*member)(const httplib::Request&, httplib::Response&) const) {
        return [this, member](const httplib::Request& request, httplib::Response& response) {
          (cloudLibrary_.*member)(request, response);
        };
      };
  http_.Post(std::string(StoreDAAPService::kLoginPath),
             route(StoreRoute::DAAPLogin, service(&StoreDAAPService::answerLogin)));
  http_.Post(std::string(StoreDAAPService::kUpdatePath),
             route(StoreRoute::DAAPUpdate, service(&StoreDAAPService::answerUpdate)));
  http_.Post(std::string(StoreDAAPService::kDatabasesPath),
             route(StoreRoute::DAAPDatabases, service(&StoreDAAPService::answerDatabases)));
  http_.Post(std::string(StoreDAAPService::kItemsPattern),
             route(StoreRoute::DAAPItems, service(&StoreDAAPService::answerItems)));
}

httplib::Server::Handler StoreServer::route(StoreRoute storeRoute, RouteHandler handler) {
  return [this, storeRoute, handler = std::move(handler)](const httplib::Request& request,
                                                          httplib::Response& response) {
    counts_.count(storeRoute);
    if (request.has_header(std::string(VendRequestSigner::kAccountHeader)) ||
        request.has_header(std::string(VendRequestSigner::kSignatureHeader))) {
      signedCounts_.count(storeRoute);
    }
    if (!answeredByFault(storeRoute, request, response)) handler(request, response);
  };
}

httplib::Server::HandlerWithContentReader StoreServer::routeReadingBody(StoreRoute storeRoute,
                                                                        BodyRouteHandler handler) {
  return [this, storeRoute, handler = std::move(handler)](const httplib::Request& request,
                                                          httplib::Response& response,
                                                          const httplib::ContentReader& reader) {
    // The whole body is read first, so that a fault's answer never leaves
    // half of it on the connection.
    std::string bytes;
    const bool decoded = reader([&](const char* data, std::size_t length) {
      bytes.append(data, length);
      return true;
    });
    const std::optional<std::string> body =
        decoded ? std::optional<std::string>(std::move(bytes)) : std::nullopt;
    route(storeRoute, [&](const httplib::Request&, httplib::Response& answer) {
      handler(body, answer);
    })(request, response);
  };
}

bool StoreServer::answeredByFault(StoreRoute storeRoute, const httplib::Request& request,
                                  httplib::Response& response) {
  const auto fault = faults_.faultFor(storeRoute);
  if (!fault) return false;
  TILL_LOG(3, "%@: fault %@ on %@", "StoreServer", StoreFaults::kindName(*fault),
           storeRouteName(storeRoute));
  switch (*fault) {
    case StoreFaults::Kind::ServerError:
      sendFailure(response, 500, "server-error", "The store failed on purpose.");
      return true;
    case StoreFaults::Kind::Stall:
      stallGate_.wait();
      sendFailure(response, 503, "server-stopping", "The store is stopping.");
      return true;
    case StoreFaults::Kind::Slow:
      // Long enough for every caller of a test to arrive while the request
      // is in flight; a stopping server lets it go at once.
      stallGate_.waitFor(std::chrono::seconds(1));
      return false;
    case StoreFaults::Kind::NotPlist:
      response.status = 200;
      response.set_content("larder-store: this answer is not a property list\n\x01\x02\xff",
                           std::string(kPlistType));
      return true;
    case StoreFaults::Kind::WrongShape:
      send(response, {200, PlistArray{"an", "array", "where", "a", "dictionary", "belongs"}, {}});
      return true;
    case StoreFaults::Kind::RedirectHost: {
      // Only the first leg: the other name of the same server answers as usual.
      const std::string host = request.get_header_value("Host");
      constexpr std::string_view kLoopback = "127.0.0.1:";
      if (!host.starts_with(kLoopback)) return false;
      response.status = 307;
      response.set_header("Location",
                          "http://localhost:" + host.substr(kLoopback.size()) + request.target);
      return true;
    }
    case StoreFaults::Kind::Truncate:
    case StoreFaults::Kind::Corrupt:
    case StoreFaults::Kind::Trickle:
    case StoreFaults::Kind::WithDownloads:
    case StoreFaults::Kind::OtherItem:
      return false;  // the route itself misbehaves
  }
  return false;
}

std::optional<int> StoreServer::bind(const std::string& host, int port) {
  host_ = host;
  port_ = port == 0 ? http_.bind_to_any_port(host) : (http_.bind_to_port(host, port) ? port : -1);
  if (port_ <= 0) return std::nullopt;
  if (!http_.widenBacklog()) {
    TILL_LOG(1, "%@: the listen backlog stays small; bursts of connections will wait",
             "StoreServer");
  }
  return port_;
}

bool StoreServer::serve() {
  return http_.listen_after_bind();
}

void StoreServer::stop() {
  stallGate_.open();
  http_.stop();
}

std::string StoreServer::baseURL(const httplib::Request& request) const {
  const std::string host = request.get_header_value("Host");
  if (isPlainHost(host)) return "http://" + host;
  return "http://" + host_ + ":" + std::to_string(port_);
}

void StoreServer::send(httplib::Response& response, const StoreReply& reply) {
  response.status = reply.status;
  response.set_content(PropertyListSerialization::writeXml(reply.body), std::string(kPlistType));
  if (reply.signingKey) {
    const VendRequestSigner signer(*reply.signingKey);
    response.set_header(std::string(VendRequestSigner::kSignatureHeader),
                        signer.answerSignature(reply.status, bytesOf(response.body)));
  }
}

void StoreServer::sendFailure(httplib::Response& response, int status, std::string_view failureType,
                              std::string_view message) {
  send(response, {status, StoreAnswers::failure(failureType, message), std::nullopt});
}

void StoreServer::answerBag(const httplib::Request& request, httplib::Response& response) const {
  const std::string base = baseURL(request);
  send(response, {200, StoreAnswers::bag(base, cloudLibrary_.bagExtras(base)), {}});
}

void StoreServer::answerAuthenticate(const httplib::Request& request,
                                     httplib::Response& response) const {
  const auto credentials = PropertyListSerialization::read(request.body);
  const std::string* name = credentials ? (*credentials)["accountName"].string() : nullptr;
  const std::string* password = credentials ? (*credentials)["password"].string() : nullptr;
  if (!name || !password) {
    sendFailure(response, 400, "invalid-request", "The request has no account name and password.");
    return;
  }
  const StoreAccount* account = catalogue_.accounts().authenticate(*name, *password);
  if (!account) {
    TILL_LOG(2, "%@: refusing the sign-in of %@", "StoreServer", *name);
    sendFailure(response, 401, "invalid-credentials", "The account name or password is wrong.");
    return;
  }
  TILL_LOG(2, "%@: %@ signed in", "StoreServer", *name);
  PlistDictionary answer = account->toAuthenticationDictionary();
  if (faults_.faultFor(StoreRoute::Authenticate) == StoreFaults::Kind::WithDownloads &&
      !catalogue_.items().empty()) {
    answer["downloads"] =
        PlistArray{StoreAnswers::download(catalogue_.items().begin()->second, baseURL(request))};
  }
  send(response, {200, std::move(answer), {}});
}

void StoreServer::answerBuyProduct(const httplib::Request& request,
                                   httplib::Response& response) const {
  StoreReply reply = purchases_.buy(request, baseURL(request));
  if (faults_.faultFor(StoreRoute::BuyProduct) == StoreFaults::Kind::OtherItem) {
    // Signed as usual: the store itself sends the wrong item.
    PlistDictionary* answer = reply.body.dictionary();
    PlistArray* downloads = answer ? (*answer)["downloads"].array() : nullptr;
    for (std::size_t index = 0; downloads && index < downloads->size(); ++index) {
      PlistDictionary* download = (*downloads)[index].dictionary();
      PlistDictionary* metadata = download ? (*download)["metadata"].dictionary() : nullptr;
      if (metadata && (*metadata)["itemIdentifier"].isInteger()) {
        (*metadata)["itemIdentifier"] = (*metadata)["itemIdentifier"].uint64Value() + 1;
      }
    }
  }
  send(response, reply);
}

void StoreServer::answerItemLookup(const httplib::Request& request,
                                   httplib::Response& response) const {
  if (!request.has_param("id") && !request.has_param("bundleId")) {
    sendFailure(response, 400, "invalid-request", "The lookup names no item.");
    return;
  }
  PlistDictionary results;
  const auto add = [&](const StoreItem* item) {
    if (item) results[std::to_string(item->wareID)] = StoreAnswers::lookupResult(*item);
  };
  const std::string ids = request.get_param_value("id");
  const std::string bundleIDs = request.get_param_value("bundleId");
  for (std::string_view id : commaSeparated(ids)) {
    const auto wareID = unsignedDecimalNumber(id);
    add(wareID ? catalogue_.itemWithID(*wareID) : nullptr);
  }
  for (std::string_view bundleID : commaSeparated(bundleIDs)) {
    add(catalogue_.itemWithBundleID(bundleID));
  }
  send(response, {200, PlistDictionary{{"results", std::move(results)}}, {}});
}

const StoreItem* StoreServer::itemInPath(const httplib::Request& request) const {
  const auto wareID = unsignedDecimalNumber(request.matches[1].str());
  return wareID ? catalogue_.itemWithID(*wareID) : nullptr;
}

void StoreServer::answerAsset(const httplib::Request& request, httplib::Response& response) const {
  const StoreItem* item = itemInPath(request);
  const auto path = item ? item->assetPath(request.matches[2].str()) : std::nullopt;
  const auto stream =
      path ? AssetStream::open(*path, damageFor(faults_.faultFor(StoreRoute::Assets))) : nullptr;
  if (!stream) {
    sendFailure(response, 404, "unknown-asset", "There is no such asset.");
    return;
  }
  const std::string type = request.matches[2].str() == item->packageName
                               ? "application/x-tar"
                               : "application/octet-stream";
  const ByteRange range = ByteRange::select(request.get_header_value("Range"), stream->size());
  response.set_header("Accept-Ranges", "bytes");
  if (range.kind != ByteRange::Kind::Whole) {
    response.set_header("Content-Range", range.contentRange(stream->size()));
  }
  if (range.kind == ByteRange::Kind::Unsatisfiable) {
    sendFailure(response, 416, "invalid-range", "The range lies outside the asset.");
    return;
  }
  response.status = range.kind == ByteRange::Kind::Partial ? 206 : 200;
  if (range.length == 0) {
    response.set_content("", type);  // httplib takes a provider of no length for a chunked one
    return;
  }
  response.set_content_provider(
      range.length, type,
      [this, stream, first = range.first,
       trickle = faults_.faultFor(StoreRoute::Assets) == StoreFaults::Kind::Trickle](
          std::size_t offset, std::size_t length, httplib::DataSink& sink) {
        if (!trickle) return stream->provide(first + offset, length, sink);
        // Fast enough never to stall, far too slow to finish; a stopping
        // server ends it.
        if (stallGate_.waitFor(std::chrono::milliseconds(250))) return false;
        return stream->provide(first + offset, std::min<std::size_t>(length, 4), sink);
      });
}

void StoreServer::answerPreflight(const httplib::Request& request,
                                  httplib::Response& response) const {
  const StoreItem* item = itemInPath(request);
  if (!item) {
    sendFailure(response, 404, "unknown-item", "This item is not in the store.");
    return;
  }
  send(response, {200, StoreAnswers::preflight(*item), {}});
}

void StoreServer::answerRequestCounts(httplib::Response& response) const {
  send(response, {200, counts_.toDictionary(), {}});
}

}  // namespace larder
