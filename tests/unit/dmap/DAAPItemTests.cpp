// The listing record: fixed fields, the open dictionary, freezing and
// thawing, keyed access, copying, coding and description.

#include <gtest/gtest.h>

#include <regex>
#include <thread>

#include "DAAPTestSupport.h"
#include "dmap/DAAPItem.h"
#include "platform/plist/KeyedArchive.h"

namespace larder {
namespace {

DAAPKey key(const char* text) {
  return DAAPKey(text);
}

DAAPItemRef itemWithInfo(std::initializer_list<std::pair<const char*, DAAPValue>> entries,
                         std::optional<std::string> name = std::nullopt) {
  DAAPItemRef item = DAAPItem::item();
  for (const auto& [entry, value] : entries) item->setObject(value, key(entry));
  item->setName(std::move(name));
  return item;
}

// ------------------------------------------------------ freeze and thaw

TEST(DAAPItemFreezeTest, FrozenItemRefusesInfoChangesButTakesFixedFields) {
  const DAAPItemRef item = itemWithInfo({{"k", "old"}});
  item->freeze();
  item->setObject("new", key("k"));
  item->setObject("x", key("added"));
  item->setObject({}, key("k"));
  item->setValue("via value", key("k"));
  EXPECT_EQ(item->objectForKey("k"), DAAPValue("old"));
  EXPECT_EQ(item->additionalInfo()->size(), 1u);
  item->setName("n");
  item->setItemID(5);
  EXPECT_EQ(item->name(), "n");
  EXPECT_EQ(item->itemID(), 5u);
}

TEST(DAAPItemFreezeTest, FreezeAndThawMoveTheSameEntriesBetweenTheTwoDictionaries) {
  const DAAPItemRef bare = DAAPItem::item();
  EXPECT_FALSE(bare->isFrozen());
  EXPECT_EQ(bare->additionalInfo(), nullptr);
  EXPECT_EQ(bare->objectForKey("daap.songalbumid"), DAAPValue("0"));
  bare->freeze();
  ASSERT_NE(bare->frozenInfo(), nullptr);  // an item without info freezes to an empty one
  EXPECT_TRUE(bare->frozenInfo()->empty());
  EXPECT_EQ(bare->additionalInfo(), bare->frozenInfo());

  const DAAPItemRef item = itemWithInfo({{"a", 1}, {"b", "two"}});
  const DAAPDictionary before = *item->additionalInfo();
  item->thaw();  // unfrozen: no effect
  EXPECT_EQ(*item->mutableInfo(), before);
  item->freeze();
  item->freeze();
  EXPECT_TRUE(item->isFrozen());
  EXPECT_EQ(*item->frozenInfo(), before);
  EXPECT_EQ(item->mutableInfo(), nullptr);
  item->thaw();
  item->thaw();
  EXPECT_FALSE(item->isFrozen());
  EXPECT_EQ(item->frozenInfo(), nullptr);
  ASSERT_NE(item->mutableInfo(), nullptr);
  EXPECT_EQ(*item->mutableInfo(), before);
  item->setObject(3, key("c"));
  EXPECT_EQ(item->objectForKey("c").int64Value(), 3);
}

// ------------------------------------------------------- keyed access

TEST(DAAPItemKeyTest, PropertiesAreReachableByKeyOthersGoToTheDictionary) {
  const DAAPItemRef byObject = DAAPItem::item();
  byObject->setObject("Title", key("name"));  // an entry, not the property
  EXPECT_FALSE(byObject->name().has_value());
  EXPECT_EQ(byObject->objectForKey("name"), DAAPValue("Title"));

  const DAAPItemRef item = DAAPItem::item();
  item->setValue("Title", key("name"));
  item->setValue(std::int64_t{77}, key("itemID"));
  item->setValue("12", key("containerItemID"));
  item->setValue(3, key("downloadStatus"));
  item->setValue(std::uint64_t{1} << 63, key("songalbumid"));
  item->setValue(true, key("hasVideo"));
  item->setValue("Album", key("songalbum"));
  item->setValue(5, key("songartist"));  // not text: ignored
  EXPECT_EQ(item->additionalInfo(), nullptr);
  item->setValue("yes", key("isFrozen"));
  EXPECT_EQ(item->name(), "Title");
  EXPECT_EQ(item->itemID(), 77u);
  EXPECT_EQ(item->containerItemID(), 12u);
  EXPECT_EQ(item->downloadStatus(), 3);
  EXPECT_EQ(item->songalbumid(), std::uint64_t{1} << 63);
  EXPECT_EQ(item->hasVideo(), DAAPValue(true));
  EXPECT_EQ(item->songalbum(), "Album");
  EXPECT_FALSE(item->songartist().has_value());
  EXPECT_FALSE(item->isFrozen());
  EXPECT_EQ(item->objectForKey("isFrozen"), DAAPValue("yes"));
  EXPECT_EQ(item->valueForKey("itemID").int64Value(), 77);
  EXPECT_EQ(item->valueForKey("songalbum"), DAAPValue("Album"));
  EXPECT_EQ(item->valueForKey("isFrozen"), DAAPValue(false));
  EXPECT_EQ(item->valueForUndefinedKey("isFrozen"), DAAPValue("yes"));
  item->setValue({}, key("itemID"));
  EXPECT_EQ(item->itemID(), 0u);
  item->setObject(1, key("a"));
  item->setValue({}, key("isFrozen"));  // an absent value removes an entry, either way
  item->setObject({}, key("a"));
  EXPECT_TRUE(item->additionalInfo()->empty());
}

TEST(DAAPItemKeyTest, ObjectForKeyReadsThreeKeysFromFields) {
  const DAAPItemRef item = itemWithInfo({{"daap.songartist", "info artist"}});
  EXPECT_TRUE(item->objectForKey("daap.songartist").isNull());  // the field, which is empty
  item->setSongartist("Field Artist");
  item->setSongalbum("Field Album");
  item->setSongalbumid(18446744073709551615ULL);
  EXPECT_EQ(item->objectForKey("daap.songartist"), DAAPValue("Field Artist"));
  EXPECT_EQ(item->objectForKey("daap.songalbum"), DAAPValue("Field Album"));
  EXPECT_EQ(item->objectForKey("daap.songalbumid"), DAAPValue("18446744073709551615"));
}

TEST(DAAPItemKeyTest, ChangesThroughUndefinedKeysAreObservedBeforeAndAfter) {
  const DAAPItemRef item = DAAPItem::item();
  std::vector<std::string> seen;
  item->setChangeObserver([&](std::string_view changed, DAAPItem::KeyChange change) {
    const bool present = !item->objectForKey("color").isNull();
    seen.push_back(std::string(changed) +
                   (change == DAAPItem::KeyChange::WillChange ? " will" : " did") +
                   (present ? " present" : " absent"));
  });
  item->setValue("red", key("color"));
  item->setValue("Name", key("name"));  // a property: not observed here
  EXPECT_EQ(seen, (std::vector<std::string>{"color will absent", "color did present"}));
}

TEST(DAAPItemKeyTest, ItemIdFallsBackOnTheLongItemIdAndKeepsIt) {
  const DAAPItemRef item =
      itemWithInfo({{"dmap.longitemid", std::uint64_t{0x8000000000000001ULL}}});
  EXPECT_EQ(item->itemID(), 0x8000000000000001ULL);
  item->setObject(std::int64_t{5}, key("dmap.longitemid"));
  EXPECT_EQ(item->itemID(), 0x8000000000000001ULL);  // kept from the first read
  item->setItemID(0);
  EXPECT_EQ(item->itemID(), 5u);
}

// The fallback writes the id it found while readers share the item; only
// the thread sanitizer build sees a race, every build sees a wrong id.
TEST(DAAPItemKeyTest, FrozenItemSharedByThreadsReadsItsIdSafely) {
  const DAAPItemRef item = itemWithInfo({{"dmap.longitemid", std::int64_t{42}}});
  item->freeze();
  std::vector<std::thread> readers;
  std::atomic<int> right{0};
  for (int index = 0; index < 4; ++index) {
    readers.emplace_back([&] {
      for (int round = 0; round < 1000; ++round) right += item->itemID() == 42u ? 1 : 0;
    });
  }
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(right.load(), 4000);
}

TEST(DAAPItemKeyTest, MediaKindPrefersTheClientKey) {
  EXPECT_EQ(DAAPItem::item()->mediaKind(), 0);
  EXPECT_EQ(itemWithInfo({{"com.orvane.sonorel.mediakind", 8}})->mediaKind(), 8);
  EXPECT_EQ(itemWithInfo({{"com.orvane.sonorel.mediakind", 8}, {"mediaKind", 2}})->mediaKind(), 2);
  EXPECT_EQ(itemWithInfo({{"mediaKind", std::int64_t{0x1ffffffff}}})->mediaKind(), -1);
}

TEST(DAAPItemKeyTest, HasVideoIsBitZeroOfTheFlags) {
  const DAAPItemRef item = DAAPItem::item();
  EXPECT_TRUE(item->hasVideo().isNull());
  item->setItemFlags(0xfe);
  EXPECT_TRUE(item->hasVideo().isNull());
  item->setHasVideo(1);
  EXPECT_EQ(item->hasVideo(), DAAPValue(true));
  EXPECT_EQ(item->itemFlags(), 0xff);
  item->setHasVideo(false);
  EXPECT_EQ(item->itemFlags(), 0xfe);
}

// ------------------------------------------------------ updates, copies

TEST(DAAPItemUpdateTest, UpdateWithItemTakesNameAndInfoOnly) {
  const DAAPItemRef source = itemWithInfo({{"k", "v"}, {"itemID", 9}}, "Source");
  source->setSongartist("Artist");
  source->setContainerItemID(4);
  const DAAPItemRef target = DAAPItem::itemWithItem(*source);
  EXPECT_EQ(target->name(), "Source");
  EXPECT_EQ(target->objectForKey("k"), DAAPValue("v"));
  EXPECT_EQ(target->itemID(), 9u);  // an info key that names a property sets it
  EXPECT_FALSE(target->songartist().has_value());
  EXPECT_EQ(target->containerItemID(), 0u);
  target->updateItemWithItem(*DAAPItem::item());
  EXPECT_EQ(target->name(), "Source");  // only a present name is taken

  const DAAPItemRef self = itemWithInfo({{"a", 1}, {"name", "In Info"}});
  self->updateItemWithItem(*self);  // with its own info: safe
  EXPECT_EQ(self->name(), "In Info");
  EXPECT_EQ(self->objectForKey("a").int64Value(), 1);

  const DAAPItemRef frozen = DAAPItem::item();
  frozen->freeze();
  frozen->updateItemWithItem(*source);
  frozen->updateItemWithDictionary({{DAAPKey("name"), "n"}, {DAAPKey("x"), 1}});
  EXPECT_FALSE(frozen->name().has_value());
  EXPECT_TRUE(frozen->additionalInfo()->empty());
}

TEST(DAAPItemCopyTest, CopyHasNameAndInfoButNotTheOtherFields) {
  const DAAPItemRef source = itemWithInfo({{"dmap.longitemid", 31}, {"k", "v"}}, "Copied");
  source->setItemID(99);
  source->setSongartist("Artist");
  source->freeze();
  const DAAPItemRef copy = source->copyWithZone();
  EXPECT_NE(copy, source);
  EXPECT_FALSE(copy->isFrozen());
  EXPECT_EQ(copy->name(), "Copied");
  EXPECT_EQ(copy->objectForKey("k"), DAAPValue("v"));
  EXPECT_EQ(copy->itemID(), 31u);  // falls back on the long item id
  EXPECT_FALSE(copy->songartist().has_value());
  copy->setObject("changed", key("k"));
  EXPECT_EQ(source->objectForKey("k"), DAAPValue("v"));
}

// -------------------------------------------------------- representation

TEST(DAAPItemRepresentationTest, FieldsOverInfoIdentifiersAlwaysAndHasVideoOnlyWhenSet) {
  const DAAPDictionary empty = DAAPItem::item()->dictionaryRepresentation();
  EXPECT_EQ(empty, (DAAPDictionary{{DAAPKey("dmap.itemid"), std::int64_t{0}},
                                   {DAAPKey("daap.songalbumid"), std::int64_t{0}},
                                   {DAAPKey("dmap.containeritemid"), std::int64_t{0}}}));

  const DAAPItemRef item =
      itemWithInfo({{"hasVideo", true}, {"extra", 1}, {"name", "info name"}}, "Name");
  item->setSongalbum("Album");
  item->setSongalbumartist("Album Artist");
  item->setItemID(0xffffffffffffffffULL);
  item->setSongalbumid(7);
  item->setContainerItemID(0xffffffff);
  DAAPDictionary fields = item->dictionaryRepresentation();
  EXPECT_EQ(lookup(fields, "name"), DAAPValue("Name"));
  EXPECT_EQ(lookup(fields, "daap.songalbum"), DAAPValue("Album"));
  EXPECT_TRUE(lookup(fields, "daap.songartist").isNull());
  EXPECT_EQ(lookup(fields, "daap.songalbumartist"), DAAPValue("Album Artist"));
  EXPECT_EQ(lookup(fields, "dmap.itemid").uint64Value(), 0xffffffffffffffffULL);
  EXPECT_EQ(lookup(fields, "daap.songalbumid").int64Value(), 7);
  EXPECT_EQ(lookup(fields, "dmap.containeritemid").int64Value(), 0xffffffff);
  EXPECT_TRUE(lookup(fields, "hasVideo").isNull());
  EXPECT_EQ(lookup(fields, "extra").int64Value(), 1);
  item->setHasVideo(true);
  EXPECT_EQ(lookup(item->dictionaryRepresentation(), "hasVideo"), DAAPValue(true));

  const DAAPItemRef outer = itemWithInfo({{"context", DAAPArray{DAAPValue(item)}}});
  const PlistValue plist = DAAPValue(outer).toPlist();  // nested items as their representation
  EXPECT_EQ(plist["context"].array()->at(0)["name"], PlistValue("Name"));
  EXPECT_EQ(plist["dmap.itemid"], PlistValue(0));
}

// ---------------------------------------------------------------- coding

TEST(DAAPItemCodingTest, ArchiveKeepsNameAndInfoAndGivesAnUnfrozenItem) {
  const DAAPItemRef inner = itemWithInfo({{"k", "inner"}}, "Inner");
  const DAAPItemRef item =
      itemWithInfo({{"string", "text"},
                    {"number", std::uint64_t{0x8000000000000000ULL}},
                    {"date", PlistDate{1600000000}},
                    {"data", PlistData{1, 2}},
                    {"flavors", DAAPArray{DAAPDictionary{{DAAPKey("daap.songformat"), "epub"}}}},
                    {"context", DAAPArray{DAAPValue(inner)}}},
                   "Outer");
  item->setItemID(5);
  item->freeze();
  const PlistData archive = KeyedArchive::archivedData(item->encodeWithCoder());
  const std::optional<PlistValue> root =
      KeyedArchive::unarchivedRoot(archive, {"DAAPItem", "dictionary", "array", "string"});
  ASSERT_TRUE(root);
  const DAAPItemRef decoded = DAAPItem::initWithCoder(*root);
  ASSERT_TRUE(decoded);
  EXPECT_FALSE(decoded->isFrozen());
  EXPECT_EQ(decoded->name(), "Outer");
  EXPECT_EQ(decoded->itemID(), 0u);  // not archived
  const DAAPDictionary& info = *decoded->additionalInfo();
  EXPECT_EQ(info.size(), 6u);
  EXPECT_EQ(lookup(info, "string"), DAAPValue("text"));
  EXPECT_EQ(lookup(info, "number").uint64Value(), 0x8000000000000000ULL);
  EXPECT_EQ(lookup(info, "date"), DAAPValue(PlistDate{1600000000}));
  EXPECT_EQ(lookup(info, "data"), DAAPValue(PlistData{1, 2}));
  EXPECT_EQ(lookup(info, "flavors").array()->at(0)["daap.songformat"], DAAPValue("epub"));
  const DAAPItemRef decodedInner = lookup(info, "context").array()->at(0).item();
  ASSERT_TRUE(decodedInner);
  EXPECT_EQ(decodedInner->name(), "Inner");
  EXPECT_EQ(decodedInner->objectForKey("k"), DAAPValue("inner"));
}

TEST(DAAPItemCodingTest, OtherRecordsAreRefused) {
  EXPECT_EQ(DAAPItem::initWithCoder(PlistValue(KeyedArchive::record("Other"))), nullptr);
  EXPECT_EQ(DAAPItem::initWithCoder(PlistValue("DAAPItem")), nullptr);
  PlistDictionary bad = KeyedArchive::record("DAAPItem");
  bad.emplace("name", 5);
  bad.emplace("additionalInfo", "not a dictionary");
  const DAAPItemRef lenient = DAAPItem::initWithCoder(PlistValue(bad));
  ASSERT_TRUE(lenient);
  EXPECT_FALSE(lenient->name().has_value());
  EXPECT_EQ(lenient->additionalInfo(), nullptr);
}

// ----------------------------------------------------------- description

TEST(DAAPItemDescriptionTest, PlainAndSpeakerItems) {
  const DAAPItemRef plain = itemWithInfo({}, "Title");
  plain->setItemID(5);
  plain->setSongalbum("Album");
  plain->setContainerItemID(7);
  const struct {
    DAAPItemRef item;
    const char* pattern;
  } cases[] = {
      {plain, R"(Title, 5, Album, \(null\), containerItemID = 7)"},
      {itemWithInfo({{"macAddress", std::int64_t{0x1b638445e6}},
                     {"supportsVideo", true},
                     {"isPlaying", true},
                     {"selected", true},
                     {"volume", 0.5},
                     {"hasPassword", 1}},
                    "Kitchen"),
       R"(Skylane Video: Kitchen, isPlaying, selected v:0\.500000 supportsVolume:1, locked:1, )"
       R"(macAddress:117633730022)"},
      {itemWithInfo({{"macAddress", 1}}, "Den"),
       R"(Skylane: Den, supportsVolume:0, locked:0, macAddress:1)"},
  };
  for (const auto& c : cases) {
    EXPECT_TRUE(std::regex_match(
        c.item->description(), std::regex(std::string(R"(<DAAPItem: 0x[0-9a-f]+> )") + c.pattern)))
        << c.item->description();
  }
}

}  // namespace
}  // namespace larder
