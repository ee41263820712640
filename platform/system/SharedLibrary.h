#pragma once

#include <memory>
#include <optional>
#include <stdexcept>
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

  // The function table `load` fills, loaded by the first caller and kept for
  // the process; throws with the loader's reason when it cannot be had.
  // One table type has one loader, so the table is one per type.
  template <typename Table>
  static const Table& sharedTable(const char* library, std::optional<Table> (*load)(std::string*)) {
    static std::string error;
    static const std::optional<Table> table = load(&error);
    if (!table) throw std::runtime_error(std::string(library) + " could not be loaded: " + error);
    return *table;
  }

 private:
  explicit SharedLibrary(void* handle);
  void* symbol(const char* name, std::string* error) const;

  std::shared_ptr<void> handle_;
};

}  // namespace larder
