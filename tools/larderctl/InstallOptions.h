#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace larder {

// What `larderctl install` was asked to install; kept apart from the
// command so that the manual and the completion can be written without
// the bus.
struct InstallOptions {
  std::vector<std::uint64_t> items;
  std::vector<std::string> osKeys;
  bool all = false;
  bool critical = false;
  std::vector<std::string> tags;
  std::optional<std::uint64_t> fallbackItem;
};

}  // namespace larder
