#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/error_codec.h"
#include "protocols/common.capnp.h"
#include "protocols/services.capnp.h"

namespace yomber {

// What the codings of the services have in common. Not for extensions: this header shows Cap'n
// Proto types.

/// Fills the request of a method without parameters.
inline constexpr auto kNoParameters = [](auto) {};

/// At the client, what becomes of results without values: the error.
[[nodiscard]] inline auto errorReply(std::function<void(NSErrorRef error)> reply) {
  return [reply = std::move(reply)](const auto& results) -> std::function<void()> {
    return [reply, error = ipc::decodeOptional(results.getFailure())] {
      if (reply) reply(error);
    };
  };
}

/// At the server, such results.
template <typename Context>
[[nodiscard]] auto errorResults(Context context) {
  return [context](const NSErrorRef& error) mutable {
    ipc::encodeOptional(error, context.getResults().initFailure());
  };
}

inline void encodeOptionalString(const std::optional<std::string>& string,
                                 protocol::OptionalData::Builder builder) {
  if (string) builder.setValue(wireData(*string));
}

[[nodiscard]] inline std::optional<std::string> decodeOptionalString(
    protocol::OptionalData::Reader reader) {
  if (!reader.isValue()) return std::nullopt;
  return stringFromWire(reader.getValue());
}

inline void encodeOptionalItem(const NSFileProviderItemRef& item,
                               protocol::OptionalItem::Builder builder) {
  if (item != nullptr) encodeItem(item->fields(), builder.initItem());
}

[[nodiscard]] inline NSFileProviderItemRef decodeOptionalItem(
    protocol::OptionalItem::Reader reader) {
  if (!reader.isItem()) return nullptr;
  return std::make_shared<WireItem>(decodeItem(reader.getItem()));
}

[[nodiscard]] inline NSFileProviderItems decodeItems(capnp::List<protocol::Item>::Reader list) {
  NSFileProviderItems items;
  items.reserve(list.size());
  for (const auto each : list) items.push_back(std::make_shared<WireItem>(decodeItem(each)));
  return items;
}

}  // namespace yomber
