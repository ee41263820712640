#include "platform/background/BackgroundActivityPowerSource.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <string_view>

#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"

namespace larder {

namespace {

// Attribute files of sysfs are one short line; anything longer is not what we look for.
std::string firstWordOfFile(const std::string& path) {
  FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!file.valid()) return {};
  std::array<char, 64> buffer{};
  ssize_t got = -1;
  do {
    got = ::read(file.get(), buffer.data(), buffer.size());
  } while (got < 0 && errno == EINTR);
  if (got <= 0) return {};
  std::string_view text(buffer.data(), static_cast<std::size_t>(got));
  const std::size_t end = text.find_first_of(" \t\r\n");
  return std::string(text.substr(0, end));
}

bool isExternalSupply(std::string_view type) {
  return type == "Mains" || type.substr(0, 3) == "USB";
}

class SystemPowerSource final : public BackgroundActivityPowerSource {
 public:
  [[nodiscard]] bool isOnMainsPower() const override {
    return mainsPowerInSupplyFolder(Environment::rootedPath("/sys/class/power_supply"));
  }
};

}  // namespace

bool BackgroundActivityPowerSource::mainsPowerInSupplyFolder(const std::string& folder) {
  bool anySupply = false;
  std::error_code code;
  std::filesystem::directory_iterator iterator(folder, code);
  if (code) return true;
  for (std::filesystem::directory_iterator end; iterator != end; iterator.increment(code)) {
    if (code) break;
    const std::string supply = iterator->path().string();
    const std::string type = firstWordOfFile(supply + "/type");
    const bool external = isExternalSupply(type);
    if (external && firstWordOfFile(supply + "/online") == "1") return true;
    anySupply = anySupply || external || type == "Battery";
  }
  return !anySupply;
}

std::shared_ptr<BackgroundActivityPowerSource> BackgroundActivityPowerSource::system() {
  return std::make_shared<SystemPowerSource>();
}

}  // namespace larder
