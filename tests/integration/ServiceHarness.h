#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder::testing {

// A child process with its standard output and error in files.
class ChildProcess {
 public:
  ChildProcess(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env,
               const std::string& outputPath, const std::string& errorPath);
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  [[nodiscard]] pid_t pid() const { return pid_; }
  [[nodiscard]] bool isRunning();
  // Sends `signal` and waits for the exit; the exit status, or 128+signal.
  int stop(int signal = 15);
  int wait();

 private:
  pid_t pid_ = -1;
  std::optional<int> status_;
};

// A private session bus for one test, so that tests never share the
// service's well-known name.
class PrivateBus {
 public:
  PrivateBus();
  ~PrivateBus();
  [[nodiscard]] const std::string& address() const { return address_; }
  [[nodiscard]] std::unique_ptr<sdbus::IConnection> connect() const;

 private:
  pid_t pid_ = -1;
  std::string address_;
};

// A temporary platform root and home, with helpers to lay out bundles.
class TemporaryPlatform {
 public:
  TemporaryPlatform();
  ~TemporaryPlatform();

  [[nodiscard]] const std::string& directory() const { return directory_; }
  [[nodiscard]] std::string root() const { return directory_ + "/root"; }
  [[nodiscard]] std::string home() const { return directory_ + "/home"; }
  [[nodiscard]] std::string cacheHome() const { return directory_ + "/home/.cache"; }
  [[nodiscard]] std::string stateHome() const { return directory_ + "/home/.local/state"; }
  [[nodiscard]] std::string persistedStorePath() const {
    return cacheHome() + "/com.orvane.tradeline/SoftwareMap";
  }

  struct BundleSpec {
    std::string folder;  // absolute path of the folder that holds the bundle
    std::string name;    // "Foo" makes "Foo.app"
    std::string bundleIdentifier;
    std::string version = "1.0";
    std::optional<std::uint64_t> itemIdentifier;  // store software when set
    std::int64_t versionIdentifier = 1;
    std::string iconBytes;  // written to resources/icon.png when not empty
  };
  // Writes the bundle; returns its path.
  std::string installBundle(const BundleSpec& spec) const;
  static void writePurchaseRecord(const std::string& bundlePath, const std::string& identifier,
                                  const std::string& version, std::uint64_t itemIdentifier,
                                  std::int64_t versionIdentifier);

  // The environment a service and its clients run with.
  [[nodiscard]] std::map<std::string, std::string> environment(const PrivateBus& bus) const;

 private:
  std::string directory_;
};

// larderd on a private bus with a temporary platform.
class ServiceProcess {
 public:
  ServiceProcess(const TemporaryPlatform& platform, const PrivateBus& bus,
                 std::vector<std::string> arguments = {},
                 std::map<std::string, std::string> extraEnvironment = {});
  ~ServiceProcess();

  // Waits until `busName` has an owner on the bus; false on time-out or if
  // the process ended.
  bool waitUntilServing(const std::string& busName = "com.orvane.larderd",
                        std::chrono::milliseconds timeout = std::chrono::seconds(10));
  [[nodiscard]] std::string log() const;
  // Lines of the log that contain `text`.
  [[nodiscard]] std::vector<std::string> logLines(const std::string& text) const;
  bool waitForLog(const std::string& text,
                  std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  int stop() { return process_.stop(); }
  ChildProcess& process() { return process_; }

 private:
  const PrivateBus& bus_;
  std::string logPath_;
  ChildProcess process_;
};

// A client of the service on the private bus.
std::unique_ptr<ServiceClient> connectClient(const PrivateBus& bus,
                                             const std::string& busName = "com.orvane.larderd");

bool eventually(const std::function<bool()>& condition,
                std::chrono::milliseconds timeout = std::chrono::seconds(10));

// The whole file; empty when it cannot be read.
std::string readFile(const std::string& path);

// Environment variables set for the span of a test; the old values are put
// back afterwards.
class ScopedEnvironment {
 public:
  explicit ScopedEnvironment(const std::map<std::string, std::string>& values);
  ~ScopedEnvironment();
  ScopedEnvironment(const ScopedEnvironment&) = delete;
  ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

 private:
  std::map<std::string, std::optional<std::string>> saved_;
};

}  // namespace larder::testing
