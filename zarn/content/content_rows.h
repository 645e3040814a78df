#pragma once

#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/rozzel/identifiers.h"
#include "zarn/connection.h"
#include "zarn/content/fault_record.h"

namespace yomber {

// How jobs and content are stored. All throw SQLite::Exception; what changes something needs the
// writer's connection.

enum class JobKind : std::uint8_t {
  Upload,  ///< makes the store's record what the item is, or removes it
  Download,
  Evict,
  Settle,     ///< syncs a filled file, then takes its marks off
  Spread,     ///< of a folder: sees to what its pins and its container mean for what is in it
  Thumbnail,  ///< gives the store's record the thumbnail that it was saved without
};
inline constexpr std::size_t kJobKinds = 6;

enum class JobState : std::uint8_t { Waiting, Retrying, OverQuota };

/// When that is due which nothing but somebody's asking brings about any more.
inline constexpr std::int64_t kNeverDue = std::numeric_limits<std::int64_t>::max();

struct Job {
  std::int64_t seq = 0;
  std::uint64_t item = 0;
  JobKind kind = JobKind::Upload;
  std::int64_t account = 0;
  JobState state = JobState::Waiting;
  std::uint32_t attempts = 0;  ///< that failed
  std::int64_t due = 0;        ///< ns since the epoch, or kNeverDue: given up
  std::int64_t created = 0;    ///< ns since the epoch
  std::uint64_t size = 0;  ///< of the document as its row has it; only where jobs are handed out
  NSErrorRef error;        ///< of the last attempt
};

/// Replaces the item's job of that kind.
void addJob(Connection& connection, std::uint64_t item, JobKind kind, std::int64_t account,
            std::int64_t due, std::int64_t now);
/// Nothing happens when another has taken its place.
void removeJob(Connection& connection, const Job& job);
/// Stores its state, attempts, due time and error.
void updateJob(Connection& connection, const Job& job);
void removeJobsOf(Connection& connection, std::uint64_t item);
[[nodiscard]] std::optional<Job> findJob(Connection& connection, std::uint64_t item, JobKind kind);
/// Those due at `now`, in the order in which they fell due, with the sizes of their documents.
[[nodiscard]] std::vector<Job> dueJobs(Connection& connection, std::int64_t account, JobKind kind,
                                       std::int64_t now, std::size_t limit);
[[nodiscard]] std::optional<std::int64_t> nextDue(Connection& connection, std::int64_t account,
                                                  JobKind kind, std::int64_t after);
/// Those that have failed before.
[[nodiscard]] std::vector<Job> failedJobs(Connection& connection, std::int64_t account,
                                          std::size_t limit);
[[nodiscard]] std::uint64_t countJobs(Connection& connection, std::int64_t account);
/// All jobs that wait to be tried again are due at `now`.
void makeAllDue(Connection& connection, std::int64_t account, std::int64_t now);

/// What is known of an item's content.
struct ContentRow {
  std::uint64_t id = 0;
  std::int64_t account = 0;
  bool isPinned = false;
  RZRecordZoneID zone;             ///< of the store's record; without a name: there is none
  std::uint64_t parent = 0;        ///< as the record has it
  std::string name;                ///< as the record has it
  std::optional<RZAsset> content;  ///< that the store has; nothing: none yet
  std::string tag;                 ///< of the record
  FileStamp stamp;                 ///< of the file when that was its content

  /// Whether the store has a record of it, or did have.
  [[nodiscard]] bool isRecorded() const { return content.has_value() || !tag.empty(); }
  /// Whether the store has a record of it, rather than its content only.
  [[nodiscard]] bool hasRecord() const { return isRecorded() && !zone.zoneName().empty(); }
};

/// The zone of an account's record of a document whose content the store has; nothing for any other
/// item.
[[nodiscard]] std::optional<RZRecordZoneID> findRecordZone(Connection& connection, std::uint64_t id,
                                                           const std::string& account);
[[nodiscard]] std::optional<ContentRow> findContent(Connection& connection, std::uint64_t id);
void storeContent(Connection& connection, const ContentRow& row);
/// With what was about to be saved.
void removeContent(Connection& connection, std::uint64_t id);

// Content that the store is about to be given, with the file that has it. Where the process ends
// before it hears what came of that, the next one knows by it which record is its own.

void storeSaving(Connection& connection, std::uint64_t id, const RZAsset& content,
                 const FileStamp& stamp);
[[nodiscard]] std::optional<FileStamp> findSaving(Connection& connection, std::uint64_t id,
                                                  const RZAsset& content);
/// What was about to be saved before counts no longer.
void removeSavings(Connection& connection, std::uint64_t id);
/// The ids of what is in a folder.
[[nodiscard]] std::vector<std::uint64_t> findChildIDs(Connection& connection, std::uint64_t folder);
[[nodiscard]] bool hasPins(Connection& connection);
/// Whether an item or a folder above it is pinned.
[[nodiscard]] bool isPinned(Connection& connection, std::uint64_t id);
/// The zone that an account's record of an item belongs to: that of the share that it is in, when
/// the account takes part in it, else that of its container; `before`, unless others see that, for
/// what is in the trash. Of no account: of whichever takes part in the share.
[[nodiscard]] RZRecordZoneID zoneOf(Connection& connection, std::uint64_t id,
                                    const RZRecordZoneID& before,
                                    std::optional<std::int64_t> account);

/// The number that stands for an account in the tables; makes one where there is none.
[[nodiscard]] std::int64_t accountKey(Connection& connection, const std::string& account);
[[nodiscard]] std::string accountName(Connection& connection, std::int64_t key);
/// Jobs and content made before anybody ever signed in become that account's.
void claimForAccount(Connection& connection, std::int64_t key);

/// Errors as they are stored: domain, code and description.
[[nodiscard]] std::string encodeError(const NSErrorRef& error);
[[nodiscard]] NSErrorRef decodeError(std::string_view text);

}  // namespace yomber
