#include "platform/system/SharedLibrary.h"

#include <dlfcn.h>

namespace larder {

std::optional<SharedLibrary> SharedLibrary::open(const std::string& soname, std::string* error) {
  // RTLD_NODELETE: a thread may still be inside the library when the last
  // handle goes at exit.
  void* handle = ::dlopen(soname.c_str(), RTLD_NOW | RTLD_LOCAL | RTLD_NODELETE);
  if (!handle) {
    if (error) *error = ::dlerror();
    return std::nullopt;
  }
  return SharedLibrary(handle);
}

SharedLibrary::SharedLibrary(void* handle)
    : handle_(handle, [](void* opened) { ::dlclose(opened); }) {}

void* SharedLibrary::symbol(const char* name, std::string* error) const {
  ::dlerror();
  void* address = ::dlsym(handle_.get(), name);
  if (!address && error) *error = std::string("no ") + name + " in the library";
  return address;
}

}  // namespace larder
