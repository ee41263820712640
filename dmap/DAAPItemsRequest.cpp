#include "dmap/DAAPItemsRequest.h"

#include "dmap/DAAPBytes.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPTagReader.h"

namespace larder {
namespace {

using Bytes = std::span<const std::uint8_t>;

template <typename Number>
std::optional<Number> exactly(Bytes value) {
  if (value.size() != sizeof(Number)) return std::nullopt;
  return static_cast<Number>(DAAPBytes::bigEndianUnchecked(value.data(), sizeof(Number)));
}

std::optional<DAAPItemsRequest::TokenPair> tokenPair(Bytes entry) {
  std::optional<std::uint32_t> token;
  std::optional<std::uint64_t> cloudID;
  DAAPTagReader reader(entry);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "aeto"_dmap) token = exactly<std::uint32_t>(tag->value);
    if (tag->code == "mild"_dmap) cloudID = exactly<std::uint64_t>(tag->value);
  }
  if (!token || !cloudID) return std::nullopt;
  return DAAPItemsRequest::TokenPair{*cloudID, *token};
}

}  // namespace

std::optional<DAAPItemsRequest> DAAPItemsRequest::parse(Bytes body) {
  DAAPTagReader top(body);
  const std::optional<DAAPTag> request = top.next();
  if (!request || request->code != "adsr"_dmap) return std::nullopt;
  if (request->value.size() + DAAPTagReader::kHeaderSize != body.size()) return std::nullopt;
  DAAPItemsRequest parsed;
  DAAPTagReader reader(request->value);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    parsed.readField(tag->code, tag->value);
  }
  return parsed;
}

void DAAPItemsRequest::readField(std::uint32_t code, Bytes value) {
  switch (code) {
    case "mstc"_dmap:
      utcTime = exactly<std::uint32_t>(value);
      return;
    case "mlid"_dmap:
      sessionID = exactly<std::uint32_t>(value);
      return;
    case "mikd"_dmap:
      itemKind = exactly<std::uint8_t>(value);
      return;
    case "musr"_dmap:
      latestVersion = exactly<std::uint32_t>(value);
      return;
    case "mder"_dmap:
      localVersion = exactly<std::uint32_t>(value);
      return;
    case "mque"_dmap:
      query = std::string(value.begin(), value.end());
      return;
    case "aetl"_dmap:
      readTokenList(value);
      return;
    default:
      return;
  }
}

void DAAPItemsRequest::readTokenList(Bytes list) {
  DAAPTagReader reader(list);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code != "aeti"_dmap) continue;
    if (const auto pair = tokenPair(tag->value)) tokenPairs.push_back(*pair);
  }
}

}  // namespace larder
