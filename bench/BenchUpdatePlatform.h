#pragma once

#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/download/VendFileManager.h"
#include "update-controller/UpdateController.h"

namespace larder::bench {

// A platform root, caches and preferences of a benchmark's own (set in the
// environment, so that everything the process reads is below it), a
// software map without discovery, and controllers whose update queues start
// from a laid-out cache. The folder goes with the object.
class BenchUpdatePlatform {
 public:
  explicit BenchUpdatePlatform(const std::string& name) {
    std::string pattern = (std::filesystem::temp_directory_path() / (name + "-XXXXXX")).string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    base_ = pattern;
    ::setenv("LARDER_ROOT", (base_ + "/root").c_str(), 1);
    ::setenv("HOME", (base_ + "/home").c_str(), 1);
    ::setenv("XDG_CACHE_HOME", (base_ + "/cache").c_str(), 1);
    ::setenv("XDG_STATE_HOME", (base_ + "/state").c_str(), 1);
    ::setenv("XDG_CONFIG_HOME", (base_ + "/config").c_str(), 1);
    ::setenv("LARDER_LOG_LEVEL", "0", 1);
    std::filesystem::create_directories(base_ + "/root/Applications");
  }
  ~BenchUpdatePlatform() {
    map_.reset();
    std::error_code ignored;
    std::filesystem::remove_all(base_, ignored);
  }
  BenchUpdatePlatform(const BenchUpdatePlatform&) = delete;
  BenchUpdatePlatform& operator=(const BenchUpdatePlatform&) = delete;

  [[nodiscard]] const std::string& base() const { return base_; }

  // A controller of the client `identifier` whose queue starts with `updates`.
  std::shared_ptr<UpdateController> controllerWithUpdates(const std::string& identifier,
                                                          const PlistArray& updates) {
    const std::string folder = VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID);
    std::filesystem::create_directories(folder);
    if (!FileIO::writeAtomically(
            folder + "/updates.plist",
            PropertyListSerialization::writeBinary(
                PlistDictionary{{"updates", updates}, {"incompatibleUpdates", PlistArray{}}}))) {
      std::abort();
    }
    return UpdateController::make(
        VendStoreClient::fromDictionary({{"identifier", identifier}, {"clientType", 0}}), map());
  }

 private:
  SoftwareMap& map() {
    if (!map_) {
      SoftwareMap::Options options;
      options.persistedStorePath = base_ + "/SoftwareMap";
      options.discoverApplications = false;
      options.liveQueries = false;
      options.periodicReload = false;
      map_.emplace(std::move(options));
    }
    return *map_;
  }

  std::string base_;
  std::optional<SoftwareMap> map_;
};

}  // namespace larder::bench
