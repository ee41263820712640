#include "platform/system/Environment.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>

namespace larder {

namespace {

std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

std::string xdgDirectory(const char* variableName, std::string_view fallbackBelowHome) {
  std::string value = Environment::variable(variableName);
  if (!value.empty() && value.front() == '/') return withoutTrailingSlashes(value);
  return Environment::homeDirectory() + "/" + std::string(fallbackBelowHome);
}

}  // namespace

std::string Environment::variable(const char* name) {
  const char* value = std::getenv(name);  // NOLINT(concurrency-mt-unsafe): nothing sets variables
  return value ? std::string(value) : std::string();
}

std::optional<std::string> Environment::variableIfSet(const char* name) {
  const char* value = std::getenv(name);  // NOLINT(concurrency-mt-unsafe): nothing sets variables
  return value ? std::optional<std::string>(value) : std::nullopt;
}

std::string Environment::platformRoot() {
  std::string root = variable("LARDER_ROOT");
  if (root.empty()) return "/";
  return withoutTrailingSlashes(root);
}

std::string Environment::rootedPath(std::string_view absolutePath) {
  std::string root = platformRoot();
  if (root == "/") return std::string(absolutePath);
  if (!absolutePath.empty() && absolutePath.front() != '/') root += '/';
  return root + std::string(absolutePath);
}

bool Environment::isBelowRootedPrefix(std::string_view path, std::string_view absolutePrefix) {
  std::string prefix = rootedPath(absolutePrefix);
  return path.size() >= prefix.size() && path.substr(0, prefix.size()) == prefix;
}

std::string Environment::homeDirectory() {
  std::string home = variable("HOME");
  if (!home.empty()) return withoutTrailingSlashes(home);
  if (const passwd* entry = getpwuid(getuid()); entry && entry->pw_dir) return entry->pw_dir;
  return "/";
}

std::string Environment::cacheHome() {
  return xdgDirectory("XDG_CACHE_HOME", ".cache");
}

std::string Environment::stateDirectory() {
  return xdgDirectory("XDG_STATE_HOME", ".local/state") + "/larder";
}

std::string Environment::userConfigDirectory() {
  return xdgDirectory("XDG_CONFIG_HOME", ".config") + "/larder";
}

std::string Environment::dataDirectory() {
  return xdgDirectory("XDG_DATA_HOME", ".local/share") + "/larder";
}

}  // namespace larder
