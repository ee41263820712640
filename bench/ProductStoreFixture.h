#pragma once

// A temporary platform whose persisted software map holds `count` products,
// for benchmarks of the map and of the service.
#include <stdlib.h>

#include <filesystem>
#include <string>

#include "bench/BenchFiles.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/system/FileIO.h"
#include "store-runtime/records/LedgerSoftwareProduct.h"

namespace larder::bench {

class ProductStoreFixture {
 public:
  explicit ProductStoreFixture(std::size_t count) {
    std::string pattern = (std::filesystem::temp_directory_path() / "larder-bench-XXXXXX").string();
    directory_ = mkdtemp(pattern.data());
    std::filesystem::create_directories(directory_ + "/root/Applications");
    std::filesystem::create_directories(directory_ + "/home");
    PlistDictionary records;
    for (std::size_t i = 0; i < count; ++i) {
      LedgerSoftwareProductFields fields;
      fields.bundlePath = directory_ + "/root/Applications/App" + std::to_string(i) + ".app";
      fields.bundleIdentifier = bundleIdentifier(i);
      fields.bundleVersion = "1." + std::to_string(i % 100) + ".3";
      fields.itemIdentifier = 400000000 + i;
      fields.versionIdentifier = static_cast<std::int64_t>(800000 + i);
      fields.accountOpaqueID = "opaque-account-" + std::to_string(i % 7);
      fields.purchaseDate = PlistDate{1700000000.0 + static_cast<double>(i)};
      fields.installed = true;
      fields.source = 4;
      LedgerSoftwareProduct product(fields);
      records.emplace(fields.bundlePath, product.encodeWithCoder());
    }
    PlistValue root =
        KeyedArchive::dictionary({{"appsByPath", KeyedArchive::dictionary(std::move(records))}});
    larder::bench::writeFixture(storePath(), KeyedArchive::archivedData(root));
  }
  ~ProductStoreFixture() {
    std::error_code code;
    std::filesystem::remove_all(directory_, code);
  }
  ProductStoreFixture(const ProductStoreFixture&) = delete;
  ProductStoreFixture& operator=(const ProductStoreFixture&) = delete;

  static std::string bundleIdentifier(std::size_t i) {
    return "com.example.app" + std::to_string(i);
  }
  [[nodiscard]] const std::string& directory() const { return directory_; }
  [[nodiscard]] std::string cacheHome() const { return directory_ + "/home/.cache"; }
  [[nodiscard]] std::string storePath() const {
    return cacheHome() + "/com.orvane.tradeline/SoftwareMap";
  }

 private:
  std::string directory_;
};

}  // namespace larder::bench
