#include "dmap/DAAPTagTables.h"

#include <algorithm>
#include <array>

#include "dmap/DAAPCode.h"

namespace larder {

namespace {

using K = DAAPValueKind;

constexpr DAAPTagEntry tag(std::string_view code, DAAPValueKind kind, std::string_view key) {
  return {DAAPCode::fromText(code), kind, key};
}

template <std::size_t N>
constexpr std::array<DAAPTagEntry, N> sortedByCode(std::array<DAAPTagEntry, N> table) {
  std::sort(table.begin(), table.end(),
            [](const DAAPTagEntry& a, const DAAPTagEntry& b) { return a.code < b.code; });
  return table;
}

template <std::size_t N>
constexpr bool codesAreUnique(const std::array<DAAPTagEntry, N>& table) {
  for (std::size_t index = 1; index < N; ++index) {
    if (table[index - 1].code == table[index].code) return false;
  }
  return true;
}

constexpr auto kListingHeader = sortedByCode(std::array{
    tag("mstt", K::UInt32, "dmap.status"),
    tag("muty", K::UInt8, "dmap.updatetype"),
    tag("mtco", K::UInt32, "dmap.specifiedtotalcount"),
    tag("musr", K::UInt32, "dmap.serverrevision"),
    tag("cmbr", K::UInt32, "dmcp.beaconsourcesrevision"),
});

constexpr auto kListingItem = sortedByCode(std::array{
    tag("aeCR", K::String, "com.orvane.sonorel.content-rating"),
    tag("aeCT", K::String, "com.orvane.sonorel.cloud-artwork-token"),
    tag("aeCa", K::String, "com.orvane.sonorel.cloud-artwork-url"),
    tag("aeEN", K::String, "com.orvane.sonorel.episode-num-str"),
    tag("aePd", K::String, "com.orvane.sonorel.display-publication-version"),
    tag("aeSN", K::String, "com.orvane.sonorel.series-name"),
    tag("agrp", K::String, "daap.songgrouping"),
    tag("ascn", K::String, "daap.songcontentdescription"),
    tag("ascp", K::String, "daap.songcomposer"),
    tag("asct", K::String, "daap.songcategory"),
    tag("asdt", K::String, "daap.songdescription"),
    tag("asfm", K::String, "daap.songformat"),
    tag("asgn", K::String, "daap.songgenre"),
    tag("aslc", K::String, "daap.songlongcontentdescription"),
    tag("aspu", K::String, "daap.songpodcasturl"),
    tag("assa", K::String, "daap.sortartist"),
    tag("assn", K::String, "daap.sortname"),
    tag("assu", K::String, "daap.sortalbum"),
    tag("asul", K::String, "daap.songdataurl"),
    tag("cmbd", K::String, "libraryDisplayName"),
    tag("cmbm", K::String, "libraryServiceDomain"),
    tag("cmbs", K::String, "libraryServiceName"),
    tag("cmbt", K::String, "libraryServiceType"),
    tag("cmid", K::String, "identifier"),
    tag("cmnm", K::String, "name"),
    tag("pasp", K::String, "aspectRatio"),

    tag("aeHD", K::UInt8, "com.orvane.sonorel.is-hd-video"),
    tag("aeMK", K::UInt8, "com.orvane.sonorel.mediakind"),
    tag("aePC", K::UInt8, "com.orvane.sonorel.is-podcast"),
    tag("aePS", K::UInt8, "com.orvane.sonorel.special-playlist"),
    tag("aprm", K::UInt8, "daap.playlistrepeatmode"),
    tag("apsm", K::UInt8, "daap.playlistshufflemode"),
    tag("asbk", K::UInt8, "daap.bookmarkable"),
    tag("ascr", K::UInt8, "daap.songcontentrating"),
    tag("ashp", K::UInt8, "daap.songhasbeenplayed"),
    tag("asur", K::UInt8, "daap.songuserrating"),
    tag("cahp", K::UInt8, "hasPassword"),
    tag("mgds", K::UInt8, "dmap.groupdownloadstatus"),
    tag("mikd", K::UInt8, "dmap.itemkind"),
    tag("msas", K::UInt8, "dmap.authenticationschemes"),
    tag("msau", K::UInt8, "dmap.authenticationmethod"),

    tag("asac", K::UInt16, "daap.songartworkcount"),
    tag("asdc", K::UInt16, "daap.songdisccount"),
    tag("asdn", K::UInt16, "daap.songdiscnumber"),
    tag("astc", K::UInt16, "daap.songtrackcount"),
    tag("astn", K::UInt16, "daap.songtracknumber"),
    tag("asyr", K::UInt16, "daap.songyear"),

    tag("aeCs", K::UInt32, "com.orvane.sonorel.cloud-connect-status"),
    tag("aeES", K::UInt32, "com.orvane.sonorel.episode-sort"),
    tag("aeRD", K::UInt32, "com.orvane.sonorel.rental-duration"),
    tag("aeRP", K::UInt32, "com.orvane.sonorel.rental-pb-start"),
    tag("aeRS", K::UInt32, "com.orvane.sonorel.rental-start"),
    tag("aeRU", K::UInt32, "com.orvane.sonorel.rental-pb-duration"),
    tag("aeSU", K::UInt32, "com.orvane.sonorel.season-num"),
    tag("aeto", K::UInt32, "com.orvane.sonorel.cloud-purchased-token"),
    tag("agac", K::UInt32, "daap.groupalbumcount"),
    tag("agma", K::UInt32, "daap.groupmatchedqueryalbumcount"),
    tag("agmi", K::UInt32, "daap.groupmatchedqueryitemcount"),
    tag("asbo", K::UInt32, "daap.songbookmark"),
    tag("askp", K::UInt32, "daap.songuserskipcount"),
    tag("aspc", K::UInt32, "daap.songuserplaycount"),
    tag("astm", K::UInt32, "daap.songtime"),
    tag("capr", K::UInt32, "dacp.protocolversion"),
    tag("cmmn", K::UInt32, "minimum"),
    tag("cmmx", K::UInt32, "maximum"),
    tag("cmpr", K::UInt32, "dmcp.protocolversion"),
    tag("mctc", K::UInt32, "dmap.containercount"),
    tag("mdbk", K::UInt32, "dmap.databasekind"),
    tag("merr", K::UInt32, "dmap.errorresponse"),
    tag("mimc", K::UInt32, "dmap.itemcount"),
    tag("mshi", K::UInt32, "headerItemIndex"),
    tag("mshn", K::UInt32, "headerItemCount"),
    tag("mstt", K::UInt32, "dmap.status"),

    tag("aeAD", K::UInt64, "com.orvane.sonorel.ware-ids-array"),
    tag("aeAI", K::UInt64, "com.orvane.sonorel.orms-artistid"),
    tag("aeAi", K::UInt64, "com.orvane.sonorel.ware-id"),
    tag("aeCU", K::UInt64, "com.orvane.sonorel.cloud-user-id"),
    tag("aeCd", K::UInt64, "com.orvane.sonorel.cloud-id"),
    tag("aeIM", K::UInt64, "com.orvane.sonorel.sonorel-machine-id"),
    tag("aeRM", K::UInt64, "com.orvane.sonorel.remote-sonorel-machine-id"),
    tag("aeSE", K::UInt64, "com.orvane.sonorel.store-pers-id"),
    tag("aepv", K::UInt64, "com.orvane.sonorel.publication-version"),
    tag("ceSX", K::UInt64, "kExtDACPSupportedSonorelExtensionsCode"),
    tag("mild", K::UInt64, "dmap.longitemid"),
    tag("mper", K::UInt64, "dmap.persistentid"),
    tag("mrpr", K::UInt64, "dmap.remotepersistentid"),
    tag("msma", K::UInt64, "macAddress"),

    tag("abpl", K::Bool, "daap.baseplaylist"),
    tag("aeHS", K::Bool, "com.orvane.sonorel.is-homeshare"),
    tag("aeMI", K::Bool, "com.orvane.sonorel.mastered-for-sonorel"),
    tag("aeSG", K::Bool, "com.orvane.sonorel.saved-curator"),
    tag("aeSP", K::Bool, "com.orvane.sonorel.smart-playlist"),
    tag("asdb", K::Bool, "daap.songdisabled"),
    tag("caia", K::Bool, "selected"),
    tag("caip", K::Bool, "isPlaying"),
    tag("caiv", K::Bool, "supportsVideo"),
    tag("caov", K::Bool, "supportsMultiSpeakerVolume"),
    tag("cass", K::Bool, "supportsSpeakerSelection"),
    tag("casu", K::Bool, "supportsSetUserRating"),
    tag("cavd", K::Bool, "selectedForVideo"),
    tag("ceDR", K::Bool, "com.orvane.sonorel.supports-directional-remote"),
    tag("ceSG", K::Bool, "com.orvane.sonorel.supports-curator-control"),
    tag("cmrl", K::Bool, "supportsRemoteLibrarySelection"),
    tag("cmsb", K::Bool, "supportsBeaconSourcesUpdates"),
    tag("cmsc", K::Bool, "supportsControlPromptRequests"),
    tag("cmsp", K::Bool, "supportsPlayStatusUpdate"),
    tag("cmsv", K::Bool, "supportsVolume"),
    tag("crol", K::Bool, "readOnly"),
    tag("mavl", K::Bool, "dmap.itemavailable"),
    tag("mihi", K::Bool, "dmap.itemhidden"),

    tag("ajEd", K::Date, "com.orvane.sonorel.store.expected-release-date"),
    tag("asda", K::Date, "daap.songdateadded"),
    tag("asdm", K::Date, "daap.songdatemodified"),
    tag("asdp", K::Date, "daap.songdatepurchased"),
    tag("asdr", K::Date, "daap.songdatereleased"),
});

constexpr auto kServerInfo = sortedByCode(std::array{
    tag("mstt", K::UInt32, "dmap.status"),
    tag("mpro", K::UInt32, "dmap.protocolversion"),
    tag("apro", K::UInt32, "daap.protocolversion"),
    tag("ppro", K::UInt32, "ppro"),
    tag("atSV", K::UInt32, "Client-TVB-Sharing-Version"),
    tag("aeSV", K::UInt32, "com.orvane.sonorel.music-sharing-version"),
    tag("aeSX", K::UInt64, "com.orvane.sonorel.supportedextensions"),
    tag("aeto", K::UInt32, "com.orvane.sonorel.cloud-purchase-token"),
    tag("aeCP", K::Bool, "supportsPurchases"),
    tag("aeMQ", K::Bool, "com.orvane.sonorel.playlist-contains-media-type"),
    tag("minm", K::String, "dmap.itemname"),
    tag("mild", K::UInt64, "dmap.longitemid"),
    tag("mmdl", K::String, "model"),
    tag("mmnf", K::String, "manufacturer"),
    tag("dvty", K::UInt8, "deviceType"),
    tag("mslr", K::UInt8, "dmap.loginrequired"),
    tag("msal", K::UInt8, "dmap.supportsautologout"),
    tag("msau", K::UInt8, "dmap.authenticationmethod"),
    tag("msas", K::UInt8, "dmap.authenticationschemes"),
    tag("mstm", K::UInt32, "dmap.timeoutinterval"),
    tag("mstc", K::UInt32, "dmap.utctime"),
    tag("msto", K::UInt32, "dmap.utcoffset"),
    tag("msdc", K::UInt32, "dmap.databasescount"),
    tag("msup", K::UInt8, "dmap.supportsupdate"),
    tag("mspi", K::UInt8, "dmap.supportspersistentids"),
    tag("msex", K::UInt8, "dmap.supportsextensions"),
    tag("msbr", K::UInt8, "dmap.supportsbrowse"),
    tag("msqy", K::UInt8, "dmap.supportsquery"),
    tag("msix", K::UInt8, "dmap.supportsindex"),
    tag("msrs", K::UInt8, "dmap.supportsresolve"),
    tag("msed", K::Bool, "supportsEditing"),
    tag("meds", K::Bool, "dmap.editcommandssupported"),
    tag("msii", K::Bool, "dmap.supportsinlinecontaineritems"),
    tag("msli", K::Bool, "dmap.supportslongitemid"),
    tag("asgr", K::UInt16, "daap.supportsgroups"),
    tag("ated", K::UInt16, "daap.supportsextradata"),
    tag("asse", K::Bool, "daap.supportssetproperty"),
});

constexpr auto kError = sortedByCode(std::array{
    tag("mstt", K::UInt32, "dmap.status"),
    tag("aeRC", K::UInt32, "com.orvane.sonorel.reconnect-interval"),
});

constexpr auto kContentCollection = sortedByCode(std::array{
    tag("mcnm", K::UInt32, "dmap.contentcodesnumber"),
    tag("mcna", K::String, "dmap.contentcodesname"),
});

constexpr auto kControlPromptCollection = sortedByCode(std::array{
    tag("cmca", K::String, "attributes"),
    tag("cmcv", K::String, "value"),
    tag("cmce", K::String, "name"),
});

constexpr auto kDACPProperty = sortedByCode(std::array{
    tag("mstt", K::UInt32, "dmap.status"),
    tag("cmsr", K::UInt32, "dmcp.playstatusrevision"),
    tag("caps", K::UInt8, "dacp.playerstate"),
    tag("cash", K::UInt8, "dacp.shufflestate"),
    tag("carp", K::UInt8, "dacp.repeatstate"),
    tag("caas", K::UInt32, "dacp.availableshufflestates"),
    tag("caar", K::UInt32, "dacp.availablerepeatstates"),
    tag("cafe", K::Bool, "dacp.fullscreenenabled"),
    tag("cafs", K::Bool, "dacp.fullscreen"),
    tag("cave", K::Bool, "dacp.visualizerenabled"),
    tag("cavs", K::Bool, "dacp.visualizer"),
    tag("cavc", K::Bool, "dacp.volumecontrollable"),
    tag("cant", K::UInt32, "dacp.playingtime"),
    tag("cast", K::UInt32, "daap.songtime"),
    tag("cann", K::String, "dmap.itemname"),
    tag("cana", K::String, "daap.songartist"),
    tag("canl", K::String, "daap.songalbum"),
    tag("cang", K::String, "NPGenre"),
    tag("cmbd", K::String, "libraryDisplayName"),
    tag("cmbm", K::String, "libraryServiceDomain"),
    tag("cmbs", K::String, "libraryServiceName"),
    tag("cmbt", K::String, "libraryServiceType"),
    tag("cmmk", K::UInt32, "mediaKind"),
    tag("mper", K::UInt64, "dmap.persistentid"),
    tag("asai", K::UInt64, "daap.songalbumid"),
    tag("aeSI", K::UInt32, "com.orvane.sonorel.orms-songid"),
    tag("ceGS", K::Bool, "com.orvane.sonorel.can-be-curator-seed"),
});

constexpr auto kFlavor = sortedByCode(std::array{
    tag("aeRp", K::String, "com.orvane.sonorel.item-redownload-param-2"),
    tag("aefd", K::UInt32, "com.orvane.sonorel.item-flavor-id"),
    tag("ajUp", K::String, "com.orvane.sonorel.store.item-update-param"),
    tag("asbr", K::UInt16, "daap.songbitrate"),
    tag("ascd", K::UInt32, "daap.songcodectype"),
    tag("ascs", K::UInt32, "daap.songcodecsubtype"),
    tag("asdk", K::UInt8, "daap.songdatakind"),
    tag("asfm", K::String, "daap.songformat"),
    tag("asls", K::UInt64, "daap.songlongsize"),
    tag("assr", K::UInt32, "daap.songsamplerate"),
    tag("astm", K::UInt32, "daap.songtime"),
});

static_assert(codesAreUnique(kListingHeader) && codesAreUnique(kListingItem) &&
                  codesAreUnique(kServerInfo) && codesAreUnique(kError) &&
                  codesAreUnique(kContentCollection) && codesAreUnique(kControlPromptCollection) &&
                  codesAreUnique(kDACPProperty) && codesAreUnique(kFlavor),
              "a code appears twice in one table");

}  // namespace

std::span<const DAAPTagEntry> DAAPTagTables::listingHeader() {
  return kListingHeader;
}
std::span<const DAAPTagEntry> DAAPTagTables::listingItem() {
  return kListingItem;
}
std::span<const DAAPTagEntry> DAAPTagTables::serverInfo() {
  return kServerInfo;
}
std::span<const DAAPTagEntry> DAAPTagTables::error() {
  return kError;
}
std::span<const DAAPTagEntry> DAAPTagTables::contentCollection() {
  return kContentCollection;
}
std::span<const DAAPTagEntry> DAAPTagTables::controlPromptCollection() {
  return kControlPromptCollection;
}
std::span<const DAAPTagEntry> DAAPTagTables::dacpProperty() {
  return kDACPProperty;
}
std::span<const DAAPTagEntry> DAAPTagTables::flavor() {
  return kFlavor;
}

const DAAPTagEntry* DAAPTagTables::find(std::span<const DAAPTagEntry> table, std::uint32_t code) {
  const auto found = std::lower_bound(
      table.begin(), table.end(), code,
      [](const DAAPTagEntry& entry, std::uint32_t wanted) { return entry.code < wanted; });
  return found != table.end() && found->code == code ? &*found : nullptr;
}

}  // namespace larder
