#pragma once

#include <kj/exception.h>

#include <functional>

#include "platform/foundation/error.h"
#include "protocols/common.capnp.h"

namespace yomber::ipc {

/// How deep errors under errors travel; what lies deeper is left out.
inline constexpr int kMaximumErrorDepth = 8;

/// Writes `error`, which must not be nil. Values without a wire form travel as their description.
void encodeError(const NSErrorRef& error, protocol::Error::Builder builder);
/// Never nil. Entries that cannot be read are left out.
[[nodiscard]] NSErrorRef decodeError(protocol::Error::Reader reader);

/// The same with nil as "none".
void encodeOptional(const NSErrorRef& error, protocol::OptionalError::Builder builder);
[[nodiscard]] NSErrorRef decodeOptional(protocol::OptionalError::Reader reader);

/// How objects in an error's user information (the item in the way of a collision) travel.
struct ObjectCodec {
  /// Writes `object`; false when it is not of the codec's kind.
  std::function<bool(const NSObjectRef& object, protocol::Item::Builder builder)> encode;
  /// Nil when `reader` makes no object; the entry is then left out.
  std::function<NSObjectRef(protocol::Item::Reader reader)> decode;
};

/// Sets the process's codec. Without one, objects travel as descriptions and items are left out.
/// Thread-safety: any thread.
void registerObjectCodec(ObjectCodec codec);

/// What a transport failure is for a caller: a lost peer is NSXPCConnectionInterrupted, a call that
/// ran out of time NSXPCConnectionTimedOut, one that the peer does not know or a message that
/// cannot be read NSXPCConnectionReplyInvalid; all in the Cocoa domain with the text as
/// description.
[[nodiscard]] NSErrorRef connectionError(const kj::Exception& exception);
/// A Cocoa-domain error of `code` that says `text`.
[[nodiscard]] NSErrorRef connectionError(std::int64_t code, std::string text);

}  // namespace yomber::ipc
