#pragma once

#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>

#include "platform/error/Result.h"

namespace larder {

// A shared library opened at run time, for dependencies that only some
// work needs: the process pays for their pages when that work first comes,
// not from the start. The library stays mapped until the process ends, so
// the functions taken from it never dangle.
class SharedLibrary {
 public:
  // Failures are errors of kErrorDomain: the loader's reason, or the
  // symbol the library lacks.
  static constexpr std::string_view kErrorDomain = "SharedLibrary";

  static Result<SharedLibrary> open(const std::string& soname);

  // Sets `function` to the library's `name`; false when the library has no
  // such symbol, which `missingSymbolError` then names. Meant to be chained
  // with && over a whole function table.
  template <typename Function>
  bool resolve(Function*& function, const char* name) {
    void* address = symbol(name);
    function = reinterpret_cast<Function*>(address);
    if (!address) missingSymbol_ = name;
    return address != nullptr;
  }
  [[nodiscard]] VendError missingSymbolError() const;

  // The function table `load` fills, loaded by the first caller and kept for
  // the process; throws with the loader's reason when it cannot be had.
  // One table type has one loader, so the table is one per type.
  template <typename Table>
  static const Table& sharedTable(const char* library, Result<Table> (*load)()) {
    static const Result<Table> table = load();
    if (!table) {
      throw std::runtime_error(std::string(library) +
                               " could not be loaded: " + table.error().description);
    }
    return *table;
  }

 private:
  explicit SharedLibrary(void* handle);
  [[nodiscard]] void* symbol(const char* name) const;

  std::shared_ptr<void> handle_;
  std::string missingSymbol_;
};

}  // namespace larder
