#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <utility>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ipc/server_call.h"
#include "platform/rozzel/identifiers.h"
#include "protocols/daemon.capnp.h"
#include "zarn/drive.h"

namespace yomber {

/// Where the store has the content of documents.
///
/// A value: found on the pool, encoded on the loop thread.
class ContentRecords {
 public:
  static constexpr std::size_t kMaximumObjects = 200'000;

  /// The ids of the documents among them. Loop thread.
  [[nodiscard]] static std::vector<std::uint64_t> documentsIn(
      capnp::List<protocol::Daemon::ObjectID>::Reader objects);
  /// Those of the signed-in account; nothing but the failure when there is one, and stops early
  /// when nobody waits any more.
  [[nodiscard]] static ContentRecords find(const Drive& drive,
                                           const std::vector<std::uint64_t>& documents,
                                           NSErrorRef failure, const ipc::CancelFlag& cancelled);
  void encode(protocol::Daemon::ContentRecordsResult::Builder result) const;

 private:
  /// Ids by zone: there are few zones.
  std::map<RZRecordZoneID, std::vector<std::uint64_t>> byZone_;
  NSErrorRef failure_;
};

}  // namespace yomber
