#include "platform/fileprovider/item_codec.h"

#include <capnp/message.h>
#include <gtest/gtest.h>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

ItemFields fullItem() {
  ItemFields item;
  item.identifier = "d:9223372036854775807";
  item.parentIdentifier = "i:17";
  item.filename = std::string("na\xFFme\nwith \0 bytes", 17);
  item.contentType = "text/plain";
  item.kind = ItemKind::Bookmark;
  item.rawID = 9223372036854775807ULL;
  item.size = 1ULL << 40U;
  item.creationDate = NSDate::fromNanoseconds(-1);
  item.modificationDate = NSDate::fromNanoseconds(1'700'000'000'123'456'789);
  item.lastUsedDate = NSDate::fromNanoseconds(0);
  item.favoriteRank = -3;
  item.tags = {"red", "", "zwölf"};
  item.capabilities = 0x3FU;
  item.flags = protocol::ITEM_FLAG_SHARED | protocol::ITEM_FLAG_DOWNLOADED;
  item.rank = 77;
  item.version = 5;
  item.childCount = 4;
  item.containerID = "com.example.app";
  return item;
}

ItemFields roundTrip(const ItemFields& item) {
  capnp::MallocMessageBuilder message;
  encodeItem(item, message.initRoot<protocol::Item>());
  return decodeItem(message.getRoot<protocol::Item>().asReader());
}

TEST(ItemCodec, KeepsEveryField) { EXPECT_EQ(roundTrip(fullItem()), fullItem()); }

TEST(ItemCodec, KeepsNilApartFromZero) {
  const ItemFields nothing;
  EXPECT_EQ(roundTrip(nothing), nothing);
  ItemFields zero;
  zero.lastUsedDate = NSDate();
  zero.favoriteRank = 0;
  EXPECT_EQ(roundTrip(zero), zero);
  EXPECT_NE(roundTrip(zero), nothing);
}

TEST(ItemCodec, ReadsAnUnknownKindAsADocument) {
  capnp::MallocMessageBuilder message;
  auto builder = message.initRoot<protocol::Item>();
  builder.setKind(static_cast<protocol::Item::Kind>(999));
  EXPECT_EQ(decodeItem(builder.asReader()).kind, ItemKind::Document);
}

TEST(ItemCodec, PromisesEnoughRoomForAPage) {
  const NSFileProviderItems items(200, std::make_shared<WireItem>(fullItem()));
  std::uint64_t words = 0;
  for (const auto& item : items) words += encodedItemWords(item->fields());
  constexpr unsigned kRootAndTag = 8;
  capnp::MallocMessageBuilder message(static_cast<unsigned>(words) + kRootAndTag,
                                      capnp::AllocationStrategy::FIXED_SIZE);
  auto page = message.initRoot<capnp::AnyPointer>().initAs<capnp::List<protocol::Item>>(
      static_cast<unsigned>(items.size()));
  encodeItems(items, page);
  EXPECT_EQ(message.getSegmentsForOutput().size(), 1U);
  EXPECT_LT(words, message.sizeInWords() * 5 / 4) << "the promise wastes memory";
}

TEST(WireItem, TravelsInsideACollisionError) {
  registerItemsInErrors();
  const auto error = fileProviderErrorForCollisionWithItem(std::make_shared<WireItem>(fullItem()));
  capnp::MallocMessageBuilder message;
  ipc::encodeError(error, message.initRoot<protocol::Error>());
  const auto decoded = ipc::decodeError(message.getRoot<protocol::Error>().asReader());
  ASSERT_TRUE(decoded->is(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision));
  const auto entry = decoded->userInfo().find(NSFileProviderErrorItemKey);
  ASSERT_NE(entry, decoded->userInfo().end());
  const auto item =
      std::dynamic_pointer_cast<const NSFileProviderItem>(std::get<NSObjectRef>(entry->second));
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->fields(), fullItem());
}

}  // namespace
}  // namespace yomber
