#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "larder-store/StoreRoute.h"
#include "platform/error/Result.h"

namespace larder {

// Faults that the store injects on a route, so that tests can see how a
// client copes with a store that misbehaves. Given as "ROUTE=KIND".
class StoreFaults {
 public:
  enum class Kind {
    ServerError,    // "500": status 500 with a failure dictionary
    Stall,          // "stall": no answer until the server stops
    Slow,           // "slow": the usual answer, one second late
    NotPlist,       // "not-plist": 200 with bytes that are no property list
    WrongShape,     // "wrong-shape": 200 with a property list of the wrong shape
    Truncate,       // "truncate" (assets): full Content-Length, half the bytes
    Corrupt,        // "corrupt" (assets): bytes flipped in the middle
    Trickle,        // "trickle" (assets): a few bytes every quarter second
    WithDownloads,  // "with-downloads" (authenticate): the answer orders a download
    OtherItem,      // "other-item" (buy-product): the download is of another item
    RedirectHost,   // "redirect-host": 307 from 127.0.0.1 to localhost, same port and target
  };

  // Parses every "ROUTE=KIND" text; the first bad one is the error.
  static constexpr std::string_view kErrorDomain = "StoreFaults";
  static Result<StoreFaults> parse(const std::vector<std::string>& faultTexts);

  [[nodiscard]] std::optional<Kind> faultFor(StoreRoute route) const;
  [[nodiscard]] bool empty() const { return faults_.empty(); }

  static std::string_view kindName(Kind kind);

 private:
  static std::optional<Kind> kindNamed(std::string_view name);
  // The one route a kind applies to, for those that apply to one only.
  static std::optional<StoreRoute> onlyRouteOf(Kind kind);

  std::map<StoreRoute, Kind> faults_;
};

}  // namespace larder
