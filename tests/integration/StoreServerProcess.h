#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "tests/integration/ServiceHarness.h"

namespace larder::testing {

// larder-store serving a catalogue on a free port of 127.0.0.1, for as long
// as the object lives. Its standard output and error go to files of a
// private temporary folder, which goes with it. The store also ends with
// the thread that made this object, so a crashed test leaves none behind;
// make it on a thread that outlives it.
class StoreServerProcess {
 public:
  // Starts the store with the faults given ("assets=truncate", ...) and
  // waits, up to `startTimeout`, for it to say where it listens. Throws
  // std::runtime_error, with the store's error output, when it does not.
  explicit StoreServerProcess(const std::string& catalogueDirectory,
                              const std::vector<std::string>& faults = {},
                              std::chrono::milliseconds startTimeout = std::chrono::seconds(20));
  ~StoreServerProcess();
  StoreServerProcess(const StoreServerProcess&) = delete;
  StoreServerProcess& operator=(const StoreServerProcess&) = delete;

  // "http://127.0.0.1:<port>"
  [[nodiscard]] const std::string& baseURL() const { return baseURL_; }
  [[nodiscard]] std::string bagURL() const { return baseURL_ + "/bag.plist"; }
  [[nodiscard]] int port() const { return port_; }

  // How many requests reached `route` ("bag", "assets", ...), as the store
  // counts them; throws when the store does not answer.
  [[nodiscard]] std::uint64_t requestCount(const std::string& route) const;
  // Requests of the route that carried an account or signature header.
  [[nodiscard]] std::uint64_t signedRequestCount(const std::string& route) const;

  // What the store wrote on standard error so far.
  [[nodiscard]] std::string errorOutput() const;

  // SIGTERM, then SIGKILL when the store has not ended within `grace`;
  // the exit status (128 + signal when a signal ended it).
  int stop(std::chrono::milliseconds grace = std::chrono::seconds(5));
  [[nodiscard]] bool isRunning() { return process_.isRunning(); }

 private:
  [[nodiscard]] std::uint64_t countAt(const std::string& path, const std::string& route) const;
  static std::string makeLogDirectory();
  void awaitListeningLine(std::chrono::milliseconds timeout);

  std::string logDirectory_;
  ChildProcess process_;
  std::string baseURL_;
  int port_ = 0;
};

// Speaking to the store over HTTP with the runtime's own transport.
inline std::string text(const PlistValue& value) {
  return value.string() ? *value.string() : "<absent>";
}
inline PlistData dataOf(std::string_view text) {
  return {text.begin(), text.end()};
}
inline PlistValue plistOf(const VendHTTPTransfer::Result& result) {
  return PropertyListSerialization::read(result.body).value_or(PlistValue());
}
inline std::string failureTypeOf(const VendHTTPTransfer::Result& result) {
  return text(plistOf(result)["failureType"]);
}
inline VendHTTPTransfer::Result get(const std::string& url, double timeout = 10) {
  VendURLRequest request(url);
  request.setTimeoutInterval(timeout);
  return VendHTTPTransfer::perform(request);
}
inline VendURLRequest postRequest(const std::string& url, const PlistValue& body) {
  VendURLRequest request(url);
  request.setMethod("POST");
  request.setValue("application/x-plist", "Content-Type");
  request.setBody(dataOf(PropertyListSerialization::writeXml(body)));
  request.setTimeoutInterval(10);
  return request;
}

}  // namespace larder::testing
