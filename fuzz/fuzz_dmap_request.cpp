// What the reference store reads from clients of its cloud library: an
// items request body and a media kind query, both any bytes at all. The
// readers must neither crash nor read outside the input, and what they
// give back must be stable: a body read, written again by the client's
// writer and read once more gives the same fields; a query's kinds,
// written and read again, are the same kinds.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>
#include <string_view>

#include "dmap/DAAPClient.h"
#include "dmap/DAAPItemsRequest.h"
#include "dmap/DAAPMediaKindQuery.h"

namespace {

using larder::DAAPClient;
using larder::DAAPItemsRequest;
using larder::DAAPMediaKindQuery;

[[noreturn]] void failWith(const char* message) {
  std::fprintf(stderr, "%s\n", message);
  std::abort();
}

bool sameFields(const DAAPItemsRequest& a, const DAAPItemsRequest& b) {
  return a.utcTime == b.utcTime && a.sessionID == b.sessionID && a.itemKind == b.itemKind &&
         a.latestVersion == b.latestVersion && a.localVersion == b.localVersion &&
         a.query == b.query && a.tokenPairs == b.tokenPairs;
}

void checkBody(std::span<const std::uint8_t> bytes) {
  const auto parsed = DAAPItemsRequest::parse(bytes);
  if (!parsed) return;
  if (bytes.size() < 8) failWith("a body under 8 bytes was read");
  if (parsed->tokenPairs.size() > bytes.size() / 36) failWith("more token pairs than bytes");
  // Only a body with every field can be written again as it was read.
  if (!parsed->utcTime || !parsed->sessionID || parsed->itemKind != 2 || !parsed->latestVersion ||
      !parsed->localVersion) {
    return;
  }
  DAAPClient::TokenPairs pairs;
  for (const auto& pair : parsed->tokenPairs) {
    pairs.push_back(*DAAPClient::tokenPairWithCloudID(pair.clientID, pair.tokenCode));
  }
  const auto written =
      DAAPClient::itemsRequestBody(*parsed->utcTime, *parsed->sessionID, *parsed->latestVersion,
                                   *parsed->localVersion, parsed->query, pairs);
  const auto again = DAAPItemsRequest::parse(written);
  if (!again) failWith("the writer's body does not read back");
  if (!sameFields(*parsed, *again)) failWith("a body read, written and read again changed");
}

void checkQuery(std::string_view text) {
  const auto kinds = DAAPMediaKindQuery::parse(text);
  if (!kinds) return;
  if (kinds->empty()) failWith("a query read with no kinds");
  if (kinds->size() > DAAPMediaKindQuery::kMaxTerms) failWith("more kinds than allowed");
  const auto written = DAAPMediaKindQuery::text(*kinds);
  if (!written || DAAPMediaKindQuery::parse(*written) != kinds) {
    failWith("a query's kinds do not survive writing");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::span<const std::uint8_t> bytes(data, size);
  checkBody(bytes);
  checkQuery(std::string_view(reinterpret_cast<const char*>(data), size));
  // The query as it arrives inside a body's `mque`.
  const auto parsed = DAAPItemsRequest::parse(bytes);
  if (parsed && parsed->query) checkQuery(*parsed->query);
  return 0;
}
