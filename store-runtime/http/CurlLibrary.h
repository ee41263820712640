#pragma once

// The functions are called through the table, never by name, so that the
// service does not link libcurl; the type checks of curl.h's macros would
// name them.
#define CURL_DISABLE_TYPECHECK
#include <curl/curl.h>

#include <string>

#include "platform/error/Result.h"

namespace larder {

// libcurl, opened on the first transfer. The transport and what it pulls
// in (TLS, Kerberos, LDAP, IDN, HTTP/2) cost an idle service about 4 MB
// resident; most of its life the service waits for the next exchange with
// the store, so it loads them when that exchange comes.
struct CurlLibrary {
  decltype(&::curl_easy_init) easyInit = nullptr;
  decltype(&::curl_easy_cleanup) easyCleanup = nullptr;
  decltype(&::curl_easy_setopt) easySetopt = nullptr;
  decltype(&::curl_easy_getinfo) easyGetinfo = nullptr;
  decltype(&::curl_easy_perform) easyPerform = nullptr;
  decltype(&::curl_easy_strerror) easyStrerror = nullptr;
  decltype(&::curl_slist_append) slistAppend = nullptr;
  decltype(&::curl_slist_free_all) slistFreeAll = nullptr;
  decltype(&::curl_url) url = nullptr;
  decltype(&::curl_url_cleanup) urlCleanup = nullptr;
  decltype(&::curl_url_set) urlSet = nullptr;
  decltype(&::curl_url_get) urlGet = nullptr;
  decltype(&::curl_free) free = nullptr;

  // The library, opened and initialised once, or why it cannot be loaded.
  static Result<const CurlLibrary*> shared();
};

}  // namespace larder
