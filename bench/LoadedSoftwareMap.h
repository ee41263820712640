#pragma once

#include <cstddef>
#include <memory>

#include "ProductStoreFixture.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"

namespace larder::bench {

// A software map loaded from a persisted store of `count` products, without
// discovery and without log lines, ready for lookups.
struct LoadedSoftwareMap {
  explicit LoadedSoftwareMap(std::size_t count) : fixture(count) {
    TillLogManager::sharedManager().setLevel(0);
    map = std::make_unique<SoftwareMap>(
        SoftwareMap::Options{fixture.storePath(), /*discoverApplications=*/false});
    map->waitUntilIdle();
  }

  ProductStoreFixture fixture;
  std::unique_ptr<SoftwareMap> map;
};

}  // namespace larder::bench
