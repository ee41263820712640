#pragma once

#include <signal.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "tests/integration/ServiceHarness.h"

namespace larder::testing {

// A store URL on loopback with nobody behind it (the discard port).
constexpr char kNoStoreURL[] = "http://127.0.0.1:9/bag.plist";

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
                              std::chrono::milliseconds startTimeout = std::chrono::seconds(20))
      : logDirectory_(makeLogDirectory()),
        process_(arguments(catalogueDirectory, faults), {{"LARDER_LOG_LEVEL", "3"}},
                 logDirectory_ + "/stdout", logDirectory_ + "/stderr") {
    constexpr std::string_view kListening = "larder-store listening on ";
    const bool listening = eventually(
        [&] {
          const std::string output = readFile(logDirectory_ + "/stdout");
          const auto start = output.find(kListening);
          const auto end = output.find('\n', start);
          if (start == std::string::npos || end == std::string::npos) return !isRunning();
          baseURL_ = output.substr(start + kListening.size(), end - start - kListening.size());
          return true;
        },
        startTimeout);
    const auto colon = baseURL_.rfind(':');
    if (!listening || baseURL_.empty() || colon == std::string::npos) {
      stop();
      throw std::runtime_error("larder-store did not start listening: " + errorOutput());
    }
    port_ = std::stoi(baseURL_.substr(colon + 1));
  }
  ~StoreServerProcess() {
    stop();
    std::error_code code;
    std::filesystem::remove_all(logDirectory_, code);
  }
  StoreServerProcess(const StoreServerProcess&) = delete;
  StoreServerProcess& operator=(const StoreServerProcess&) = delete;

  // "http://127.0.0.1:<port>"
  [[nodiscard]] const std::string& baseURL() const { return baseURL_; }
  [[nodiscard]] std::string bagURL() const { return baseURL_ + "/bag.plist"; }
  [[nodiscard]] int port() const { return port_; }

  // How many requests reached `route` ("bag", "assets", ...), as the store
  // counts them; throws when the store does not answer.
  [[nodiscard]] std::uint64_t requestCount(const std::string& route) const {
    return countAt("/_larder/requests", route);
  }
  // Requests of the route that carried an account or signature header.
  [[nodiscard]] std::uint64_t signedRequestCount(const std::string& route) const {
    return countAt("/_larder/signed-requests", route);
  }

  // What the store wrote on standard error so far.
  [[nodiscard]] std::string errorOutput() const { return readFile(logDirectory_ + "/stderr"); }

  // SIGTERM, then SIGKILL when the store has not ended within `grace`;
  // the exit status (128 + signal when a signal ended it).
  int stop(std::chrono::milliseconds grace = std::chrono::seconds(5)) {
    if (!process_.isRunning()) return process_.wait();
    ::kill(process_.pid(), SIGTERM);
    if (!eventually([&] { return !process_.isRunning(); }, grace)) return process_.stop(SIGKILL);
    return process_.wait();
  }
  [[nodiscard]] bool isRunning() { return process_.isRunning(); }

 private:
  static std::vector<std::string> arguments(const std::string& catalogueDirectory,
                                            const std::vector<std::string>& faults) {
    std::vector<std::string> arguments{
        LARDER_STORE_PATH, "--catalogue", catalogueDirectory,  "--host", "127.0.0.1",
        "--port",          "0",           "--exit-with-parent"};
    for (const std::string& fault : faults) arguments.insert(arguments.end(), {"--fault", fault});
    return arguments;
  }
  static std::string makeLogDirectory() {
    std::string pattern = (std::filesystem::temp_directory_path() / "larder-store-XXXXXX").string();
    if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp");
    return pattern;
  }
  [[nodiscard]] std::uint64_t countAt(const std::string& path, const std::string& route) const {
    const auto result = get(baseURL_ + path);
    const std::optional<PlistValue> counts =
        result.error ? std::nullopt : PropertyListSerialization::read(result.body).optional();
    if (!counts || !(*counts)[route].isInteger()) {
      throw std::runtime_error("larder-store gave no request count for " + route);
    }
    return (*counts)[route].uint64Value();
  }

  std::string logDirectory_;
  ChildProcess process_;
  std::string baseURL_;
  int port_ = 0;
};

}  // namespace larder::testing
