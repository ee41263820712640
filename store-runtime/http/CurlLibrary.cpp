#include "store-runtime/http/CurlLibrary.h"

#include <optional>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

struct LoadedCurl {
  CurlLibrary functions;
  std::string error;
  bool loaded = false;
};

LoadedCurl load() {
  LoadedCurl result;
  std::optional<SharedLibrary> library = SharedLibrary::open("libcurl.so.4", &result.error);
  if (!library) return result;
  decltype(&::curl_global_init) globalInit = nullptr;
  CurlLibrary& f = result.functions;
  std::string* error = &result.error;
  const bool resolved = library->resolve(globalInit, "curl_global_init", error) &&
                        library->resolve(f.easyInit, "curl_easy_init", error) &&
                        library->resolve(f.easyCleanup, "curl_easy_cleanup", error) &&
                        library->resolve(f.easySetopt, "curl_easy_setopt", error) &&
                        library->resolve(f.easyGetinfo, "curl_easy_getinfo", error) &&
                        library->resolve(f.easyPerform, "curl_easy_perform", error) &&
                        library->resolve(f.easyStrerror, "curl_easy_strerror", error) &&
                        library->resolve(f.slistAppend, "curl_slist_append", error) &&
                        library->resolve(f.slistFreeAll, "curl_slist_free_all", error) &&
                        library->resolve(f.url, "curl_url", error) &&
                        library->resolve(f.urlCleanup, "curl_url_cleanup", error) &&
                        library->resolve(f.urlSet, "curl_url_set", error) &&
                        library->resolve(f.urlGet, "curl_url_get", error) &&
                        library->resolve(f.free, "curl_free", error);
  if (!resolved) return result;
  if (globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
    result.error = "libcurl did not initialise";
    return result;
  }
  result.loaded = true;
  return result;
}

}  // namespace

const CurlLibrary* CurlLibrary::shared(std::string* error) {
  // Loaded under the static's own guard, so the first transfers of several
  // threads wait for one load.
  static const LoadedCurl curl = load();
  if (curl.loaded) return &curl.functions;
  if (error) *error = "libcurl could not be loaded: " + curl.error;
  return nullptr;
}

}  // namespace larder
