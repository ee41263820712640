#pragma once

#include <memory>
#include <string>

namespace larder {

// Whether the machine runs on mains power, for activities that must not run on battery.
//
// The system source reads the kernel's power supplies, <root>/sys/class/power_supply/*/ (below
// the platform root, so that tests and the demo can fake them), afresh at every question:
//  - a supply of an external type ("Mains", or "USB" and its variants) whose "online" is 1
//    means mains power;
//  - otherwise, any battery or any external supply at all means battery: a laptop unplugged;
//  - no supplies at all is a desktop or a virtual machine, and counts as mains power.
class BackgroundActivityPowerSource {
 public:
  virtual ~BackgroundActivityPowerSource() = default;

  [[nodiscard]] virtual bool isOnMainsPower() const = 0;

  static std::shared_ptr<BackgroundActivityPowerSource> system();

  // The rule above, applied to one folder of supplies.
  static bool mainsPowerInSupplyFolder(const std::string& folder);
};

}  // namespace larder
