#include "tests/integration/StoreServerProcess.h"

#include <signal.h>

#include <filesystem>
#include <stdexcept>
#include <thread>

#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/http/VendHTTPTransfer.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kListeningPrefix = "larder-store listening on ";

std::vector<std::string> storeArguments(const std::string& catalogueDirectory,
                                        const std::vector<std::string>& faults) {
  std::vector<std::string> arguments{
      LARDER_STORE_PATH, "--catalogue", catalogueDirectory,  "--host", "127.0.0.1",
      "--port",          "0",           "--exit-with-parent"};
  for (const std::string& fault : faults) {
    arguments.push_back("--fault");
    arguments.push_back(fault);
  }
  return arguments;
}

}  // namespace

std::string StoreServerProcess::makeLogDirectory() {
  std::string pattern = (fs::temp_directory_path() / "larder-store-XXXXXX").string();
  if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp");
  return pattern;
}

StoreServerProcess::StoreServerProcess(const std::string& catalogueDirectory,
                                       const std::vector<std::string>& faults,
                                       std::chrono::milliseconds startTimeout)
    : logDirectory_(makeLogDirectory()),
      process_(storeArguments(catalogueDirectory, faults), {{"LARDER_LOG_LEVEL", "3"}},
               logDirectory_ + "/stdout", logDirectory_ + "/stderr") {
  awaitListeningLine(startTimeout);
}

StoreServerProcess::~StoreServerProcess() {
  stop();
  std::error_code code;
  fs::remove_all(logDirectory_, code);
}

void StoreServerProcess::awaitListeningLine(std::chrono::milliseconds timeout) {
  const bool listening = eventually(
      [&] {
        const std::string output = readFile(logDirectory_ + "/stdout");
        const auto start = output.find(kListeningPrefix);
        const auto end = output.find('\n', start);
        if (start == std::string::npos || end == std::string::npos) return !process_.isRunning();
        baseURL_ =
            output.substr(start + kListeningPrefix.size(), end - start - kListeningPrefix.size());
        return true;
      },
      timeout);
  const auto colon = baseURL_.rfind(':');
  if (!listening || baseURL_.empty() || colon == std::string::npos) {
    stop();
    throw std::runtime_error("larder-store did not start listening: " + errorOutput());
  }
  port_ = std::stoi(baseURL_.substr(colon + 1));
}

std::uint64_t StoreServerProcess::requestCount(const std::string& route) const {
  return countAt("/_larder/requests", route);
}

std::uint64_t StoreServerProcess::signedRequestCount(const std::string& route) const {
  return countAt("/_larder/signed-requests", route);
}

std::uint64_t StoreServerProcess::countAt(const std::string& path, const std::string& route) const {
  const auto result = get(baseURL_ + path);
  const std::optional<PlistValue> counts =
      result.error ? std::nullopt : PropertyListSerialization::read(result.body).optional();
  if (!counts || !(*counts)[route].isInteger()) {
    throw std::runtime_error("larder-store gave no request count for " + route);
  }
  return (*counts)[route].uint64Value();
}

std::string StoreServerProcess::errorOutput() const {
  return readFile(logDirectory_ + "/stderr");
}

int StoreServerProcess::stop(std::chrono::milliseconds grace) {
  if (!process_.isRunning()) return process_.wait();
  ::kill(process_.pid(), SIGTERM);
  if (!eventually([&] { return !process_.isRunning(); }, grace)) return process_.stop(SIGKILL);
  return process_.wait();
}

}  // namespace larder::testing
