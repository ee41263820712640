#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <span>
#include <string>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/http/VendURLResponse.h"

namespace larder {

// One HTTP exchange over libcurl. Every transfer ends: the connection has
// a time limit of its own, a transfer that makes no progress for the
// request's `timeoutInterval` fails, and so does one that takes longer than
// `totalTimeBound` (a trickle just above the stall limit), so a synchronous
// caller never hangs on a lost or starved reply. gzip and deflate answers
// are decoded on the way in.
//
// Redirects are followed (at most `kMaximumRedirects`) as `redirectPolicy`
// decides: never from https to http or to another scheme, and without the
// account and signature headers to any other origin.
class VendHTTPTransfer {
 public:
  struct Options {
    // Receives the body piece by piece; returning false aborts the
    // transfer with a cancellation error. Without it the body is collected.
    std::function<bool(std::span<const std::uint8_t>)> onData;
    // Called with the head once it has arrived, before any body.
    std::function<void(const VendURLResponse&)> onResponse;
    // Bytes received so far and expected in all (0 while unknown); returning
    // false aborts the transfer with a cancellation error.
    std::function<bool(std::uint64_t received, std::uint64_t expected)> onProgress;
    // Asks for the body from this offset on (HTTP range request).
    std::uint64_t resumeFrom = 0;
    std::chrono::milliseconds connectTimeout{10000};
    // Largest body collected in memory when there is no `onData`.
    std::size_t maximumBodySize = 64u << 20u;
  };

  struct Result {
    VendURLResponse response;
    PlistData body;  // empty when `onData` took it
    OptionalError error;
  };

  // Errors: domain "VendHTTPErrorDomain" with curl's code for transport
  // failures (the description is curl's text), -128 when a callback
  // aborted. An HTTP status is not an error here; callers judge it.
  static Result perform(const VendURLRequest& request, const Options& options);
  static Result perform(const VendURLRequest& request);

  static constexpr std::string_view kErrorDomain = "VendHTTPErrorDomain";

  enum class Redirect {
    kRefuse,                // a downgrade (https to http), another scheme, or no URL
    kFollow,                // same scheme, host and port: the request goes on as it is
    kFollowWithoutAccount,  // another origin: the account and signature headers stay behind
  };
  static Redirect redirectPolicy(std::string_view fromURL, std::string_view toURL);
  static constexpr int kMaximumRedirects = 5;

  // The longest a transfer may take in all: twice its stall limit, plus its
  // bytes (the larger of the expected and the received count, both ways) at
  // `kMinimumRate`. A 1 GB package with the default stall limit of 60 s may
  // take 2 + 8.5 hours; a small answer 2 minutes.
  static std::chrono::milliseconds totalTimeBound(double stallSeconds, std::uint64_t bytes);
  static constexpr std::uint64_t kMinimumRate = 32u * 1024u;  // bytes per second
};

}  // namespace larder
