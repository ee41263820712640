// Environment variables that tests change, put back as they were.
#pragma once

#include <cstdlib>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace larder::testing {

// Remembers the values of the variables it is told of and puts them back,
// in reverse order, when it goes.
class ScopedEnvironment {
 public:
  ScopedEnvironment() = default;
  ~ScopedEnvironment() { restore(); }
  ScopedEnvironment(const ScopedEnvironment&) = delete;
  ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

  // Remembers the value of `name`, for a test that changes it directly.
  void save(const std::string& name) {
    const char* old = std::getenv(name.c_str());  // NOLINT(concurrency-mt-unsafe): test setup
    saved_.emplace_back(name, old ? std::optional<std::string>(old) : std::nullopt);
  }
  void set(const std::string& name, const std::string& value) {
    save(name);
    ::setenv(name.c_str(), value.c_str(), 1);
  }
  void unset(const std::string& name) {
    save(name);
    ::unsetenv(name.c_str());
  }

  void restore() {
    for (auto it = saved_.rbegin(); it != saved_.rend(); ++it) {
      if (it->second) {
        ::setenv(it->first.c_str(), it->second->c_str(), 1);
      } else {
        ::unsetenv(it->first.c_str());
      }
    }
    saved_.clear();
  }

 private:
  std::vector<std::pair<std::string, std::optional<std::string>>> saved_;
};

}  // namespace larder::testing
