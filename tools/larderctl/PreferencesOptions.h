#pragma once

#include <string>

namespace larder {

// The words of `larderctl prefs get|set|delete`.
struct PreferencesOptions {
  std::string domain;
  std::string key;
  std::string value;
  // bool, integer, real, string, date or json; empty: by the value's look.
  std::string type;
  std::string scope = "app";
};

}  // namespace larder
