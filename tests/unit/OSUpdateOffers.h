#pragma once

#include <gtest/gtest.h>

#include <future>

#include "platform/value/PlistValue.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

namespace larder::testing {

// The OS updates the system offers, found by a scan of the simulated
// framework under the platform root.
inline void offerOSUpdates(const PlistArray& catalog) {
  ASSERT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                  .updateDictionary([&](PlistDictionary& state) { state["catalog"] = catalog; }));
  std::promise<OptionalError> finished;
  SysupQuaymartUpdateController::sharedUpdateController()
      .startScanningForUpdatesIncludingPrerelease(
          true, true, true, nullptr, [](double) {},
          [&](const OptionalError& error) { finished.set_value(error); });
  ASSERT_FALSE(finished.get_future().get());
}

}  // namespace larder::testing
