#pragma once

#include <exception>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/query_item.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

// The library's types on the daemon's wire. For this room's sources only. Loop thread.

void encodeObjectID(const QSFileObjectID& object, protocol::Daemon::ObjectID::Builder builder);
/// Nil for a raw id or a kind that no object has.
[[nodiscard]] QSFileObjectIDRef decodeObjectID(protocol::Daemon::ObjectID::Reader reader);

/// Nil for an item that names no object and is not the root: nobody could ask about it.
[[nodiscard]] QSQueryItemRef decodeQueryItem(protocol::Item::Reader reader);
/// Leaves out what `decodeQueryItem` answers nil for, and logs it.
[[nodiscard]] QSQueryItems decodeQueryItems(capnp::List<protocol::Item>::Reader reader);

/// Nil and an error when the daemon sent one, or a path that is none.
[[nodiscard]] NSURLRef decodeLocation(protocol::Daemon::LocationResult::Reader reader,
                                      NSErrorRef* error);
[[nodiscard]] QSQueryItemRef decodeItemResult(protocol::Daemon::ItemResult::Reader reader,
                                              NSErrorRef* error);

/// Nil and an error when the daemon sent one. Leaves out what names no object or no zone.
[[nodiscard]] QSContentRecordIDsRef decodeContentRecords(
    protocol::Daemon::ContentRecordsResult::Reader reader, NSErrorRef* error);

/// Runs `read`, which reads a message: answers nil, or the error for a message that cannot be read.
/// Whoever waits for the message hears of it then.
template <typename Read>
[[nodiscard]] NSErrorRef whatIsWrongWith(const Read& read) {
  try {
    read();
    return nullptr;
  } catch (const kj::Exception& exception) {
    return ipc::connectionError(exception);
  } catch (const std::exception& exception) {
    return ipc::connectionError(NSXPCConnectionReplyInvalid, exception.what());
  }
}

/// What is said of a reply that makes no sense.
[[nodiscard]] NSErrorRef unintelligibleReply(const char* what);

}  // namespace yomber
