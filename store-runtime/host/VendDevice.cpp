#include "store-runtime/host/VendDevice.h"

#include <sys/statvfs.h>
#include <sys/utsname.h>

#include <algorithm>
#include <cctype>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "platform/system/Uuid.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendDevice";
constexpr std::size_t kMaxSmallFileBytes = 64u * 1024u;

std::optional<std::string> readSmallTextFile(const std::string& path) {
  std::optional<PlistData> bytes = FileIO::read(path, kMaxSmallFileBytes).optional();
  if (!bytes) return std::nullopt;
  return std::string(bytes->begin(), bytes->end());
}

std::string_view trimmed(std::string_view text) {
  while (!text.empty() && std::isspace(static_cast<unsigned char>(text.front())))
    text.remove_prefix(1);
  while (!text.empty() && std::isspace(static_cast<unsigned char>(text.back())))
    text.remove_suffix(1);
  return text;
}

// The value of `VERSION_ID=` in an os-release text, quotes removed.
std::string versionIdentifierOf(std::string_view osRelease) {
  constexpr std::string_view kKey = "VERSION_ID=";
  while (!osRelease.empty()) {
    std::size_t end = osRelease.find('\n');
    std::string_view line = trimmed(osRelease.substr(0, end));
    osRelease.remove_prefix(end == std::string_view::npos ? osRelease.size() : end + 1);
    if (line.substr(0, kKey.size()) != kKey) continue;
    std::string_view value = trimmed(line.substr(kKey.size()));
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') &&
        value.back() == value.front()) {
      value = value.substr(1, value.size() - 2);
    }
    return std::string(value);
  }
  return {};
}

std::string kernelMajorVersion() {
  utsname name{};
  if (::uname(&name) != 0) return {};
  return VendDevice::majorVersionOf(name.release);
}

// A machine-id is 32 hexadecimal digits; anything else is not taken.
std::optional<std::string> machineIdentifierIn(const std::string& path) {
  std::optional<std::string> text = readSmallTextFile(path);
  if (!text) return std::nullopt;
  std::string_view identifier = trimmed(*text);
  bool wellFormed =
      identifier.size() == 32 && std::all_of(identifier.begin(), identifier.end(),
                                             [](unsigned char c) { return std::isxdigit(c) != 0; });
  if (!wellFormed) return std::nullopt;
  return std::string(identifier);
}

std::string newMachineIdentifier() {
  std::string uuid = Uuid::generateString();
  std::string identifier;
  for (char c : uuid) {
    if (c != '-')
      identifier.push_back(static_cast<char>(std::tolower(static_cast<unsigned char>(c))));
  }
  return identifier;
}

// Reads the identifier kept at `path`, or makes and keeps one there.
std::optional<std::string> keptMachineIdentifier(const std::string& path) {
  if (std::optional<std::string> kept = machineIdentifierIn(path)) return kept;
  std::string made = newMachineIdentifier();
  if (!FileIO::writeAtomically(path, made + "\n")) return std::nullopt;
  // Another process may have made one at the same moment: the file decides.
  return machineIdentifierIn(path);
}

}  // namespace

std::string VendDevice::majorVersionOf(std::string_view version) {
  version = trimmed(version);
  if (!version.empty() && version.front() == '"') version.remove_prefix(1);
  std::size_t digits = 0;
  while (digits < version.size() && std::isdigit(static_cast<unsigned char>(version[digits]))) {
    ++digits;
  }
  return std::string(version.substr(0, digits));
}

std::string VendDevice::osMajorVersionString() {
  for (std::string_view file : {"/etc/os-release", "/usr/lib/os-release"}) {
    std::optional<std::string> text = readSmallTextFile(Environment::rootedPath(file));
    if (!text) continue;
    std::string major = majorVersionOf(versionIdentifierOf(*text));
    if (!major.empty()) return major;
  }
  return kernelMajorVersion();
}

std::uint64_t VendDevice::availableDiskSpace() {
  struct statvfs info {};
  std::string root = Environment::platformRoot();
  if (::statvfs(root.c_str(), &info) != 0) {
    TILL_LOG(1, "%@: Cannot read the free space of %@", kSpeaker, root);
    return 0;
  }
  return static_cast<std::uint64_t>(info.f_bavail) * static_cast<std::uint64_t>(info.f_frsize);
}

std::string VendDevice::guid() {
  if (std::optional<std::string> system =
          machineIdentifierIn(Environment::rootedPath("/etc/machine-id"))) {
    return *system;
  }
  if (std::optional<std::string> kept =
          keptMachineIdentifier(PlatformStateFile::pathForName("machine-guid"))) {
    return *kept;
  }
  if (std::optional<std::string> kept =
          keptMachineIdentifier(Environment::stateDirectory() + "/machine-guid")) {
    return *kept;
  }
  TILL_LOG(1, "%@: Cannot keep a machine identifier; using one for this call only", kSpeaker);
  return newMachineIdentifier();
}

}  // namespace larder
