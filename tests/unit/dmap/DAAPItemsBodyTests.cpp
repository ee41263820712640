// The wire of the client session that needs no server: the items request
// body byte for byte, the media kind query, token pairs and event names.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "DAAPTestSupport.h"
#include "dmap/DAAPClient.h"
#include "dmap/DAAPItemsRequest.h"
#include "dmap/DAAPMediaKindQuery.h"

namespace larder::dmaptest {
namespace {

using Pair = std::pair<std::uint64_t, std::uint32_t>;

// The body as the protocol lays it out, built tag by tag with the test's
// own writer, whose container sizes are summed from the children rather
// than taken from the client's arithmetic.
PlistData expectedBody(std::uint32_t time, std::uint32_t session, std::uint32_t latest,
                       std::uint32_t local, const std::optional<std::string>& query,
                       const std::vector<Pair>& pairs) {
  std::vector<Tag> fields{u32("mstc", time), u32("mlid", session), u8("mikd", 2),
                          u32("musr", latest), u32("mder", local)};
  if (query) fields.push_back(text("mque", *query));
  std::vector<Tag> entries;
  for (const auto& [cloudID, token] : pairs) {
    entries.push_back(container("aeti", {u32("aeto", token), u64("mild", cloudID)}));
  }
  fields.push_back(container("aetl", std::move(entries)));
  return document(container("adsr", std::move(fields)));
}

DAAPClient::TokenPairs tokenPairs(const std::vector<Pair>& pairs) {
  DAAPClient::TokenPairs result;
  for (const auto& [cloudID, token] : pairs) {
    result.push_back(*DAAPClient::tokenPairWithCloudID(cloudID, token));
  }
  return result;
}

std::uint32_t sizeAt(const PlistData& bytes, std::size_t offset) {
  return DAAPTagReader::readUInt32(bytes.data() + offset + 4);
}

TEST(DAAPItemsBody, WithoutQueryOrPairsIsTheProtocolsSeventyThreeBytes) {
  const PlistData body = DAAPClient::itemsRequestBody(0x01020304, 77, 9, 5, std::nullopt, {});
  const PlistData expected{
      'a', 'd', 's', 'r', 0, 0, 0, 65,                          // 65 bytes follow
      'm', 's', 't', 'c', 0, 0, 0, 4,  0x01, 0x02, 0x03, 0x04,  // the time
      'm', 'l', 'i', 'd', 0, 0, 0, 4,  0,    0,    0,    77,    // session
      'm', 'i', 'k', 'd', 0, 0, 0, 1,  2,                       // item kind
      'm', 'u', 's', 'r', 0, 0, 0, 4,  0,    0,    0,    9,     // latest
      'm', 'd', 'e', 'r', 0, 0, 0, 4,  0,    0,    0,    5,     // local
      'a', 'e', 't', 'l', 0, 0, 0, 0,                           // no pairs
  };
  EXPECT_EQ(body, expected);
}

TEST(DAAPItemsBody, QueryAndPairsAreLaidOutInOrderAndPairsWithoutBothNumbersAreLeftOut) {
  const std::string query = *DAAPMediaKindQuery::text(std::vector<std::int64_t>{2, 64});
  std::vector<Pair> many;
  for (std::uint32_t index = 0; index < 1000; ++index) many.emplace_back(90000 + index, index * 3);
  DAAPClient::TokenPairs incomplete = tokenPairs({{10, 1}});
  incomplete.push_back({{"clientID", 11}});                      // no token
  incomplete.push_back({{"tokenCode", 2}});                      // no cloud id
  incomplete.push_back({{"clientID", "12"}, {"tokenCode", 3}});  // text, not a number
  incomplete.push_back({});                                      // nothing at all
  incomplete.push_back(*DAAPClient::tokenPairWithCloudID(13, 4));
  const std::vector<Pair> mixed{{0x1122334455667788ULL, 7}, {42, 0xfffffffe}, {1, 0}};
  const struct {
    const char* name;
    std::optional<std::string> query;
    DAAPClient::TokenPairs pairs;
    std::vector<Pair> expected;
  } cases[] = {
      {"query and pairs", query, tokenPairs(mixed), mixed},
      {"many pairs keep their order", std::nullopt, tokenPairs(many), many},
      {"pairs without both numbers", std::nullopt, incomplete, {{10, 1}, {13, 4}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const PlistData body = DAAPClient::itemsRequestBody(1700000000, 12, 40, 39, c.query, c.pairs);
    EXPECT_EQ(body, expectedBody(1700000000, 12, 40, 39, c.query, c.expected));
    // adsr: 65 bytes, a header and the query if any, 36 per pair.
    EXPECT_EQ(sizeAt(body, 0), 65 + (c.query ? 8 + c.query->size() : 0) + 36 * c.expected.size());
  }
}

TEST(DAAPItemsBody, TheServersReaderGetsBackEveryField) {
  const std::string query = *DAAPMediaKindQuery::text(std::vector<std::int64_t>{4});
  const PlistData body =
      DAAPClient::itemsRequestBody(99, 100, 101, 102, query, tokenPairs({{5, 6}, {7, 8}}));
  const auto parsed = DAAPItemsRequest::parse(body);
  ASSERT_TRUE(parsed);
  EXPECT_EQ(parsed->utcTime, 99U);
  EXPECT_EQ(parsed->sessionID, 100U);
  EXPECT_EQ(parsed->itemKind, 2U);
  EXPECT_EQ(parsed->latestVersion, 101U);
  EXPECT_EQ(parsed->localVersion, 102U);
  EXPECT_EQ(parsed->query, query);
  const std::vector<DAAPItemsRequest::TokenPair> expected{{5, 6}, {7, 8}};
  EXPECT_EQ(parsed->tokenPairs, expected);
}

TEST(DAAPItemsBody, TheReaderRefusesWhatIsNoWholeRequest) {
  const PlistData body =
      DAAPClient::itemsRequestBody(1, 2, 3, 4, std::nullopt, tokenPairs({{5, 6}}));
  for (std::size_t length = 0; length < body.size(); ++length) {
    const PlistData cut(body.begin(), body.begin() + static_cast<std::ptrdiff_t>(length));
    EXPECT_FALSE(DAAPItemsRequest::parse(cut)) << "cut at " << length;
  }
  PlistData longer = body;
  longer.push_back(0);
  EXPECT_FALSE(DAAPItemsRequest::parse(longer));
  EXPECT_FALSE(DAAPItemsRequest::parse(document(container("mupd", {u32("musr", 3)}))));
  // Values of the wrong width are left absent; an entry without both
  // numbers is skipped.
  const auto odd = DAAPItemsRequest::parse(document(container(
      "adsr", {u8("mlid", 1), u32("musr", 9),
               container("aetl", {container("aeti", {u32("aeto", 1)}),
                                  container("aeti", {u32("aeto", 2), u64("mild", 3)})})})));
  ASSERT_TRUE(odd);
  EXPECT_FALSE(odd->sessionID);
  EXPECT_EQ(odd->latestVersion, 9U);
  const std::vector<DAAPItemsRequest::TokenPair> expected{{3, 2}};
  EXPECT_EQ(odd->tokenPairs, expected);
}

TEST(DAAPMediaKindQuery, TextEscapesTheHyphensOfTheKey) {
  EXPECT_EQ(
      DAAPMediaKindQuery::text(std::vector<std::int64_t>{2, 64}),
      R"(('com.orvane.sonorel.extended\-media\-kind:2','com.orvane.sonorel.extended\-media\-kind:64'))");
  EXPECT_EQ(DAAPMediaKindQuery::text(std::vector<std::int64_t>{1}),
            R"(('com.orvane.sonorel.extended\-media\-kind:1'))");
  EXPECT_FALSE(DAAPMediaKindQuery::text(std::vector<std::int64_t>{}));
}

TEST(DAAPMediaKindQuery, ParseReadsBackWhatTextWrites) {
  const std::vector<std::int64_t> kinds{2, 64, 1, 4096};
  EXPECT_EQ(DAAPMediaKindQuery::parse(*DAAPMediaKindQuery::text(kinds)), kinds);
  for (const std::string_view bad :
       {"", "()", "('com.orvane.sonorel.extended\\-media\\-kind:2'",
        "'com.orvane.sonorel.extended\\-media\\-kind:2'",
        "('com.orvane.sonorel.extended-media-kind:2')",
        "('com.orvane.sonorel.extended\\-media\\-kind:')",
        "('com.orvane.sonorel.extended\\-media\\-kind:2x')",
        "('com.orvane.sonorel.extended\\-media\\-kind:2',)",
        "('com.orvane.sonorel.extended\\-media\\-kind:99999999999999999999')", "('other:2')"}) {
    EXPECT_FALSE(DAAPMediaKindQuery::parse(bad)) << bad;
  }
}

TEST(DAAPClientNames, TokenPairNeedsBothNumbers) {
  const auto pair = DAAPClient::tokenPairWithCloudID(0xfedcba9876543210ULL, 4000000000U);
  ASSERT_TRUE(pair);
  EXPECT_EQ(pair->size(), 2U);
  EXPECT_EQ(pair->at("clientID").uint64Value(), 0xfedcba9876543210ULL);
  EXPECT_EQ(pair->at("tokenCode").uint64Value(), 4000000000U);
  EXPECT_FALSE(DAAPClient::tokenPairWithCloudID(std::nullopt, 1));
  EXPECT_FALSE(DAAPClient::tokenPairWithCloudID(1, std::nullopt));
}

TEST(DAAPClientNames, EveryEventHasItsName) {
  EXPECT_EQ(DAAPClient::nameForEvent(1), "Login");
  EXPECT_EQ(DAAPClient::nameForEvent(2), "GetLatestVersion");
  EXPECT_EQ(DAAPClient::nameForEvent(3), "GetDatabases");
  EXPECT_EQ(DAAPClient::nameForEvent(4), "GetItems");
  EXPECT_EQ(DAAPClient::nameForEvent(5), "GetArtworkURLs");
  EXPECT_EQ(DAAPClient::nameForEvent(0), "Unknown (0)");
  EXPECT_EQ(DAAPClient::nameForEvent(6), "Unknown (6)");
  EXPECT_EQ(DAAPClient::nameForEvent(-3), "Unknown (-3)");
}

}  // namespace
}  // namespace larder::dmaptest
