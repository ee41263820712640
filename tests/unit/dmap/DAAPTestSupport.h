#pragma once

#include <algorithm>
#include <cstdint>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPItem.h"
#include "dmap/DAAPParser.h"
#include "platform/log/TillLogManager.h"

namespace larder {

// Lets test failures show values as the log shows them.
inline void PrintTo(const DAAPValue& value, std::ostream* out) {
  *out << value.description();
}

}  // namespace larder

namespace larder::dmaptest {

// One tag of a document under construction: a leaf with its value bytes,
// or a container with its children. Written through DAAPBuffer, with each
// container's size worked out ahead, as a client writes a request body.
struct Tag {
  enum class Width { Raw, UInt8, UInt32, UInt64 };

  std::uint32_t code = 0;
  Width width = Width::Raw;
  std::uint64_t number = 0;
  PlistData bytes;
  std::vector<Tag> children;
  bool isContainer = false;

  [[nodiscard]] std::uint32_t valueSize() const {
    if (!isContainer) {
      switch (width) {
        case Width::UInt8:
          return 1;
        case Width::UInt32:
          return 4;
        case Width::UInt64:
          return 8;
        case Width::Raw:
          return static_cast<std::uint32_t>(bytes.size());
      }
    }
    std::uint32_t size = 0;
    for (const Tag& child : children) size += 8 + child.valueSize();
    return size;
  }

  void writeTo(DAAPBuffer& buffer) const {
    if (isContainer) {
      buffer.appendHeader(code, valueSize());
      for (const Tag& child : children) child.writeTo(buffer);
      return;
    }
    switch (width) {
      case Width::UInt8:
        buffer.appendUInt8(static_cast<std::uint8_t>(number), code);
        return;
      case Width::UInt32:
        buffer.appendUInt32(static_cast<std::uint32_t>(number), code);
        return;
      case Width::UInt64:
        buffer.appendUInt64(number, code);
        return;
      case Width::Raw:
        buffer.appendUTF8String(std::span<const std::uint8_t>(bytes), code);
        return;
    }
  }
};

inline std::uint32_t code(std::string_view text) {
  return DAAPCode::fromText(text);
}

inline Tag raw(std::string_view name, PlistData bytes) {
  Tag tag;
  tag.code = code(name);
  tag.bytes = std::move(bytes);
  return tag;
}
inline Tag text(std::string_view name, std::string_view value) {
  return raw(name, PlistData(value.begin(), value.end()));
}
inline Tag u8(std::string_view name, std::uint8_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt8;
  tag.number = value;
  return tag;
}
inline Tag u16(std::string_view name, std::uint16_t value) {
  return raw(name, {static_cast<std::uint8_t>(value >> 8), static_cast<std::uint8_t>(value)});
}
inline Tag u32(std::string_view name, std::uint32_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt32;
  tag.number = value;
  return tag;
}
inline Tag u64(std::string_view name, std::uint64_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt64;
  tag.number = value;
  return tag;
}
inline Tag container(std::string_view name, std::vector<Tag> children) {
  Tag tag;
  tag.code = code(name);
  tag.isContainer = true;
  tag.children = std::move(children);
  return tag;
}

inline PlistData document(const Tag& top) {
  DAAPBuffer buffer;
  top.writeTo(buffer);
  return buffer.data();
}

inline DAAPValue decode(const Tag& top) {
  return DAAPParser::decodeData(document(top));
}

inline PlistData bytesOf(std::string_view text) {
  return PlistData(text.begin(), text.end());
}

// Captures the log's lines at level 3 for as long as it lives, and puts the
// level back afterwards.
class LogCapture {
 public:
  struct Line {
    int level;
    std::string text;
  };

  LogCapture() : previousLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(3);
    handle_ = TillLogManager::sharedManager().addSink([this](int level, const std::string& line) {
      std::lock_guard lock(mutex_);
      lines_.push_back({level, line});
    });
  }
  ~LogCapture() {
    handle_.reset();
    TillLogManager::sharedManager().setLevel(previousLevel_);
  }
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  [[nodiscard]] std::vector<Line> lines() const {
    std::lock_guard lock(mutex_);
    return lines_;
  }
  [[nodiscard]] std::vector<std::string> texts() const {
    std::vector<std::string> result;
    for (const Line& line : lines()) result.push_back(line.text);
    return result;
  }
  void clear() {
    std::lock_guard lock(mutex_);
    lines_.clear();
  }
  [[nodiscard]] std::size_t countExactly(std::string_view text, int level = 3) const {
    std::lock_guard lock(mutex_);
    return static_cast<std::size_t>(
        std::count_if(lines_.begin(), lines_.end(),
                      [&](const Line& line) { return line.text == text && line.level == level; }));
  }
  [[nodiscard]] std::size_t countContaining(std::string_view fragment) const {
    std::lock_guard lock(mutex_);
    return static_cast<std::size_t>(std::count_if(
        lines_.begin(), lines_.end(),
        [&](const Line& line) { return line.text.find(fragment) != std::string::npos; }));
  }
  [[nodiscard]] std::size_t size() const {
    std::lock_guard lock(mutex_);
    return lines_.size();
  }

 private:
  int previousLevel_;
  std::shared_ptr<void> handle_;
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

// ------------------------------------------------------ protocol tables

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

// ------------------------------------------------ top-level documents

// What a document decodes to is decided by its top-level code alone,
// whatever its body holds.
enum class Shape { Dictionary, Item, Array, DictionaryOrNull, NumberOrNull, Null };

struct TopLevelCode {
  const char* code;
  Shape shape;
};

const std::vector<TopLevelCode> kTopLevelCodes{{"abro", Shape::Dictionary},
                                               {"adbs", Shape::Dictionary},
                                               {"aeBR", Shape::Dictionary},
                                               {"agal", Shape::Dictionary},
                                               {"agar", Shape::Dictionary},
                                               {"aply", Shape::Dictionary},
                                               {"apso", Shape::Dictionary},
                                               {"avdb", Shape::Dictionary},
                                               {"caci", Shape::Dictionary},
                                               {"cmbu", Shape::Dictionary},
                                               {"cprp", Shape::Dictionary},
                                               {"mctl", Shape::Dictionary},
                                               {"mscr", Shape::Dictionary},
                                               {"mupd", Shape::Dictionary},
                                               {"cacr", Shape::Item},
                                               {"medc", Shape::Item},
                                               {"casp", Shape::Array},
                                               {"ceGI", Shape::Array},
                                               {"cmcp", Shape::Dictionary},
                                               {"cmgt", Shape::Dictionary},
                                               {"cmst", Shape::Dictionary},
                                               {"mccr", Shape::Array},
                                               {"merr", Shape::DictionaryOrNull},
                                               {"mlog", Shape::NumberOrNull},
                                               {"msrv", Shape::Dictionary},
                                               {"arsv", Shape::Null}};

inline bool hasShape(const DAAPValue& value, Shape shape) {
  switch (shape) {
    case Shape::Dictionary:
      return value.isDictionary();
    case Shape::Item:
      return value.isItem() && value.item()->isFrozen();
    case Shape::Array:
      return value.isArray();
    case Shape::DictionaryOrNull:
      return value.isDictionary() || value.isNull();
    case Shape::NumberOrNull:
      return value.isNull() || value.type() == DAAPValue::Type::Integer;
    case Shape::Null:
      return value.isNull();
  }
  return false;
}

// One realistic document for every top-level code, which is also what the
// DMAP fuzz targets start from (see fuzz/seeds/).
inline Tag bookItem(std::uint32_t identifier) {
  return container(
      "mlit", {u32("miid", identifier),
               text("minm", "A Tale of Two Harbours"),
               text("asar", "J. Doe"),
               text("asal", "Harbours"),
               u64("asai", 0x1122334455667788ULL),
               u8("mikd", 2),
               text("asgn", "Fiction"),
               text("assn", "Tale of Two Harbours"),
               u32("asdp", 1600000000),
               u64("aepv", 3),
               text("aePd", "1.2"),
               u32("aeto", 0xfeedbeef),
               u32("aeMk", 8),
               u64("aeSI", 987654321),
               text("aeCa", "https://art.example/{w}x{h}.jpg"),
               u32("ajEd", 1700000000),
               u32("aeCS", 4242),
               u64("mper", 0x0a0b0c0d0e0f1011ULL),
               container("aefl", {container("aeif", {u32("aefd", 1), text("asfm", "epub"),
                                                     u64("asls", 1048576), text("aeRp", "p=1")})}),
               container("mdcl", {text("mdky", "custom"), text("mdvl", "value")}),
               u16("cmvt", 3),
               u32("cval", 5),
               raw("mshc", {0, 'A'})});
}

inline std::vector<std::pair<std::string, Tag>> seedDocuments() {
  std::vector<std::pair<std::string, Tag>> seeds;
  for (const char* code : {"abro", "adbs", "aeBR", "agal", "agar", "aply", "apso", "avdb", "caci",
                           "cmbu", "cprp", "mctl", "mscr", "mupd"}) {
    seeds.emplace_back(
        code, container(code, {u32("mstt", 200), u8("muty", 0), u32("mtco", 2), u32("mrco", 2),
                               u32("musr", 17), container("mlcl", {bookItem(1), bookItem(2)}),
                               container("mudl", {u64("mild", 99)}),
                               container("abgn", {text("mlit", "Fiction")})}));
  }
  seeds.emplace_back("cacr", container("cacr", {u32("miid", 5), text("minm", "x")}));
  seeds.emplace_back("medc", container("medc", bookItem(6).children));
  seeds.emplace_back(
      "casp",
      container("casp", {u32("mstt", 200),
                         container("mdcl", {text("minm", "Kitchen"), u64("msma", 0x1b638445e6),
                                            u8("caia", 1), u32("cmvo", 50)})}));
  seeds.emplace_back(
      "ceGI",
      container("ceGI", {container("mlit", {u32("miid", 7), container("cmvl", {bookItem(8)})})}));
  seeds.emplace_back(
      "cmcp",
      container("cmcp",
                {u32("mstt", 200), u32("miid", 9),
                 container("mdcl", {text("cmca", "a"), text("cmcv", "v"), text("cmce", "n")})}));
  std::vector<Tag> dacp = everyTagOf(kDACPPropertyTags);
  dacp.push_back(raw("canp", PlistData(16, 1)));
  dacp.push_back(u8("ceQu", 1));
  dacp.push_back(text("ceSD",
                      "<plist version=\"1.0\"><dict><key>id</key><string>1</string>"
                      "</dict></plist>"));
  seeds.emplace_back("cmgt", container("cmgt", dacp));
  seeds.emplace_back("cmst", container("cmst", dacp));
  seeds.emplace_back(
      "mccr", container("mccr", {u32("mstt", 200), container("mdcl", {u32("mcnm", 0x6d696964),
                                                                      text("mcna", "dmap.itemid"),
                                                                      u16("mcty", 5)})}));
  seeds.emplace_back("merr", container("merr", {u32("mstt", 503), u32("aeRC", 60)}));
  seeds.emplace_back("mlog", container("mlog", {u32("mstt", 200), u32("mlid", 1234)}));
  std::vector<Tag> info = everyTagOf(kServerInfoTags);
  info.push_back(container("msml", {u64("msma", 1)}));
  seeds.emplace_back("msrv", container("msrv", info));
  seeds.emplace_back("arsv", container("arsv", {u32("mstt", 200)}));
  return seeds;
}

}  // namespace larder::dmaptest
