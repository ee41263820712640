#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value/PlistValue.h"

namespace larder {

// Description of one HTTP request. A value: copying a request copies its
// body. A request without URL takes its URL from the URL bag key of the
// operation that performs it.
class VendURLRequest {
 public:
  enum CachePolicy : std::int64_t {
    kUseProtocolCachePolicy = 0,
    kReloadIgnoringLocalCacheData = 1,
  };
  static constexpr double kDefaultTimeoutInterval = 60;

  VendURLRequest() = default;
  explicit VendURLRequest(std::string url) : url_(std::move(url)) {}
  static VendURLRequest requestWithURL(std::string url) { return VendURLRequest(std::move(url)); }

  [[nodiscard]] const std::string& url() const { return url_; }
  void setURL(std::string url) { url_ = std::move(url); }

  // "GET" unless set.
  [[nodiscard]] const std::string& method() const { return method_; }
  void setMethod(std::string method) { method_ = std::move(method); }

  [[nodiscard]] const PlistData& body() const { return body_; }
  void setBody(PlistData body) { body_ = std::move(body); }

  [[nodiscard]] std::int64_t cachePolicy() const { return cachePolicy_; }
  void setCachePolicy(std::int64_t policy) { cachePolicy_ = policy; }

  // Header names compare without regard to case; setting a header replaces
  // one of the same name, and an empty value removes it.
  void setValue(std::string_view value, std::string_view headerField);
  [[nodiscard]] std::optional<std::string> valueForHeaderField(std::string_view field) const;
  [[nodiscard]] const std::vector<std::pair<std::string, std::string>>& headers() const {
    return headers_;
  }

  // Seconds without progress after which the request fails. The time to
  // connect is bounded separately by the transport.
  [[nodiscard]] double timeoutInterval() const { return timeoutInterval_; }
  void setTimeoutInterval(double seconds) { timeoutInterval_ = seconds; }

  // Wire and archive form: "url", "method", "body", "cachePolicy",
  // "headers" (dictionary), "timeoutInterval". Unknown or mistyped entries
  // are ignored.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static VendURLRequest fromDictionary(const PlistDictionary& dictionary);

  friend bool operator==(const VendURLRequest&, const VendURLRequest&) = default;

 private:
  std::string url_;
  std::string method_{"GET"};
  PlistData body_;
  std::int64_t cachePolicy_ = kUseProtocolCachePolicy;
  std::vector<std::pair<std::string, std::string>> headers_;
  double timeoutInterval_ = kDefaultTimeoutInterval;
};

}  // namespace larder
