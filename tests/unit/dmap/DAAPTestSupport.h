#pragma once

#include <algorithm>
#include <cstdint>
#include <memory>
#include <mutex>
#include <ostream>
#include <sstream>
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
inline void PrintTo(const DAAPKey& key, std::ostream* out) {
  *out << key.str();
}

}  // namespace larder

namespace larder::dmaptest {

// One tag of a document under construction: a leaf with its value bytes,
// or a container with its children. Numbers are laid out big-endian here,
// not by the writer under test; each container's size is worked out ahead,
// as a client writes a request body.
struct Tag {
  std::uint32_t code = 0;
  PlistData bytes;
  std::vector<Tag> children;
  bool isContainer = false;

  [[nodiscard]] std::uint32_t valueSize() const {
    if (!isContainer) return static_cast<std::uint32_t>(bytes.size());
    std::uint32_t size = 0;
    for (const Tag& child : children) size += 8 + child.valueSize();
    return size;
  }

  void writeTo(DAAPBuffer& buffer) const {
    if (!isContainer) {
      buffer.appendUTF8String(std::span<const std::uint8_t>(bytes), code);
      return;
    }
    buffer.appendHeader(code, valueSize());
    for (const Tag& child : children) child.writeTo(buffer);
  }
};

inline std::uint32_t code(std::string_view text) {
  return DAAPCode::fromText(text);
}

inline Tag raw(std::string_view name, PlistData bytes) {
  return Tag{.code = code(name), .bytes = std::move(bytes)};
}
inline Tag text(std::string_view name, std::string_view value) {
  return raw(name, PlistData(value.begin(), value.end()));
}
inline Tag number(std::string_view name, std::uint64_t value, int width) {
  PlistData bytes;
  for (int shift = 8 * (width - 1); shift >= 0; shift -= 8) {
    bytes.push_back(static_cast<std::uint8_t>(value >> shift));
  }
  return raw(name, std::move(bytes));
}
inline Tag u8(std::string_view name, std::uint8_t value) {
  return number(name, value, 1);
}
inline Tag u16(std::string_view name, std::uint16_t value) {
  return number(name, value, 2);
}
inline Tag u32(std::string_view name, std::uint32_t value) {
  return number(name, value, 4);
}
inline Tag u64(std::string_view name, std::uint64_t value) {
  return number(name, value, 8);
}
inline Tag container(std::string_view name, std::vector<Tag> children) {
  return Tag{.code = code(name), .children = std::move(children), .isContainer = true};
}

inline PlistData document(const Tag& top) {
  DAAPBuffer buffer;
  top.writeTo(buffer);
  return buffer.data();
}

// Tags one after another, as a container's value.
inline PlistData bodyOf(const std::vector<Tag>& tags) {
  DAAPBuffer buffer;
  for (const Tag& tag : tags) tag.writeTo(buffer);
  return buffer.data();
}

inline DAAPValue decode(const Tag& top) {
  return DAAPParser::decodeData(document(top));
}

// A dictionary written out in a test, with keys that own their text.
inline DAAPDictionary dictionaryOf(
    std::initializer_list<std::pair<const char*, DAAPValue>> entries) {
  DAAPDictionary result;
  for (const auto& [key, value] : entries) result.insert_or_assign(DAAPKey(key), value);
  return result;
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

  [[nodiscard]] std::vector<std::string> texts() const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> result;
    for (const Line& line : lines_) result.push_back(line.text);
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
  std::string code;
  Kind kind;
  std::string key;
};

// The plain tags of every container, transcribed from the protocol's tables
// and grouped by how the value is read: pairs of code and the key it is
// stored under, separated by blanks.
struct KindGroup {
  Kind kind;
  std::string_view pairs;
};

inline std::vector<PlainTag> plainTags(std::initializer_list<KindGroup> groups) {
  std::vector<PlainTag> table;
  for (const KindGroup& group : groups) {
    std::istringstream words{std::string(group.pairs)};
    std::string code;
    std::string key;
    while (words >> code >> key) table.push_back({code, group.kind, key});
  }
  return table;
}

const std::vector<PlainTag> kListingItemTags = plainTags({
    {Kind::String,
     "aeCR com.orvane.sonorel.content-rating  aeCT com.orvane.sonorel.cloud-artwork-token "
     "aeCa com.orvane.sonorel.cloud-artwork-url  aeEN com.orvane.sonorel.episode-num-str "
     "aePd com.orvane.sonorel.display-publication-version "
     "aeSN com.orvane.sonorel.series-name  agrp daap.songgrouping "
     "ascn daap.songcontentdescription  ascp daap.songcomposer  asct daap.songcategory "
     "asdt daap.songdescription  asfm daap.songformat  asgn daap.songgenre "
     "aslc daap.songlongcontentdescription  aspu daap.songpodcasturl  assa daap.sortartist "
     "assn daap.sortname  assu daap.sortalbum  asul daap.songdataurl "
     "cmbd libraryDisplayName  cmbm libraryServiceDomain  cmbs libraryServiceName "
     "cmbt libraryServiceType  cmid identifier  cmnm name  pasp aspectRatio"},
    {Kind::UInt8,
     "aeHD com.orvane.sonorel.is-hd-video  aeMK com.orvane.sonorel.mediakind "
     "aePC com.orvane.sonorel.is-podcast  aePS com.orvane.sonorel.special-playlist "
     "aprm daap.playlistrepeatmode  apsm daap.playlistshufflemode  asbk daap.bookmarkable "
     "ascr daap.songcontentrating  ashp daap.songhasbeenplayed  asur daap.songuserrating "
     "cahp hasPassword  mgds dmap.groupdownloadstatus  mikd dmap.itemkind "
     "msas dmap.authenticationschemes  msau dmap.authenticationmethod"},
    {Kind::UInt16,
     "asac daap.songartworkcount  asdc daap.songdisccount  asdn daap.songdiscnumber "
     "astc daap.songtrackcount  astn daap.songtracknumber  asyr daap.songyear"},
    {Kind::UInt32,
     "aeCs com.orvane.sonorel.cloud-connect-status  aeES com.orvane.sonorel.episode-sort "
     "aeRD com.orvane.sonorel.rental-duration  aeRP com.orvane.sonorel.rental-pb-start "
     "aeRS com.orvane.sonorel.rental-start  aeRU com.orvane.sonorel.rental-pb-duration "
     "aeSU com.orvane.sonorel.season-num  aeto com.orvane.sonorel.cloud-purchased-token "
     "agac daap.groupalbumcount  agma daap.groupmatchedqueryalbumcount "
     "agmi daap.groupmatchedqueryitemcount  asbo daap.songbookmark "
     "askp daap.songuserskipcount  aspc daap.songuserplaycount  astm daap.songtime "
     "capr dacp.protocolversion  cmmn minimum  cmmx maximum  cmpr dmcp.protocolversion "
     "mctc dmap.containercount  mdbk dmap.databasekind  merr dmap.errorresponse "
     "mimc dmap.itemcount  mshi headerItemIndex  mshn headerItemCount  mstt dmap.status"},
    {Kind::UInt64,
     "aeAD com.orvane.sonorel.ware-ids-array  aeAI com.orvane.sonorel.orms-artistid "
     "aeAi com.orvane.sonorel.ware-id  aeCU com.orvane.sonorel.cloud-user-id "
     "aeCd com.orvane.sonorel.cloud-id  aeIM com.orvane.sonorel.sonorel-machine-id "
     "aeRM com.orvane.sonorel.remote-sonorel-machine-id "
     "aeSE com.orvane.sonorel.store-pers-id  aepv com.orvane.sonorel.publication-version "
     "ceSX kExtDACPSupportedSonorelExtensionsCode  mild dmap.longitemid "
     "mper dmap.persistentid  mrpr dmap.remotepersistentid  msma macAddress"},
    {Kind::Bool,
     "abpl daap.baseplaylist  aeHS com.orvane.sonorel.is-homeshare "
     "aeMI com.orvane.sonorel.mastered-for-sonorel  aeSG com.orvane.sonorel.saved-curator "
     "aeSP com.orvane.sonorel.smart-playlist  asdb daap.songdisabled  caia selected "
     "caip isPlaying  caiv supportsVideo  caov supportsMultiSpeakerVolume "
     "cass supportsSpeakerSelection  casu supportsSetUserRating  cavd selectedForVideo "
     "ceDR com.orvane.sonorel.supports-directional-remote "
     "ceSG com.orvane.sonorel.supports-curator-control  cmrl supportsRemoteLibrarySelection "
     "cmsb supportsBeaconSourcesUpdates  cmsc supportsControlPromptRequests "
     "cmsp supportsPlayStatusUpdate  cmsv supportsVolume  crol readOnly "
     "mavl dmap.itemavailable  mihi dmap.itemhidden"},
    {Kind::Date,
     "ajEd com.orvane.sonorel.store.expected-release-date  asda daap.songdateadded "
     "asdm daap.songdatemodified  asdp daap.songdatepurchased  asdr daap.songdatereleased"},
});

const std::vector<PlainTag> kServerInfoTags = plainTags({
    {Kind::UInt32,
     "mstt dmap.status  mpro dmap.protocolversion  apro daap.protocolversion  ppro ppro "
     "atSV Client-TVB-Sharing-Version  aeSV com.orvane.sonorel.music-sharing-version "
     "aeto com.orvane.sonorel.cloud-purchase-token  mstm dmap.timeoutinterval "
     "mstc dmap.utctime  msto dmap.utcoffset  msdc dmap.databasescount"},
    {Kind::UInt64, "aeSX com.orvane.sonorel.supportedextensions  mild dmap.longitemid"},
    {Kind::Bool,
     "aeCP supportsPurchases  aeMQ com.orvane.sonorel.playlist-contains-media-type "
     "msed supportsEditing  meds dmap.editcommandssupported "
     "msii dmap.supportsinlinecontaineritems  msli dmap.supportslongitemid "
     "asse daap.supportssetproperty"},
    {Kind::String, "minm dmap.itemname  mmdl model  mmnf manufacturer"},
    {Kind::UInt8,
     "dvty deviceType  mslr dmap.loginrequired  msal dmap.supportsautologout "
     "msau dmap.authenticationmethod  msas dmap.authenticationschemes "
     "msup dmap.supportsupdate  mspi dmap.supportspersistentids "
     "msex dmap.supportsextensions  msbr dmap.supportsbrowse  msqy dmap.supportsquery "
     "msix dmap.supportsindex  msrs dmap.supportsresolve"},
    {Kind::UInt16, "asgr daap.supportsgroups  ated daap.supportsextradata"},
});

const std::vector<PlainTag> kDACPPropertyTags = plainTags({
    {Kind::UInt32,
     "mstt dmap.status  cmsr dmcp.playstatusrevision  caas dacp.availableshufflestates "
     "caar dacp.availablerepeatstates  cant dacp.playingtime  cast daap.songtime "
     "cmmk mediaKind  aeSI com.orvane.sonorel.orms-songid"},
    {Kind::UInt8, "caps dacp.playerstate  cash dacp.shufflestate  carp dacp.repeatstate"},
    {Kind::Bool,
     "cafe dacp.fullscreenenabled  cafs dacp.fullscreen  cave dacp.visualizerenabled "
     "cavs dacp.visualizer  cavc dacp.volumecontrollable "
     "ceGS com.orvane.sonorel.can-be-curator-seed"},
    {Kind::String,
     "cann dmap.itemname  cana daap.songartist  canl daap.songalbum  cang NPGenre "
     "cmbd libraryDisplayName  cmbm libraryServiceDomain  cmbs libraryServiceName "
     "cmbt libraryServiceType"},
    {Kind::UInt64, "mper dmap.persistentid  asai daap.songalbumid"},
});

const std::vector<PlainTag> kFlavorTags = plainTags({
    {Kind::String,
     "aeRp com.orvane.sonorel.item-redownload-param-2 "
     "ajUp com.orvane.sonorel.store.item-update-param  asfm daap.songformat"},
    {Kind::UInt32,
     "aefd com.orvane.sonorel.item-flavor-id  ascd daap.songcodectype "
     "ascs daap.songcodecsubtype  assr daap.songsamplerate  astm daap.songtime"},
    {Kind::UInt16, "asbr daap.songbitrate"},
    {Kind::UInt8, "asdk daap.songdatakind"},
    {Kind::UInt64, "asls daap.songlongsize"},
});

const std::vector<PlainTag> kListingHeaderTags = plainTags({
    {Kind::UInt32,
     "mstt dmap.status  mtco dmap.specifiedtotalcount  musr dmap.serverrevision "
     "cmbr dmcp.beaconsourcesrevision"},
    {Kind::UInt8, "muty dmap.updatetype"},
});

const std::vector<PlainTag> kErrorTags = plainTags({
    {Kind::UInt32, "mstt dmap.status  aeRC com.orvane.sonorel.reconnect-interval"},
});

const std::vector<PlainTag> kContentCollectionTags = plainTags({
    {Kind::UInt32, "mcnm dmap.contentcodesnumber"},
    {Kind::String, "mcna dmap.contentcodesname"},
});

const std::vector<PlainTag> kControlPromptCollectionTags = plainTags({
    {Kind::String, "cmca attributes  cmcv value  cmce name"},
});

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

// The listing documents, which all decode the same way.
constexpr const char* kListingCodes[] = {"abro", "adbs", "aeBR", "agal", "agar", "aply", "apso",
                                         "avdb", "caci", "cmbu", "cprp", "mctl", "mscr", "mupd"};

const std::vector<TopLevelCode> kTopLevelCodes = [] {
  std::vector<TopLevelCode> codes;
  for (const char* code : kListingCodes) codes.push_back({code, Shape::Dictionary});
  codes.insert(codes.end(), {{"cacr", Shape::Item},
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
                             {"arsv", Shape::Null}});
  return codes;
}();

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
  for (const char* code : kListingCodes) {
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
