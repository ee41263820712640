#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace larder {

// The body of a cloud library items request, read back: an `adsr`
// container with the time (`mstc`), the session (`mlid`), the item kind
// (`mikd`), the two revisions (`musr` latest, `mder` local), an optional
// media kind query (`mque`) and the token list (`aetl` of `aeti`, each
// with `aeto` and `mild`). The client writes the body (`DAAPClient`); this
// reader is the server's side, used by the reference store and by tests.
//
// The body comes off the network: every read stays inside its tag, a field
// whose value has the wrong width is left absent, a token entry without
// both numbers is skipped, and unknown tags are passed over.
class DAAPItemsRequest {
 public:
  // One item the client holds: its cloud id and purchased token.
  struct TokenPair {
    std::uint64_t clientID = 0;
    std::uint32_t tokenCode = 0;
    friend bool operator==(const TokenPair&, const TokenPair&) = default;
  };

  // Nothing when the body is not one whole `adsr` container.
  static std::optional<DAAPItemsRequest> parse(std::span<const std::uint8_t> body);

  std::optional<std::uint32_t> utcTime;
  std::optional<std::uint32_t> sessionID;
  std::optional<std::uint8_t> itemKind;
  std::optional<std::uint32_t> latestVersion;
  std::optional<std::uint32_t> localVersion;
  // The `mque` bytes as text; not checked to be UTF-8.
  std::optional<std::string> query;
  std::vector<TokenPair> tokenPairs;

 private:
  void readTokenList(std::span<const std::uint8_t> list);
  void readField(std::uint32_t code, std::span<const std::uint8_t> value);
};

}  // namespace larder
