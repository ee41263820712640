#include "store-runtime/http/CurlLibrary.h"

#include <optional>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

Result<CurlLibrary> load() {
  Result<SharedLibrary> library = SharedLibrary::open("libcurl.so.4");
  if (!library) return library.error();
  decltype(&::curl_global_init) globalInit = nullptr;
  CurlLibrary f;
  const bool resolved =
      library->resolve(globalInit, "curl_global_init") &&
      library->resolve(f.easyInit, "curl_easy_init") &&
      library->resolve(f.easyCleanup, "curl_easy_cleanup") &&
      library->resolve(f.easySetopt, "curl_easy_setopt") &&
      library->resolve(f.easyGetinfo, "curl_easy_getinfo") &&
      library->resolve(f.easyPerform, "curl_easy_perform") &&
      library->resolve(f.easyStrerror, "curl_easy_strerror") &&
      library->resolve(f.slistAppend, "curl_slist_append") &&
      library->resolve(f.slistFreeAll, "curl_slist_free_all") &&
      library->resolve(f.url, "curl_url") && library->resolve(f.urlCleanup, "curl_url_cleanup") &&
      library->resolve(f.urlSet, "curl_url_set") && library->resolve(f.urlGet, "curl_url_get") &&
      library->resolve(f.free, "curl_free");
  if (!resolved) return library->missingSymbolError();
  if (globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
    return VendError::withDomain(std::string(SharedLibrary::kErrorDomain), 3,
                                 "libcurl did not initialise");
  }
  return f;
}

}  // namespace

Result<const CurlLibrary*> CurlLibrary::shared() {
  // Loaded under the static's own guard, so the first transfers of several
  // threads wait for one load.
  static const Result<CurlLibrary> curl = load();
  if (curl) return &*curl;
  return VendError::withDomain(curl.error().domain, curl.error().code,
                               "libcurl could not be loaded: " + curl.error().description);
}

}  // namespace larder
