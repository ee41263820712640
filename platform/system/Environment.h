#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace larder {

// Where the service finds the platform and keeps its own files. Every
// absolute platform path ("/Applications", "/var/db/...") is read below the
// platform root, so that tests and the demo run against a private tree.
// Values come from the process environment at each call: nothing is cached.
class Environment {
 public:
  // LARDER_ROOT, default "/". Never ends in "/" unless it is "/".
  static std::string platformRoot();
  // `absolutePath` ("/Applications") below the platform root.
  static std::string rootedPath(std::string_view absolutePath);
  // True when `path` lies below `rootedPath(absolutePrefix)`; the prefix
  // ends with "/" when a folder is meant ("/Applications/").
  static bool isBelowRootedPrefix(std::string_view path, std::string_view absolutePrefix);

  static std::string homeDirectory();
  // $XDG_CACHE_HOME, default ~/.cache.
  static std::string cacheHome();
  // $XDG_STATE_HOME/larder, default ~/.local/state/larder.
  static std::string stateDirectory();
  // $XDG_CONFIG_HOME/larder, default ~/.config/larder.
  static std::string userConfigDirectory();
  // $XDG_DATA_HOME/larder, default ~/.local/share/larder: the user's data
  // that is neither cache nor state (the installed-updates journal).
  static std::string dataDirectory();

  // Reads a variable; empty when unset.
  static std::string variable(const char* name);
  // Reads a variable whose being set means something even when its value
  // is empty; nullopt when unset.
  static std::optional<std::string> variableIfSet(const char* name);
};

}  // namespace larder
