#pragma once

#include <httplib.h>

#include <functional>
#include <optional>
#include <string>

#include "larder-store/StoreCatalogue.h"
#include "larder-store/StoreDAAPService.h"
#include "larder-store/StoreFaults.h"
#include "larder-store/StoreHTTPServer.h"
#include "larder-store/StoreOrvaneIDLookup.h"
#include "larder-store/StorePurchases.h"
#include "larder-store/StoreReply.h"
#include "larder-store/StoreRequestCounts.h"
#include "larder-store/StoreStallGate.h"
#include "larder-store/StoreUpdateCheck.h"

namespace larder {

// The HTTP face of the store: one handler per route of docs/store.md, with
// request counting and fault injection in front of every route.
class StoreServer {
 public:
  // Enough workers that stalled requests never starve the other routes.
  static constexpr std::size_t kWorkerThreads = 64;

  StoreServer(StoreCatalogue catalogue, StoreFaults faults);
  StoreServer(const StoreServer&) = delete;
  StoreServer& operator=(const StoreServer&) = delete;

  // Binds to `host`:`port` (0: a free port) and listens; the port bound,
  // or nullopt. Connections wait in the backlog until `serve` runs.
  std::optional<int> bind(const std::string& host, int port);
  // Answers requests until `stop`; false when it could not serve at all.
  bool serve();
  // From any thread, once `isServing`: releases stalled requests and ends
  // `serve`.
  void stop();
  [[nodiscard]] bool isServing() const { return http_.is_running(); }

 private:
  using RouteHandler = std::function<void(const httplib::Request&, httplib::Response&)>;
  // Takes the body as read, or nullopt when it could not be decoded.
  using BodyRouteHandler =
      std::function<void(const std::optional<std::string>& body, httplib::Response&)>;

  void installRoutes();
  // The cloud library's routes below the bag's "base-url".
  void installCloudLibraryRoutes();
  // Counts the request, then lets a fault or `handler` answer it.
  httplib::Server::Handler route(StoreRoute storeRoute, RouteHandler handler);
  // The same for a route that reads its body itself: httplib refuses a
  // body it cannot decode (a damaged gzip stream) before any route, which
  // the route would rather answer in its own words.
  httplib::Server::HandlerWithContentReader routeReadingBody(StoreRoute storeRoute,
                                                             BodyRouteHandler handler);
  bool answeredByFault(StoreRoute storeRoute, const httplib::Request& request,
                       httplib::Response& response);

  void answerBag(const httplib::Request& request, httplib::Response& response) const;
  void answerAuthenticate(const httplib::Request& request, httplib::Response& response) const;
  void answerBuyProduct(const httplib::Request& request, httplib::Response& response) const;
  void answerItemLookup(const httplib::Request& request, httplib::Response& response) const;
  void answerAsset(const httplib::Request& request, httplib::Response& response) const;
  void answerPreflight(const httplib::Request& request, httplib::Response& response) const;
  void answerRequestCounts(httplib::Response& response) const;

  // "http://<the host the client asked>", so that URLs in answers reach
  // this store on whatever port it runs.
  [[nodiscard]] std::string baseURL(const httplib::Request& request) const;
  [[nodiscard]] const StoreItem* itemInPath(const httplib::Request& request) const;
  static void send(httplib::Response& response, const StoreReply& reply);
  static void sendFailure(httplib::Response& response, int status, std::string_view failureType,
                          std::string_view message);

  StoreCatalogue catalogue_;
  StoreFaults faults_;
  StorePurchases purchases_;
  StoreUpdateCheck updateCheck_;
  StoreOrvaneIDLookup orvaneIDLookup_;
  StoreDAAPService cloudLibrary_;
  StoreRequestCounts counts_;
  // Requests that carried an account or signature header.
  StoreRequestCounts signedCounts_;
  // Waited on by const routes too (a trickling asset).
  mutable StoreStallGate stallGate_;
  StoreHTTPServer http_;
  std::string host_;
  int port_ = 0;
};

}  // namespace larder
