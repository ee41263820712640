#include "store-runtime/records/VendChunkDigestRules.h"

#include <algorithm>
#include <cctype>

namespace larder {

namespace {

bool isHexDigits(const std::string& text) {
  return std::all_of(text.begin(), text.end(),
                     [](char digit) { return std::isxdigit(static_cast<unsigned char>(digit)); });
}

}  // namespace

std::optional<std::string> VendChunkDigestRules::chunkSizeProblem(std::uint64_t chunkSize) {
  if (chunkSize == 0) return "chunk size is 0";
  if (chunkSize > kMaxChunkSize) {
    return "chunk size " + std::to_string(chunkSize) + " is over the limit of " +
           std::to_string(kMaxChunkSize) + " bytes";
  }
  return std::nullopt;
}

std::optional<std::string> VendChunkDigestRules::digestListProblem(
    const std::vector<std::string>& hexDigests) {
  if (hexDigests.empty()) return "no digests";
  const std::size_t hexLength = hexDigests.front().size();
  if (hexLength != 2 * kSha256Length && hexLength != 2 * kMd5Length) {
    return "digest \"" + hexDigests.front() + "\" is neither SHA-256 nor MD5 hex";
  }
  for (std::size_t i = 0; i < hexDigests.size(); ++i) {
    if (hexDigests[i].size() != hexLength || !isHexDigits(hexDigests[i])) {
      return "digest " + std::to_string(i) + " (\"" + hexDigests[i] + "\") is not " +
             std::to_string(hexLength) + " hex digits";
    }
  }
  return std::nullopt;
}

}  // namespace larder
