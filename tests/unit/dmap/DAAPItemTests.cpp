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

DAAPItemRef itemWithInfo(std::initializer_list<std::pair<const char*, DAAPValue>> entries) {
  DAAPItemRef item = DAAPItem::item();
  for (const auto& [name, value] : entries) item->setObject(value, key(name));
  return item;
}

// ------------------------------------------------------ freeze and thaw

TEST(DAAPItemFreezeTest, NewItemIsUnfrozenWithoutInfo) {
  const DAAPItemRef item = DAAPItem::item();
  EXPECT_FALSE(item->isFrozen());
  EXPECT_EQ(item->additionalInfo(), nullptr);
  EXPECT_EQ(item->objectForKey("daap.songalbumid"), DAAPValue("0"));
}

TEST(DAAPItemFreezeTest, SetObjectOnAFrozenItemChangesNothing) {
  const DAAPItemRef item = itemWithInfo({{"k", "old"}});
  item->freeze();
  item->setObject("new", key("k"));
  item->setObject("x", key("added"));
  item->setObject({}, key("k"));
  item->setValue("via value", key("k"));
  EXPECT_EQ(item->objectForKey("k"), DAAPValue("old"));
  EXPECT_EQ(item->additionalInfo()->size(), 1u);
}

TEST(DAAPItemFreezeTest, FreezingAnItemWithoutInfoGivesAnEmptyDictionary) {
  const DAAPItemRef item = DAAPItem::item();
  item->freeze();
  EXPECT_TRUE(item->isFrozen());
  ASSERT_NE(item->frozenInfo(), nullptr);
  EXPECT_TRUE(item->frozenInfo()->empty());
  EXPECT_EQ(item->additionalInfo(), item->frozenInfo());
  EXPECT_EQ(item->mutableInfo(), nullptr);
}

TEST(DAAPItemFreezeTest, ThawAfterFreezeGivesBackTheSameEntries) {
  const DAAPItemRef item = itemWithInfo({{"a", 1}, {"b", "two"}});
  const DAAPDictionary before = *item->additionalInfo();
  item->freeze();
  EXPECT_EQ(*item->frozenInfo(), before);
  EXPECT_EQ(item->mutableInfo(), nullptr);
  item->thaw();
  EXPECT_FALSE(item->isFrozen());
  EXPECT_EQ(item->frozenInfo(), nullptr);
  ASSERT_NE(item->mutableInfo(), nullptr);
  EXPECT_EQ(*item->mutableInfo(), before);
  item->setObject(3, key("c"));
  EXPECT_EQ(item->objectForKey("c").int64Value(), 3);
}

TEST(DAAPItemFreezeTest, FreezeAndThawAreIdempotent) {
  const DAAPItemRef item = itemWithInfo({{"a", 1}});
  item->thaw();  // unfrozen: no effect
  EXPECT_EQ(item->mutableInfo()->size(), 1u);
  item->freeze();
  item->freeze();
  EXPECT_EQ(item->frozenInfo()->size(), 1u);
  item->thaw();
  item->thaw();
  EXPECT_EQ(item->mutableInfo()->size(), 1u);
}

TEST(DAAPItemFreezeTest, FixedFieldsCanBeSetOnAFrozenItem) {
  const DAAPItemRef item = DAAPItem::item();
  item->freeze();
  item->setName("n");
  item->setItemID(5);
  item->setSongartist("a");
  item->setContainerItemID(9);
  EXPECT_EQ(item->name(), "n");
  EXPECT_EQ(item->itemID(), 5u);
  EXPECT_EQ(item->songartist(), "a");
  EXPECT_EQ(item->containerItemID(), 9u);
}

// ------------------------------------------------------- keyed access

TEST(DAAPItemKeyTest, NameByValueIsThePropertyByObjectIsAnEntry) {
  const DAAPItemRef byValue = DAAPItem::item();
  byValue->setValue("Title", key("name"));
  EXPECT_EQ(byValue->name(), "Title");
  EXPECT_EQ(byValue->additionalInfo(), nullptr);
  const DAAPItemRef byObject = DAAPItem::item();
  byObject->setObject("Title", key("name"));
  EXPECT_FALSE(byObject->name().has_value());
  EXPECT_EQ(byObject->objectForKey("name"), DAAPValue("Title"));
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

TEST(DAAPItemKeyTest, AbsentValueRemovesTheKey) {
  const DAAPItemRef item = itemWithInfo({{"a", 1}, {"b", 2}});
  item->setObject({}, key("a"));
  item->setValue({}, key("b"));
  EXPECT_TRUE(item->additionalInfo()->empty());
}

TEST(DAAPItemKeyTest, PropertiesAreReachableByKeyOthersGoToTheDictionary) {
  const DAAPItemRef item = DAAPItem::item();
  item->setValue(std::int64_t{77}, key("itemID"));
  item->setValue("12", key("containerItemID"));
  item->setValue(3, key("downloadStatus"));
  item->setValue(std::uint64_t{1} << 63, key("songalbumid"));
  item->setValue(true, key("hasVideo"));
  item->setValue("Album", key("songalbum"));
  item->setValue(5, key("songartist"));  // not text: ignored
  item->setValue("yes", key("isFrozen"));
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

// -------------------------------------------------------------- updates

TEST(DAAPItemUpdateTest, UpdateWithItemTakesNameAndInfoOnly) {
  const DAAPItemRef source = itemWithInfo({{"k", "v"}, {"itemID", 9}});
  source->setName("Source");
  source->setSongartist("Artist");
  source->setContainerItemID(4);
  const DAAPItemRef target = DAAPItem::itemWithItem(*source);
  EXPECT_EQ(target->name(), "Source");
  EXPECT_EQ(target->objectForKey("k"), DAAPValue("v"));
  EXPECT_EQ(target->itemID(), 9u);  // an info key that names a property sets it
  EXPECT_FALSE(target->songartist().has_value());
  EXPECT_EQ(target->containerItemID(), 0u);

  const DAAPItemRef unnamed = DAAPItem::item();
  target->updateItemWithItem(*unnamed);
  EXPECT_EQ(target->name(), "Source");  // only a present name is taken
}

TEST(DAAPItemUpdateTest, UpdatesDoNothingToAFrozenItem) {
  const DAAPItemRef source = itemWithInfo({{"k", "v"}});
  source->setName("Source");
  const DAAPItemRef frozen = DAAPItem::item();
  frozen->freeze();
  frozen->updateItemWithItem(*source);
  frozen->updateItemWithDictionary({{DAAPKey("name"), "n"}, {DAAPKey("x"), 1}});
  EXPECT_FALSE(frozen->name().has_value());
  EXPECT_TRUE(frozen->additionalInfo()->empty());
}

TEST(DAAPItemUpdateTest, UpdateWithItsOwnInfoIsSafe) {
  const DAAPItemRef item = itemWithInfo({{"a", 1}, {"name", "In Info"}});
  item->updateItemWithItem(*item);
  EXPECT_EQ(item->name(), "In Info");
  EXPECT_EQ(item->objectForKey("a").int64Value(), 1);
}

// ---------------------------------------------------------------- copies

TEST(DAAPItemCopyTest, CopyHasNameAndInfoButNotTheOtherFields) {
  const DAAPItemRef source = itemWithInfo({{"dmap.longitemid", 31}, {"k", "v"}});
  source->setName("Copied");
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

TEST(DAAPItemRepresentationTest, AlwaysHoldsTheIdentifiers) {
  const DAAPDictionary empty = DAAPItem::item()->dictionaryRepresentation();
  EXPECT_EQ(lookup(empty, "dmap.itemid"), DAAPValue(std::int64_t{0}));
  EXPECT_EQ(lookup(empty, "daap.songalbumid"), DAAPValue(std::int64_t{0}));
  EXPECT_EQ(lookup(empty, "dmap.containeritemid"), DAAPValue(std::int64_t{0}));
  EXPECT_EQ(empty.size(), 3u);
}

TEST(DAAPItemRepresentationTest, FieldsOverInfoAndHasVideoOnlyWhenSet) {
  const DAAPItemRef item = itemWithInfo({{"hasVideo", true}, {"extra", 1}, {"name", "info name"}});
  item->setName("Name");
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
}

TEST(DAAPItemRepresentationTest, ToPlistTurnsNestedItemsIntoTheirRepresentation) {
  const DAAPItemRef inner = DAAPItem::item();
  inner->setName("Inner");
  const DAAPItemRef outer = itemWithInfo({{"context", DAAPArray{DAAPValue(inner)}}});
  const PlistValue plist = DAAPValue(outer).toPlist();
  EXPECT_EQ(plist["context"].array()->at(0)["name"], PlistValue("Inner"));
  EXPECT_EQ(plist["dmap.itemid"], PlistValue(0));
}

// ---------------------------------------------------------------- coding

TEST(DAAPItemCodingTest, ArchiveKeepsNameAndInfoAndGivesAnUnfrozenItem) {
  const DAAPItemRef inner = itemWithInfo({{"k", "inner"}});
  inner->setName("Inner");
  const DAAPItemRef item =
      itemWithInfo({{"string", "text"},
                    {"number", std::uint64_t{0x8000000000000000ULL}},
                    {"date", PlistDate{1600000000}},
                    {"data", PlistData{1, 2}},
                    {"flavors", DAAPArray{DAAPDictionary{{DAAPKey("daap.songformat"), "epub"}}}},
                    {"context", DAAPArray{DAAPValue(inner)}}});
  item->setName("Outer");
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

TEST(DAAPItemDescriptionTest, PlainItem) {
  const DAAPItemRef item = DAAPItem::item();
  item->setName("Title");
  item->setItemID(5);
  item->setSongalbum("Album");
  item->setContainerItemID(7);
  EXPECT_TRUE(std::regex_match(
      item->description(),
      std::regex(R"(<DAAPItem: 0x[0-9a-f]+> Title, 5, Album, \(null\), containerItemID = 7)")))
      << item->description();
}

TEST(DAAPItemDescriptionTest, SpeakerItem) {
  const DAAPItemRef speaker = itemWithInfo({{"macAddress", std::int64_t{0x1b638445e6}},
                                            {"supportsVideo", true},
                                            {"isPlaying", true},
                                            {"selected", true},
                                            {"volume", 0.5},
                                            {"hasPassword", 1}});
  speaker->setName("Kitchen");
  EXPECT_TRUE(std::regex_match(
      speaker->description(),
      std::regex(R"(<DAAPItem: 0x[0-9a-f]+> Skylane Video: Kitchen, isPlaying, selected )"
                 R"(v:0\.500000 supportsVolume:1, locked:1, macAddress:117633730022)")))
      << speaker->description();
  const DAAPItemRef quiet = itemWithInfo({{"macAddress", 1}});
  quiet->setName("Den");
  EXPECT_TRUE(std::regex_match(quiet->description(),
                               std::regex(R"(<DAAPItem: 0x[0-9a-f]+> Skylane: Den, )"
                                          R"(supportsVolume:0, locked:0, macAddress:1)")))
      << quiet->description();
}

}  // namespace
}  // namespace larder
