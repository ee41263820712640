#pragma once

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

namespace larder {

// libcrypto, opened when the first request is signed or the first digest
// is taken: an idle service has no use for its 1.5 MB of pages. The
// functions are called through the table, never by name, so that the
// service does not link the library.
struct CryptoLibrary {
  decltype(&::EVP_sha256) sha256 = nullptr;
  decltype(&::EVP_md5) md5 = nullptr;
  decltype(&::EVP_Digest) digest = nullptr;
  decltype(&::EVP_MD_CTX_new) contextNew = nullptr;
  decltype(&::EVP_MD_CTX_free) contextFree = nullptr;
  decltype(&::EVP_DigestInit_ex) digestInit = nullptr;
  decltype(&::EVP_DigestUpdate) digestUpdate = nullptr;
  decltype(&::EVP_DigestFinal_ex) digestFinal = nullptr;
  decltype(&::HMAC) hmac = nullptr;
  decltype(&::CRYPTO_memcmp) constantTimeCompare = nullptr;

  // The library, opened once. Throws std::runtime_error when it cannot be
  // loaded: without it no request can be signed nor download checked, and
  // the package that installed the service depends on it.
  static const CryptoLibrary& shared();
};

}  // namespace larder
