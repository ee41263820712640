#include "store-runtime/http/VendRequestSigner.h"

#include <array>

#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/CryptoLibrary.h"

namespace larder {
namespace {

PlistData message(std::string_view head, std::span<const std::uint8_t> body) {
  PlistData bytes(head.begin(), head.end());
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

}  // namespace

std::string VendRequestSigner::hmac(std::span<const std::uint8_t> text) const {
  std::array<std::uint8_t, EVP_MAX_MD_SIZE> digest{};
  unsigned int length = 0;
  const CryptoLibrary& crypto = CryptoLibrary::shared();
  crypto.hmac(crypto.sha256(), key_.data(), static_cast<int>(key_.size()), text.data(), text.size(),
              digest.data(), &length);
  return hexString({digest.data(), length});
}

std::string VendRequestSigner::requestSignature(std::string_view method, std::string_view path,
                                                std::span<const std::uint8_t> body) const {
  std::string head(method);
  head += '\n';
  head += path;
  head += '\n';
  return hmac(message(head, body));
}

std::string VendRequestSigner::answerSignature(long statusCode,
                                               std::span<const std::uint8_t> body) const {
  return hmac(message(std::to_string(statusCode) + "\n", body));
}

void VendRequestSigner::sign(VendURLRequest& request, std::uint64_t accountID) const {
  request.setValue(std::to_string(accountID), kAccountHeader);
  request.setValue(requestSignature(request.method(), pathAndQuery(request.url()), request.body()),
                   kSignatureHeader);
}

std::optional<PlistData> VendRequestSigner::verifiedBody(const VendURLResponse& response,
                                                         std::span<const std::uint8_t> body) const {
  const auto carried = response.valueForHeaderField(kSignatureHeader);
  if (!carried || !signaturesMatch(*carried, answerSignature(response.statusCode, body))) {
    return std::nullopt;
  }
  return PlistData(body.begin(), body.end());
}

bool VendRequestSigner::signaturesMatch(std::string_view a, std::string_view b) {
  return a.size() == b.size() &&
         CryptoLibrary::shared().constantTimeCompare(a.data(), b.data(), a.size()) == 0;
}

std::string VendRequestSigner::pathAndQuery(std::string_view url) {
  const auto scheme = url.find("://");
  const auto pathStart = url.find('/', scheme == std::string_view::npos ? 0 : scheme + 3);
  if (pathStart == std::string_view::npos) return "/";
  std::string path(url.substr(pathStart));
  if (const auto fragment = path.find('#'); fragment != std::string::npos) path.resize(fragment);
  return path;
}

}  // namespace larder
