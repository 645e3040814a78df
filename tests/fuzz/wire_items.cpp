// Items and errors out of messages of any bytes. What can be read at all can be written again, and
// then reads the same.

#include <capnp/message.h>
#include <capnp/serialize.h>
#include <kj/exception.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/message_stream.h"
#include "protocols/daemon.capnp.h"
#include "tests/fuzz/expect.h"

namespace yomber::fuzz {
namespace {

bool isSame(const ItemFields& a, const ItemFields& b) {
  return a.identifier == b.identifier && a.parentIdentifier == b.parentIdentifier &&
         a.filename == b.filename && a.contentType == b.contentType && a.kind == b.kind &&
         a.rawID == b.rawID && a.size == b.size && a.tags == b.tags && a.flags == b.flags &&
         a.containerID == b.containerID && a.lastUsedDate == b.lastUsedDate &&
         a.favoriteRank == b.favoriteRank;
}

void readItem(protocol::Item::Reader reader) {
  const ItemFields item = decodeItem(reader);
  capnp::MallocMessageBuilder message;
  auto builder = message.initRoot<protocol::Item>();
  encodeItem(item, builder);
  expect(message.sizeInWords() <= encodedItemWords(item) + 1, "an item is as large as was said");
  expect(isSame(decodeItem(builder.asReader()), item), "an item survives the wire");
}

std::size_t depthOf(const NSErrorRef& error) {
  std::size_t deepest = 0;
  for (const auto& [key, value] : error->userInfo()) {
    if (const auto* inner = std::get_if<NSErrorRef>(&value)) {
      deepest = std::max(deepest, depthOf(*inner));
    }
  }
  return deepest + 1;
}

void readError(protocol::Error::Reader reader) {
  const NSErrorRef error = ipc::decodeError(reader);
  expect(error != nullptr, "an error is never nil");
  expect(depthOf(error) <= ipc::kMaximumErrorDepth + 1, "errors are cut where they lie too deep");
  (void)error->description();
  capnp::MallocMessageBuilder message;
  auto builder = message.initRoot<protocol::Error>();
  ipc::encodeError(error, builder);
  const NSErrorRef again = ipc::decodeError(builder.asReader());
  expect(again->domain() == error->domain() && again->code() == error->code() &&
             again->userInfo().size() == error->userInfo().size(),
         "an error survives the wire");
}

template <typename Root, typename Read>
void readAs(kj::ArrayPtr<const capnp::word> words, Read read) {
  // As the connection does: no exception leaves it, and so much may be read of one message.
  constexpr std::uint64_t kReadableWords = 1024 * 1024;
  try {
    capnp::FlatArrayMessageReader message(words, {kReadableWords, 64});
    read(message.getRoot<Root>());
  } catch (const kj::Exception&) {
  }
}

void readAll(kj::ArrayPtr<const capnp::word> words) {
  readAs<protocol::Item>(words, readItem);
  readAs<protocol::Error>(words, readError);
  readAs<protocol::OptionalError>(
      words, [](protocol::OptionalError::Reader reader) { (void)ipc::decodeOptional(reader); });
  readAs<protocol::Daemon::PageResult>(words, [](protocol::Daemon::PageResult::Reader reader) {
    if (reader.isPage()) {
      for (const auto item : reader.getPage().getItems()) readItem(item);
    } else if (reader.isError()) {
      readError(reader.getError());
    }
  });
}

}  // namespace
}  // namespace yomber::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace yomber;
  static const bool isRegistered = (registerItemsInErrors(), true);
  (void)isRegistered;
  // As it is, with its own framing; and as the one segment of a message.
  auto words = kj::heapArray<capnp::word>(size / sizeof(capnp::word) + 1);
  std::memset(words.asBytes().begin(), 0, words.asBytes().size());
  const std::uint32_t header[2] = {0, static_cast<std::uint32_t>(words.size() - 1)};
  std::memcpy(words.begin(), header, sizeof header);
  if (size >= sizeof(capnp::word)) {
    const std::size_t whole = size / sizeof(capnp::word) * sizeof(capnp::word);
    std::memcpy(words.begin() + 1, data, whole);
    fuzz::readAll(words.slice(1, words.size()));
  }
  fuzz::readAll(words);
  return 0;
}
