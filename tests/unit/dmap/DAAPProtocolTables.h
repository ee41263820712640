#pragma once

#include <string>
#include <vector>

#include "DAAPTestSupport.h"

namespace larder::dmaptest {

enum class Kind { Bool, UInt8, UInt16, UInt32, UInt64, Date, String };

struct PlainTag {
  const char* code;
  Kind kind;
  const char* key;
};

// The plain tags of every container, transcribed from the protocol's tables:
// code, how the value is read, and the key it is stored under.

const std::vector<PlainTag> kListingItemTags{
    {"aeCR", Kind::String, "com.orvane.sonorel.content-rating"},
    {"aeCT", Kind::String, "com.orvane.sonorel.cloud-artwork-token"},
    {"aeCa", Kind::String, "com.orvane.sonorel.cloud-artwork-url"},
    {"aeEN", Kind::String, "com.orvane.sonorel.episode-num-str"},
    {"aePd", Kind::String, "com.orvane.sonorel.display-publication-version"},
    {"aeSN", Kind::String, "com.orvane.sonorel.series-name"},
    {"agrp", Kind::String, "daap.songgrouping"},
    {"ascn", Kind::String, "daap.songcontentdescription"},
    {"ascp", Kind::String, "daap.songcomposer"},
    {"asct", Kind::String, "daap.songcategory"},
    {"asdt", Kind::String, "daap.songdescription"},
    {"asfm", Kind::String, "daap.songformat"},
    {"asgn", Kind::String, "daap.songgenre"},
    {"aslc", Kind::String, "daap.songlongcontentdescription"},
    {"aspu", Kind::String, "daap.songpodcasturl"},
    {"assa", Kind::String, "daap.sortartist"},
    {"assn", Kind::String, "daap.sortname"},
    {"assu", Kind::String, "daap.sortalbum"},
    {"asul", Kind::String, "daap.songdataurl"},
    {"cmbd", Kind::String, "libraryDisplayName"},
    {"cmbm", Kind::String, "libraryServiceDomain"},
    {"cmbs", Kind::String, "libraryServiceName"},
    {"cmbt", Kind::String, "libraryServiceType"},
    {"cmid", Kind::String, "identifier"},
    {"cmnm", Kind::String, "name"},
    {"pasp", Kind::String, "aspectRatio"},
    {"aeHD", Kind::UInt8, "com.orvane.sonorel.is-hd-video"},
    {"aeMK", Kind::UInt8, "com.orvane.sonorel.mediakind"},
    {"aePC", Kind::UInt8, "com.orvane.sonorel.is-podcast"},
    {"aePS", Kind::UInt8, "com.orvane.sonorel.special-playlist"},
    {"aprm", Kind::UInt8, "daap.playlistrepeatmode"},
    {"apsm", Kind::UInt8, "daap.playlistshufflemode"},
    {"asbk", Kind::UInt8, "daap.bookmarkable"},
    {"ascr", Kind::UInt8, "daap.songcontentrating"},
    {"ashp", Kind::UInt8, "daap.songhasbeenplayed"},
    {"asur", Kind::UInt8, "daap.songuserrating"},
    {"cahp", Kind::UInt8, "hasPassword"},
    {"mgds", Kind::UInt8, "dmap.groupdownloadstatus"},
    {"mikd", Kind::UInt8, "dmap.itemkind"},
    {"msas", Kind::UInt8, "dmap.authenticationschemes"},
    {"msau", Kind::UInt8, "dmap.authenticationmethod"},
    {"asac", Kind::UInt16, "daap.songartworkcount"},
    {"asdc", Kind::UInt16, "daap.songdisccount"},
    {"asdn", Kind::UInt16, "daap.songdiscnumber"},
    {"astc", Kind::UInt16, "daap.songtrackcount"},
    {"astn", Kind::UInt16, "daap.songtracknumber"},
    {"asyr", Kind::UInt16, "daap.songyear"},
    {"aeCs", Kind::UInt32, "com.orvane.sonorel.cloud-connect-status"},
    {"aeES", Kind::UInt32, "com.orvane.sonorel.episode-sort"},
    {"aeRD", Kind::UInt32, "com.orvane.sonorel.rental-duration"},
    {"aeRP", Kind::UInt32, "com.orvane.sonorel.rental-pb-start"},
    {"aeRS", Kind::UInt32, "com.orvane.sonorel.rental-start"},
    {"aeRU", Kind::UInt32, "com.orvane.sonorel.rental-pb-duration"},
    {"aeSU", Kind::UInt32, "com.orvane.sonorel.season-num"},
    {"aeto", Kind::UInt32, "com.orvane.sonorel.cloud-purchased-token"},
    {"agac", Kind::UInt32, "daap.groupalbumcount"},
    {"agma", Kind::UInt32, "daap.groupmatchedqueryalbumcount"},
    {"agmi", Kind::UInt32, "daap.groupmatchedqueryitemcount"},
    {"asbo", Kind::UInt32, "daap.songbookmark"},
    {"askp", Kind::UInt32, "daap.songuserskipcount"},
    {"aspc", Kind::UInt32, "daap.songuserplaycount"},
    {"astm", Kind::UInt32, "daap.songtime"},
    {"capr", Kind::UInt32, "dacp.protocolversion"},
    {"cmmn", Kind::UInt32, "minimum"},
    {"cmmx", Kind::UInt32, "maximum"},
    {"cmpr", Kind::UInt32, "dmcp.protocolversion"},
    {"mctc", Kind::UInt32, "dmap.containercount"},
    {"mdbk", Kind::UInt32, "dmap.databasekind"},
    {"merr", Kind::UInt32, "dmap.errorresponse"},
    {"mimc", Kind::UInt32, "dmap.itemcount"},
    {"mshi", Kind::UInt32, "headerItemIndex"},
    {"mshn", Kind::UInt32, "headerItemCount"},
    {"mstt", Kind::UInt32, "dmap.status"},
    {"aeAD", Kind::UInt64, "com.orvane.sonorel.ware-ids-array"},
    {"aeAI", Kind::UInt64, "com.orvane.sonorel.orms-artistid"},
    {"aeAi", Kind::UInt64, "com.orvane.sonorel.ware-id"},
    {"aeCU", Kind::UInt64, "com.orvane.sonorel.cloud-user-id"},
    {"aeCd", Kind::UInt64, "com.orvane.sonorel.cloud-id"},
    {"aeIM", Kind::UInt64, "com.orvane.sonorel.sonorel-machine-id"},
    {"aeRM", Kind::UInt64, "com.orvane.sonorel.remote-sonorel-machine-id"},
    {"aeSE", Kind::UInt64, "com.orvane.sonorel.store-pers-id"},
    {"aepv", Kind::UInt64, "com.orvane.sonorel.publication-version"},
    {"ceSX", Kind::UInt64, "kExtDACPSupportedSonorelExtensionsCode"},
    {"mild", Kind::UInt64, "dmap.longitemid"},
    {"mper", Kind::UInt64, "dmap.persistentid"},
    {"mrpr", Kind::UInt64, "dmap.remotepersistentid"},
    {"msma", Kind::UInt64, "macAddress"},
    {"abpl", Kind::Bool, "daap.baseplaylist"},
    {"aeHS", Kind::Bool, "com.orvane.sonorel.is-homeshare"},
    {"aeMI", Kind::Bool, "com.orvane.sonorel.mastered-for-sonorel"},
    {"aeSG", Kind::Bool, "com.orvane.sonorel.saved-curator"},
    {"aeSP", Kind::Bool, "com.orvane.sonorel.smart-playlist"},
    {"asdb", Kind::Bool, "daap.songdisabled"},
    {"caia", Kind::Bool, "selected"},
    {"caip", Kind::Bool, "isPlaying"},
    {"caiv", Kind::Bool, "supportsVideo"},
    {"caov", Kind::Bool, "supportsMultiSpeakerVolume"},
    {"cass", Kind::Bool, "supportsSpeakerSelection"},
    {"casu", Kind::Bool, "supportsSetUserRating"},
    {"cavd", Kind::Bool, "selectedForVideo"},
    {"ceDR", Kind::Bool, "com.orvane.sonorel.supports-directional-remote"},
    {"ceSG", Kind::Bool, "com.orvane.sonorel.supports-curator-control"},
    {"cmrl", Kind::Bool, "supportsRemoteLibrarySelection"},
    {"cmsb", Kind::Bool, "supportsBeaconSourcesUpdates"},
    {"cmsc", Kind::Bool, "supportsControlPromptRequests"},
    {"cmsp", Kind::Bool, "supportsPlayStatusUpdate"},
    {"cmsv", Kind::Bool, "supportsVolume"},
    {"crol", Kind::Bool, "readOnly"},
    {"mavl", Kind::Bool, "dmap.itemavailable"},
    {"mihi", Kind::Bool, "dmap.itemhidden"},
    {"ajEd", Kind::Date, "com.orvane.sonorel.store.expected-release-date"},
    {"asda", Kind::Date, "daap.songdateadded"},
    {"asdm", Kind::Date, "daap.songdatemodified"},
    {"asdp", Kind::Date, "daap.songdatepurchased"},
    {"asdr", Kind::Date, "daap.songdatereleased"},
};

const std::vector<PlainTag> kServerInfoTags{
    {"mstt", Kind::UInt32, "dmap.status"},
    {"mpro", Kind::UInt32, "dmap.protocolversion"},
    {"apro", Kind::UInt32, "daap.protocolversion"},
    {"ppro", Kind::UInt32, "ppro"},
    {"atSV", Kind::UInt32, "Client-TVB-Sharing-Version"},
    {"aeSV", Kind::UInt32, "com.orvane.sonorel.music-sharing-version"},
    {"aeSX", Kind::UInt64, "com.orvane.sonorel.supportedextensions"},
    {"aeto", Kind::UInt32, "com.orvane.sonorel.cloud-purchase-token"},
    {"aeCP", Kind::Bool, "supportsPurchases"},
    {"aeMQ", Kind::Bool, "com.orvane.sonorel.playlist-contains-media-type"},
    {"minm", Kind::String, "dmap.itemname"},
    {"mild", Kind::UInt64, "dmap.longitemid"},
    {"mmdl", Kind::String, "model"},
    {"mmnf", Kind::String, "manufacturer"},
    {"dvty", Kind::UInt8, "deviceType"},
    {"mslr", Kind::UInt8, "dmap.loginrequired"},
    {"msal", Kind::UInt8, "dmap.supportsautologout"},
    {"msau", Kind::UInt8, "dmap.authenticationmethod"},
    {"msas", Kind::UInt8, "dmap.authenticationschemes"},
    {"mstm", Kind::UInt32, "dmap.timeoutinterval"},
    {"mstc", Kind::UInt32, "dmap.utctime"},
    {"msto", Kind::UInt32, "dmap.utcoffset"},
    {"msdc", Kind::UInt32, "dmap.databasescount"},
    {"msup", Kind::UInt8, "dmap.supportsupdate"},
    {"mspi", Kind::UInt8, "dmap.supportspersistentids"},
    {"msex", Kind::UInt8, "dmap.supportsextensions"},
    {"msbr", Kind::UInt8, "dmap.supportsbrowse"},
    {"msqy", Kind::UInt8, "dmap.supportsquery"},
    {"msix", Kind::UInt8, "dmap.supportsindex"},
    {"msrs", Kind::UInt8, "dmap.supportsresolve"},
    {"msed", Kind::Bool, "supportsEditing"},
    {"meds", Kind::Bool, "dmap.editcommandssupported"},
    {"msii", Kind::Bool, "dmap.supportsinlinecontaineritems"},
    {"msli", Kind::Bool, "dmap.supportslongitemid"},
    {"asgr", Kind::UInt16, "daap.supportsgroups"},
    {"ated", Kind::UInt16, "daap.supportsextradata"},
    {"asse", Kind::Bool, "daap.supportssetproperty"},
};

const std::vector<PlainTag> kDACPPropertyTags{
    {"mstt", Kind::UInt32, "dmap.status"},
    {"cmsr", Kind::UInt32, "dmcp.playstatusrevision"},
    {"caps", Kind::UInt8, "dacp.playerstate"},
    {"cash", Kind::UInt8, "dacp.shufflestate"},
    {"carp", Kind::UInt8, "dacp.repeatstate"},
    {"caas", Kind::UInt32, "dacp.availableshufflestates"},
    {"caar", Kind::UInt32, "dacp.availablerepeatstates"},
    {"cafe", Kind::Bool, "dacp.fullscreenenabled"},
    {"cafs", Kind::Bool, "dacp.fullscreen"},
    {"cave", Kind::Bool, "dacp.visualizerenabled"},
    {"cavs", Kind::Bool, "dacp.visualizer"},
    {"cavc", Kind::Bool, "dacp.volumecontrollable"},
    {"cant", Kind::UInt32, "dacp.playingtime"},
    {"cast", Kind::UInt32, "daap.songtime"},
    {"cann", Kind::String, "dmap.itemname"},
    {"cana", Kind::String, "daap.songartist"},
    {"canl", Kind::String, "daap.songalbum"},
    {"cang", Kind::String, "NPGenre"},
    {"cmbd", Kind::String, "libraryDisplayName"},
    {"cmbm", Kind::String, "libraryServiceDomain"},
    {"cmbs", Kind::String, "libraryServiceName"},
    {"cmbt", Kind::String, "libraryServiceType"},
    {"cmmk", Kind::UInt32, "mediaKind"},
    {"mper", Kind::UInt64, "dmap.persistentid"},
    {"asai", Kind::UInt64, "daap.songalbumid"},
    {"ceGS", Kind::Bool, "com.orvane.sonorel.can-be-curator-seed"},
    {"aeSI", Kind::UInt32, "com.orvane.sonorel.orms-songid"},
};

const std::vector<PlainTag> kFlavorTags{
    {"aeRp", Kind::String, "com.orvane.sonorel.item-redownload-param-2"},
    {"aefd", Kind::UInt32, "com.orvane.sonorel.item-flavor-id"},
    {"ajUp", Kind::String, "com.orvane.sonorel.store.item-update-param"},
    {"asbr", Kind::UInt16, "daap.songbitrate"},
    {"ascd", Kind::UInt32, "daap.songcodectype"},
    {"ascs", Kind::UInt32, "daap.songcodecsubtype"},
    {"asdk", Kind::UInt8, "daap.songdatakind"},
    {"asfm", Kind::String, "daap.songformat"},
    {"asls", Kind::UInt64, "daap.songlongsize"},
    {"assr", Kind::UInt32, "daap.songsamplerate"},
    {"astm", Kind::UInt32, "daap.songtime"},
};

const std::vector<PlainTag> kListingHeaderTags{
    {"mstt", Kind::UInt32, "dmap.status"},
    {"muty", Kind::UInt8, "dmap.updatetype"},
    {"mtco", Kind::UInt32, "dmap.specifiedtotalcount"},
    {"musr", Kind::UInt32, "dmap.serverrevision"},
    {"cmbr", Kind::UInt32, "dmcp.beaconsourcesrevision"},
};

const std::vector<PlainTag> kErrorTags{
    {"mstt", Kind::UInt32, "dmap.status"},
    {"aeRC", Kind::UInt32, "com.orvane.sonorel.reconnect-interval"},
};

const std::vector<PlainTag> kContentCollectionTags{
    {"mcnm", Kind::UInt32, "dmap.contentcodesnumber"},
    {"mcna", Kind::String, "dmap.contentcodesname"},
};

const std::vector<PlainTag> kControlPromptCollectionTags{
    {"cmca", Kind::String, "attributes"},
    {"cmcv", Kind::String, "value"},
    {"cmce", Kind::String, "name"},
};

// A value for the `index`th tag of a table, different for every tag and
// chosen so that a swapped byte order, a lost sign bit or a wrong width
// shows: high bits set, distinct low bits.
inline Tag tagWithValue(const PlainTag& plain, std::size_t index) {
  const auto number = static_cast<std::uint32_t>(index);
  switch (plain.kind) {
    case Kind::Bool:
      if (index % 3 == 0) return raw(plain.code, {0x01});
      if (index % 3 == 1) return raw(plain.code, {0x01, 0x00, 0x00, 0x00});
      return raw(plain.code, {0x00, 0x00});
    case Kind::UInt8:
      return u8(plain.code, static_cast<std::uint8_t>(0x80 + number));
    case Kind::UInt16:
      return u16(plain.code, static_cast<std::uint16_t>(0x8100 + number));
    case Kind::UInt32:
      return u32(plain.code, 0x81000000u + number);
    case Kind::UInt64:
      return u64(plain.code, 0x8100000000000000ULL + number);
    case Kind::Date:
      return u32(plain.code, 1500000000u + number * 1000u);
    case Kind::String:
      return text(plain.code, std::string("value of ") + plain.code + " \xc3\xbc");
  }
  return {};
}

inline DAAPValue expectedValue(const PlainTag& plain, std::size_t index) {
  const auto number = static_cast<std::uint32_t>(index);
  switch (plain.kind) {
    case Kind::Bool:
      return index % 3 != 2;
    case Kind::UInt8:
      return std::int64_t{0x80 + number};
    case Kind::UInt16:
      return std::int64_t{0x8100 + number};
    case Kind::UInt32:
      return std::int64_t{0x81000000u + number};
    case Kind::UInt64:
      return std::uint64_t{0x8100000000000000ULL + number};
    case Kind::Date:
      return PlistDate{1500000000.0 + number * 1000.0};
    case Kind::String:
      return std::string("value of ") + plain.code + " \xc3\xbc";
  }
  return {};
}

inline std::vector<Tag> everyTagOf(const std::vector<PlainTag>& table) {
  std::vector<Tag> tags;
  for (std::size_t index = 0; index < table.size(); ++index) {
    tags.push_back(tagWithValue(table[index], index));
  }
  return tags;
}

}  // namespace larder::dmaptest
