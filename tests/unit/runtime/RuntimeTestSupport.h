// Scaffolding of the runtime's network tests: a private platform root,
// packages built as tar archives, their manifests, and a store server on
// 127.0.0.1 with range support and the failures a store can have.
#pragma once

#include <archive.h>
#include <archive_entry.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <sys/socket.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "tests/unit/ScopedEnvironment.h"

namespace larder::testing {

namespace fs = std::filesystem;

// The manifest digests of `bytes`, SHA-256 per chunk in lower-case hex,
// computed here independently of the code under test.
inline std::vector<std::string> chunkDigests(std::string_view bytes, std::size_t chunkSize) {
  std::vector<std::string> digests;
  for (std::size_t offset = 0; offset < bytes.size(); offset += chunkSize) {
    const std::string_view chunk = bytes.substr(offset, chunkSize);
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    EVP_Digest(chunk.data(), chunk.size(), digest, &length, EVP_sha256(), nullptr);
    std::string& hex = digests.emplace_back();
    for (unsigned int i = 0; i < length; ++i) {
      hex += "0123456789abcdef"[digest[i] >> 4u];
      hex += "0123456789abcdef"[digest[i] & 0xfu];
    }
  }
  return digests;
}

inline std::string randomBytes(std::size_t size, unsigned seed) {
  std::mt19937_64 generator(seed);
  std::string bytes(size, '\0');
  for (std::size_t offset = 0; offset < size; offset += 8) {
    const std::uint64_t word = generator();
    std::memcpy(bytes.data() + offset, &word, std::min<std::size_t>(8, size - offset));
  }
  return bytes;
}

inline std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

inline std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

inline void writeFile(const fs::path& path, std::string_view bytes) {
  fs::create_directories(path.parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
}

// Every path below `root`, relative to it, sorted; empty when it is gone.
inline std::vector<std::string> treeOf(const fs::path& root) {
  std::vector<std::string> paths;
  std::error_code code;
  if (!fs::exists(root, code)) return paths;
  for (fs::recursive_directory_iterator it(root, code), end; !code && it != end;
       it.increment(code)) {
    paths.push_back(fs::relative(it->path(), root).string());
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

// A tar archive written entry by entry, hostile entries included: the
// archive writer keeps names and link targets exactly as given.
class TarBuilder {
 public:
  TarBuilder& directory(const std::string& name) { return add({name, AE_IFDIR, 0755}); }
  TarBuilder& file(const std::string& name, std::string contents, int mode = 0644) {
    return add({name, AE_IFREG, mode, std::move(contents)});
  }
  TarBuilder& symlink(const std::string& name, const std::string& target) {
    return add({name, AE_IFLNK, 0777, "", target});
  }
  TarBuilder& hardlink(const std::string& name, const std::string& target) {
    return add({name, AE_IFREG, 0644, "", "", target});
  }
  TarBuilder& fifo(const std::string& name) { return add({name, AE_IFIFO, 0644}); }
  TarBuilder& characterDevice(const std::string& name) { return add({name, AE_IFCHR, 0644}); }

  [[nodiscard]] std::string bytes() const {
    archive* writer = archive_write_new();
    archive_write_set_format_pax_restricted(writer);
    archive_write_set_bytes_in_last_block(writer, 1);
    std::string output;
    archive_write_open(writer, &output, nullptr, &TarBuilder::append, nullptr);
    for (const Entry& entry : entries_) {
      archive_entry* header = archive_entry_new();
      archive_entry_set_pathname(header, entry.name.c_str());
      archive_entry_set_filetype(header, entry.type);
      archive_entry_set_perm(header, entry.mode);
      archive_entry_set_mtime(header, 1700000000, 0);
      if (!entry.linkTarget.empty()) archive_entry_set_symlink(header, entry.linkTarget.c_str());
      if (!entry.hardlinkTarget.empty())
        archive_entry_set_hardlink(header, entry.hardlinkTarget.c_str());
      if (entry.type == AE_IFCHR) archive_entry_set_rdev(header, makedev(1, 3));
      const bool hasData = entry.type == AE_IFREG && entry.hardlinkTarget.empty();
      archive_entry_set_size(header, hasData ? static_cast<la_int64_t>(entry.contents.size()) : 0);
      archive_write_header(writer, header);
      if (hasData) archive_write_data(writer, entry.contents.data(), entry.contents.size());
      archive_entry_free(header);
    }
    archive_write_close(writer);
    archive_write_free(writer);
    return output;
  }

 private:
  struct Entry {
    std::string name;
    unsigned type;
    int mode;
    std::string contents, linkTarget, hardlinkTarget;
  };

  TarBuilder& add(Entry entry) {
    entries_.push_back(std::move(entry));
    return *this;
  }

  static la_ssize_t append(archive*, void* context, const void* buffer, size_t length) {
    static_cast<std::string*>(context)->append(static_cast<const char*>(buffer), length);
    return static_cast<la_ssize_t>(length);
  }

  std::vector<Entry> entries_;
};

inline std::string bundleInfo(const std::string& identifier, const std::string& version) {
  return PropertyListSerialization::writeXml(
      PlistDictionary{{"HostBundleIdentifier", identifier},
                      {"HostBundleVersion", version},
                      {"HostBundleShortVersionString", version},
                      {"HostBundleExecutable", "run"}});
}

// A well-formed package: "<name>.app" with its information list, an
// executable, and a payload of `payloadSize` bytes.
inline std::string bundlePackage(const std::string& name, const std::string& identifier,
                                 const std::string& version, std::size_t payloadSize = 4096,
                                 unsigned seed = 1) {
  const std::string top = name + ".app/";
  return TarBuilder()
      .directory(top)
      .file(top + "bundle.plist", bundleInfo(identifier, version))
      .directory(top + "bin/")
      .file(top + "bin/run", "#!/bin/sh\necho " + version + "\n", 0755)
      .directory(top + "resources/")
      .file(top + "resources/payload.bin", randomBytes(payloadSize, seed))
      .file(top + "resources/version.txt", version)
      .bytes();
}

// Installs a bundle directly, as if the store had installed it before.
inline void installBundleDirectly(const fs::path& path, const std::string& identifier,
                                  const std::string& version) {
  writeFile(path / "bundle.plist", bundleInfo(identifier, version));
  writeFile(path / "purchase.plist",
            PropertyListSerialization::writeXml(
                PlistDictionary{{"bundleIdentifier", identifier}, {"bundleVersion", version}}));
  writeFile(path / "resources/version.txt", version);
  writeFile(path / "resources/only-in-old.txt", "old");
}

// LARDER_ROOT and HOME point into a fresh folder for the test's lifetime,
// so that the application registry sees only the test's bundles.
class PrivateRoot {
 public:
  PrivateRoot() {
    std::string pattern = (fs::temp_directory_path() / "larder-download-XXXXXX").string();
    base_ = fs::path(::mkdtemp(pattern.data()));
    fs::create_directories(applications());
    fs::create_directories(base_ / "home");
    environment_.set("LARDER_ROOT", root().string());
    environment_.set("HOME", (base_ / "home").string());
  }
  ~PrivateRoot() {
    environment_.restore();
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }
  PrivateRoot(const PrivateRoot&) = delete;
  PrivateRoot& operator=(const PrivateRoot&) = delete;

  [[nodiscard]] fs::path root() const { return base_ / "root"; }
  [[nodiscard]] fs::path applications() const { return root() / "Applications"; }
  [[nodiscard]] fs::path downloads() const { return base_ / "cache/Downloads"; }
  [[nodiscard]] fs::path scratch() const { return base_ / "scratch"; }

  [[nodiscard]] VendRuntimeConfiguration configuration(double requestTimeout = 5) const {
    VendRuntimeConfiguration configuration;
    configuration.downloadsDirectory = downloads().string();
    configuration.stateDirectory = (base_ / "state").string();
    configuration.requestTimeout = requestTimeout;
    configuration.connectTimeout = std::chrono::milliseconds(2000);
    return configuration;
  }

 private:
  fs::path base_;
  ScopedEnvironment environment_;
};

// A runtime of the test's own, in a private root, installed as the shared
// one, so that operations, whose services come from the shared runtime,
// reach what the test gives it. The next user makes a shared runtime from
// the environment again.
class SharedRuntime {
 public:
  explicit SharedRuntime(std::string bagURL = "") {
    VendRuntimeConfiguration configuration = root_.configuration();
    configuration.bagURL = std::move(bagURL);
    runtime_ = std::make_shared<VendRuntime>(configuration);
    VendRuntime::setShared(runtime_);
  }
  ~SharedRuntime() { VendRuntime::setShared(nullptr); }
  SharedRuntime(const SharedRuntime&) = delete;
  SharedRuntime& operator=(const SharedRuntime&) = delete;

  [[nodiscard]] const std::shared_ptr<VendRuntime>& get() const { return runtime_; }

 private:
  PrivateRoot root_;
  std::shared_ptr<VendRuntime> runtime_;
};

// Serves bodies on 127.0.0.1 with range requests, records every request
// and can fail the ways a store fails.
class StoreServer {
 public:
  enum class Fault {
    kNone,
    kCorrupt,      // one byte in the middle flipped
    kTruncate,     // the connection closes halfway
    kStatus500,    // an error status instead of the file
    kStall,        // half the file, then nothing until the server stops
    kGate,         // `gateBytes` of the file, then the rest once the gate opens
    kIgnoreRange,  // always the whole file with 200
  };
  struct Seen {
    std::string target;  // with the query
    httplib::Headers headers;
  };

  StoreServer() {
    server_.Get(R"(/(.*))", [this](const httplib::Request& request, httplib::Response& response) {
      serve(request, response);
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    // `stop` is lost on a server whose accept loop has not begun yet.
    while (!server_.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  ~StoreServer() {
    {
      std::lock_guard lock(mutex_);
      stopping_ = gateOpen_ = true;
    }
    changed_.notify_all();
    server_.stop();
    thread_.join();
  }
  StoreServer(const StoreServer&) = delete;
  StoreServer& operator=(const StoreServer&) = delete;

  std::string add(const std::string& path, std::string bytes, Fault fault = Fault::kNone,
                  int status = 200) {
    std::lock_guard lock(mutex_);
    resources_[path] = {std::move(bytes), fault, status};
    return url(path);
  }
  void setFault(const std::string& path, Fault fault) {
    std::lock_guard lock(mutex_);
    resources_[path].fault = fault;
  }
  void setGateBytes(std::size_t bytes) {
    std::lock_guard lock(mutex_);
    gateBytes_ = bytes;
  }
  void openGate() {
    {
      std::lock_guard lock(mutex_);
      gateOpen_ = true;
    }
    changed_.notify_all();
  }
  // Waits until a gated or stalled transfer has sent its first part.
  bool waitUntilGateReached(std::chrono::milliseconds limit) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, limit, [this] { return gateReached_; });
  }

  [[nodiscard]] std::string url(const std::string& path) const {
    return "http://127.0.0.1:" + std::to_string(port_) + path;
  }
  [[nodiscard]] std::vector<Seen> requests(const std::string& path) const {
    std::lock_guard lock(mutex_);
    const auto found = seen_.find(path);
    return found == seen_.end() ? std::vector<Seen>{} : found->second;
  }
  [[nodiscard]] std::size_t requestCount(const std::string& path) const {
    return requests(path).size();
  }
  [[nodiscard]] std::size_t totalRequests() const {
    std::lock_guard lock(mutex_);
    std::size_t total = 0;
    for (const auto& [path, seen] : seen_) total += seen.size();
    return total;
  }
  // The Range header of each request for `path`, "" when there was none.
  [[nodiscard]] std::vector<std::string> rangeHeaders(const std::string& path) const {
    std::vector<std::string> ranges;
    for (const Seen& seen : requests(path)) {
      const auto found = seen.headers.find("Range");
      ranges.push_back(found == seen.headers.end() ? "" : found->second);
    }
    return ranges;
  }

  // A port on which nothing listens: connections to it are refused.
  static int refusingPort() {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address));
    socklen_t length = sizeof(address);
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    ::close(fd);
    return ntohs(address.sin_port);
  }

 private:
  struct Resource {
    std::string bytes;
    Fault fault = Fault::kNone;
    int status = 200;
  };

  void serve(const httplib::Request& request, httplib::Response& response) {
    Resource resource;
    {
      std::lock_guard lock(mutex_);
      seen_[request.path].push_back({request.target, request.headers});
      const auto found = resources_.find(request.path);
      if (found == resources_.end()) {
        response.status = 404;
        return;
      }
      resource = found->second;
    }
    auto shared = std::make_shared<std::string>(std::move(resource.bytes));
    switch (resource.fault) {
      case Fault::kNone:
      case Fault::kCorrupt:
        if (resource.fault == Fault::kCorrupt) (*shared)[shared->size() / 2] ^= 0x5a;
        response.status = resource.status;
        response.set_content(*shared, "application/octet-stream");
        return;
      case Fault::kStatus500:
        response.status = 500;
        response.set_content("the store is broken", "text/plain");
        return;
      case Fault::kIgnoreRange:
        // A provider without length, which httplib does not cut to ranges.
        response.set_chunked_content_provider(
            "application/octet-stream", [shared](size_t offset, httplib::DataSink& sink) {
              if (offset < shared->size())
                sink.write(shared->data() + offset, shared->size() - offset);
              else
                sink.done();
              return true;
            });
        return;
      case Fault::kTruncate:
      case Fault::kStall:
      case Fault::kGate:
        break;
    }
    const Fault fault = resource.fault;
    const std::size_t cut = fault == Fault::kGate ? gateBytes() : shared->size() / 2;
    response.set_content_provider(
        shared->size(), "application/octet-stream",
        [this, shared, fault, cut](size_t offset, size_t length, httplib::DataSink& sink) {
          const std::size_t end = offset + length;
          if (offset < cut) {
            sink.write(shared->data() + offset, std::min(end, cut) - offset);
            return true;  // asked again from where this piece ends
          }
          if (fault == Fault::kTruncate) return false;
          std::unique_lock lock(mutex_);
          gateReached_ = true;
          changed_.notify_all();
          changed_.wait(lock, [&] { return stopping_ || (fault == Fault::kGate && gateOpen_); });
          if (stopping_) return false;
          lock.unlock();
          sink.write(shared->data() + offset, end - offset);
          return true;
        });
  }

  std::size_t gateBytes() {
    std::lock_guard lock(mutex_);
    return gateBytes_;
  }

  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::map<std::string, Resource> resources_;
  std::map<std::string, std::vector<Seen>> seen_;
  std::size_t gateBytes_ = 0;
  bool gateOpen_ = false;
  bool gateReached_ = false;
  bool stopping_ = false;
};

// An asset of a package served at `url`, with its manifest digests.
inline TillDownloadAsset assetFor(const std::string& url, std::string_view bytes,
                                  std::size_t chunkSize) {
  TillDownloadAsset asset;
  asset.setType(TillDownloadAsset::kTypeSoftwarePackage);
  asset.setURLRequest(VendURLRequest(url));
  asset.setFileSize(static_cast<std::int64_t>(bytes.size()));
  asset.setNumberOfBytesToHash(static_cast<std::int64_t>(chunkSize));
  asset.setHashes(chunkDigests(bytes, chunkSize));
  return asset;
}

inline std::shared_ptr<TillDownload> downloadFor(std::uint64_t itemIdentifier,
                                                 const std::string& bundleIdentifier,
                                                 TillDownloadAsset asset,
                                                 std::int64_t downloadType = 1) {
  TillDownloadMetadata metadata;
  metadata.setItemIdentifier(itemIdentifier);
  metadata.setBundleIdentifier(bundleIdentifier);
  metadata.setBundleVersion("1.0");
  metadata.setTitle("Item " + std::to_string(itemIdentifier));
  auto download = TillDownload::initWithAssets({std::move(asset)}, std::move(metadata));
  download->setDownloadType(downloadType);
  return download;
}

// The replies of a download, waited for.
struct ReplyWaiter {
  struct Answer {
    bool success = false;
    OptionalError error;
  };

  std::function<void(bool, OptionalError)> callback() {
    return [this](bool success, OptionalError error) {
      std::lock_guard lock(mutex);
      answers.push_back({success, std::move(error)});
      changed.notify_all();
    };
  }
  // The first answer, or nullopt when none came within `limit`.
  std::optional<Answer> wait(std::chrono::milliseconds limit = std::chrono::seconds(30)) {
    std::unique_lock lock(mutex);
    if (!changed.wait_for(lock, limit, [this] { return !answers.empty(); })) return std::nullopt;
    return answers.front();
  }
  std::size_t count() {
    std::lock_guard lock(mutex);
    return answers.size();
  }

  std::mutex mutex;
  std::condition_variable changed;
  std::vector<Answer> answers;
};

}  // namespace larder::testing
