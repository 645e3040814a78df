#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/rozzel/asset.h"
#include "platform/rozzel/identifiers.h"
#include "platform/rozzel/record.h"

namespace yomber {

/// Failures of the record store.
inline constexpr const char* RZErrorDomain = "RZErrorDomain";

/// Codes of RZErrorDomain. Those marked "later" may go away by themselves: try again, with
/// back-off.
enum RZErrorCode : std::int64_t {
  /// An argument that no store would take: a record twice in a batch, an empty name, a record of
  /// another database. Nothing was changed; the text says which.
  RZErrorInvalidArguments = 1,
  /// Later. The store is out of reach. Nothing is known about what it holds.
  RZErrorNetworkUnavailable = 2,
  /// Nobody is signed in, so there is no account to ask for.
  RZErrorNotAuthenticated = 9,
  /// There is no such record (any more).
  RZErrorUnknownItem = 11,
  /// The account may not do that, e.g. write to a zone that is shared with it read-only.
  RZErrorPermissionFailure = 12,
  /// The record was saved by another in between. `rz_serverRecord` has it as it is now; apply the
  /// change to a copy of that and save again.
  RZErrorServerRecordChanged = 14,
  /// The change token is of another zone or store, damaged, or older than what the store
  /// remembers. Begin again with an empty token.
  RZErrorChangeTokenExpired = 21,
  /// Later. Others kept the store locked for so long that the call gave up.
  RZErrorStoreBusy = 23,
  /// The account's quota does not allow the save. Nothing was changed.
  RZErrorQuotaExceeded = 25,
  /// There is no such zone in that database (any more).
  RZErrorZoneNotFound = 26,
  /// A record, batch, name or page is larger than a store takes (the limits are in engine.h).
  RZErrorLimitExceeded = 27,
  /// The store has a record of this asset, but not its content.
  RZErrorAssetMissing = 35,
  /// The content found is not what its hash says. None of it must be used.
  RZErrorAssetDamaged = 36,
  /// The store was made by a later version of this program. It was left as it is.
  RZErrorStoreTooNew = 41,
  /// The database file is no record store, or is damaged.
  RZErrorStoreDamaged = 42,
  /// Later. The disk that holds the store is full.
  RZErrorStoreFull = 43,
  /// Reading or writing failed; the underlying error has what the system said.
  RZErrorStoreFailure = 44,
};

/// User-information keys: the record that a failure is about, as an object that describes itself.
inline constexpr const char* RZErrorServerRecordKey = "RZErrorServerRecord";
inline constexpr const char* RZErrorFailedRecordsKey = "RZErrorFailedRecords";

/// A failure of RZErrorDomain with a text for a person.
[[nodiscard]] NSErrorRef rz_error(RZErrorCode code, std::string description,
                                  NSErrorUserInfo userInfo = {});
/// True for an error of RZErrorDomain with that code. False for nil.
[[nodiscard]] bool rz_isError(const NSErrorRef& error, RZErrorCode code);
/// True for the codes marked "later".
[[nodiscard]] bool rz_isTransient(const NSErrorRef& error);

/// The record as the store has it, of RZErrorServerRecordChanged; else nil.
[[nodiscard]] RZRecordRef rz_serverRecord(const NSErrorRef& error);

using RZFailedRecords = std::vector<std::pair<RZRecordID, NSErrorRef>>;
/// Every record on whose account a batch was refused, each with its own error. The batch's error
/// is that of the first. Empty when the failure was not about records.
[[nodiscard]] RZFailedRecords rz_failedRecords(const NSErrorRef& error);
/// For engines: the error of a batch that these refused. Nil when there are none.
[[nodiscard]] NSErrorRef rz_batchError(RZFailedRecords failures);

}  // namespace yomber
