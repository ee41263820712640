#include "dmap/DAAPResponseKind.h"

#include "dmap/DAAPCode.h"

namespace larder {

std::optional<DAAPResponseKind> daapResponseKind(std::uint32_t code) {
  switch (code) {
    case "abro"_dmap:
    case "adbs"_dmap:
    case "aeBR"_dmap:
    case "agal"_dmap:
    case "agar"_dmap:
    case "aply"_dmap:
    case "apso"_dmap:
    case "avdb"_dmap:
    case "caci"_dmap:
    case "cmbu"_dmap:
    case "cprp"_dmap:
    case "mctl"_dmap:
    case "mscr"_dmap:
    case "mupd"_dmap:
      return DAAPResponseKind::ListingHeader;
    case "cacr"_dmap:
    case "medc"_dmap:
      return DAAPResponseKind::ListingItem;
    case "casp"_dmap:
      return DAAPResponseKind::Speakers;
    case "ceGI"_dmap:
      return DAAPResponseKind::ListingCollection;
    case "cmcp"_dmap:
      return DAAPResponseKind::ControlPrompts;
    case "cmgt"_dmap:
    case "cmst"_dmap:
      return DAAPResponseKind::Properties;
    case "mccr"_dmap:
      return DAAPResponseKind::ContentCodes;
    case "merr"_dmap:
      return DAAPResponseKind::Error;
    case "mlog"_dmap:
      return DAAPResponseKind::Login;
    case "msrv"_dmap:
      return DAAPResponseKind::ServerInfo;
    case "arsv"_dmap:
      return DAAPResponseKind::Acknowledgement;
    default:
      return std::nullopt;
  }
}

}  // namespace larder
