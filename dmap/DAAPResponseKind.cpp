#include "dmap/DAAPResponseKind.h"

#include <algorithm>
#include <utility>

#include "dmap/DAAPCode.h"

namespace larder {

namespace {

using Kind = DAAPResponseKind;

constexpr std::pair<std::uint32_t, DAAPResponseKind> kResponseCodes[] = {
    {"abro"_dmap, Kind::ListingHeader},  {"adbs"_dmap, Kind::ListingHeader},
    {"aeBR"_dmap, Kind::ListingHeader},  {"agal"_dmap, Kind::ListingHeader},
    {"agar"_dmap, Kind::ListingHeader},  {"aply"_dmap, Kind::ListingHeader},
    {"apso"_dmap, Kind::ListingHeader},  {"avdb"_dmap, Kind::ListingHeader},
    {"caci"_dmap, Kind::ListingHeader},  {"cmbu"_dmap, Kind::ListingHeader},
    {"cprp"_dmap, Kind::ListingHeader},  {"mctl"_dmap, Kind::ListingHeader},
    {"mscr"_dmap, Kind::ListingHeader},  {"mupd"_dmap, Kind::ListingHeader},
    {"cacr"_dmap, Kind::ListingItem},    {"medc"_dmap, Kind::ListingItem},
    {"casp"_dmap, Kind::Speakers},       {"ceGI"_dmap, Kind::ListingCollection},
    {"cmcp"_dmap, Kind::ControlPrompts}, {"cmgt"_dmap, Kind::Properties},
    {"cmst"_dmap, Kind::Properties},     {"mccr"_dmap, Kind::ContentCodes},
    {"merr"_dmap, Kind::Error},          {"mlog"_dmap, Kind::Login},
    {"msrv"_dmap, Kind::ServerInfo},     {"arsv"_dmap, Kind::Acknowledgement},
};

}  // namespace

std::optional<DAAPResponseKind> daapResponseKind(std::uint32_t code) {
  const auto* found =
      std::ranges::find(kResponseCodes, code, &std::pair<std::uint32_t, Kind>::first);
  if (found == std::end(kResponseCodes)) return std::nullopt;
  return found->second;
}

}  // namespace larder
