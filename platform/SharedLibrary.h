#pragma once

#include <memory>
#include <optional>
#include <string>

namespace larder {

// A shared library opened at run time, for dependencies that only some
// work needs: the process pays for their pages when that work first comes,
// not from the start. The library stays mapped until the process ends, so
// the functions taken from it never dangle.
class SharedLibrary {
 public:
  // nullopt, with the loader's reason in *error, when it cannot be opened.
  static std::optional<SharedLibrary> open(const std::string& soname, std::string* error);

  // Sets `function` to the library's `name`; false, with the reason in
  // *error, when the library has no such symbol.
  template <typename Function>
  bool resolve(Function*& function, const char* name, std::string* error) const {
    void* address = symbol(name, error);
    function = reinterpret_cast<Function*>(address);
    return address != nullptr;
  }

 private:
  explicit SharedLibrary(void* handle);
  void* symbol(const char* name, std::string* error) const;

  std::shared_ptr<void> handle_;
};

}  // namespace larder
