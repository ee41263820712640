#include "store-runtime/http/CryptoLibrary.h"

#include <optional>
#include <string>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

std::optional<CryptoLibrary> load(std::string* error) {
  std::optional<SharedLibrary> library = SharedLibrary::open("libcrypto.so.3", error);
  if (!library) return std::nullopt;
  CryptoLibrary f;
  const bool resolved = library->resolve(f.sha256, "EVP_sha256", error) &&
                        library->resolve(f.md5, "EVP_md5", error) &&
                        library->resolve(f.digest, "EVP_Digest", error) &&
                        library->resolve(f.contextNew, "EVP_MD_CTX_new", error) &&
                        library->resolve(f.contextFree, "EVP_MD_CTX_free", error) &&
                        library->resolve(f.digestInit, "EVP_DigestInit_ex", error) &&
                        library->resolve(f.digestUpdate, "EVP_DigestUpdate", error) &&
                        library->resolve(f.digestFinal, "EVP_DigestFinal_ex", error) &&
                        library->resolve(f.hmac, "HMAC", error) &&
                        library->resolve(f.constantTimeCompare, "CRYPTO_memcmp", error);
  if (!resolved) return std::nullopt;
  return f;
}

}  // namespace

const CryptoLibrary& CryptoLibrary::shared() {
  return SharedLibrary::sharedTable("libcrypto", &load);
}

}  // namespace larder
