#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/date.h"
#include "platform/rozzel/asset_folder.h"
#include "platform/rozzel/engine.h"
#include "platform/rozzel/records_connection.h"

namespace yomber {

// What is left over in a store. Each step is a short transaction of its own, so that others get
// their turn, and a kill between any two loses nothing. Failures are StoreFailure.

/// Clears the records of deleted zones away.
void clearDeadZones(RecordsConnection& connection, NSDate now, RZGarbageReport& report);

/// Drops the assets that nobody has referred to, and nobody has stored again, since `before`.
/// They go by way of `staging`, a folder of the caller's in the store.
void dropUnusedAssets(RecordsConnection& connection, const AssetFolder& folder,
                      const std::string& staging, NSDate before, RZGarbageReport& report);

}  // namespace yomber
