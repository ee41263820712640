#include "store-runtime/http/CryptoLibrary.h"

#include <optional>
#include <string>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

Result<CryptoLibrary> load() {
  Result<SharedLibrary> library = SharedLibrary::open("libcrypto.so.3");
  if (!library) return library.error();
  CryptoLibrary f;
  const bool resolved =
      library->resolve(f.sha256, "EVP_sha256") && library->resolve(f.md5, "EVP_md5") &&
      library->resolve(f.digest, "EVP_Digest") &&
      library->resolve(f.contextNew, "EVP_MD_CTX_new") &&
      library->resolve(f.contextFree, "EVP_MD_CTX_free") &&
      library->resolve(f.digestInit, "EVP_DigestInit_ex") &&
      library->resolve(f.digestUpdate, "EVP_DigestUpdate") &&
      library->resolve(f.digestFinal, "EVP_DigestFinal_ex") && library->resolve(f.hmac, "HMAC") &&
      library->resolve(f.constantTimeCompare, "CRYPTO_memcmp");
  if (!resolved) return library->missingSymbolError();
  return f;
}

}  // namespace

const CryptoLibrary& CryptoLibrary::shared() {
  return SharedLibrary::sharedTable("libcrypto", &load);
}

}  // namespace larder
