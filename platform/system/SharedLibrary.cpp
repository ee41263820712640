#include "platform/system/SharedLibrary.h"

#include <dlfcn.h>

namespace larder {

Result<SharedLibrary> SharedLibrary::open(const std::string& soname) {
  // RTLD_NODELETE: a thread may still be inside the library when the last
  // handle goes at exit.
  void* handle = ::dlopen(soname.c_str(), RTLD_NOW | RTLD_LOCAL | RTLD_NODELETE);
  if (!handle) return VendError::withDomain(std::string(kErrorDomain), 1, ::dlerror());
  return SharedLibrary(handle);
}

VendError SharedLibrary::missingSymbolError() const {
  return VendError::withDomain(std::string(kErrorDomain), 2,
                               "no " + missingSymbol_ + " in the library");
}

SharedLibrary::SharedLibrary(void* handle)
    : handle_(handle, [](void* opened) { ::dlclose(opened); }) {}

void* SharedLibrary::symbol(const char* name) const {
  ::dlerror();
  return ::dlsym(handle_.get(), name);
}

}  // namespace larder
