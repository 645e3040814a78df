#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/item_row.h"

namespace yomber {

class BusyFiles;
class RecentBackups;
class Connection;
class WriteTransaction;
class BulkLoad;

/// Told of every commit. Called on the writer thread after the commit, before the call that caused
/// it returns; changes are in the order of their ranks. Must not write to the database and wait for
/// it (it would wait for itself), and should be quick: it holds up the next commit.
class ChangeSink {
 public:
  virtual ~ChangeSink() = default;
  virtual void committed(const std::vector<ItemChange>& changes) = 0;
  /// After `committed`: rows that were changed in nothing that is shown of them, as they are now.
  virtual void touched(const std::vector<ItemRow>& /*rows*/) {}
};

/// Stores something of its own together with every change of rows.
class CommitParticipant {
 public:
  virtual ~CommitParticipant() = default;
  /// On the writer thread before the commit; what it stores is committed with the changes, and what
  /// it throws undoes them. It must not change rows of items itself. What it answers (or nothing)
  /// is called after the commit, before the sinks.
  virtual std::function<void()> willCommit(WriteTransaction& transaction) = 0;
};

/// Errors of this domain are about the database file itself.
inline constexpr const char* kDatabaseErrorDomain = "ZarnDatabaseErrorDomain";
inline constexpr std::int64_t kDatabaseTooNew = 1;   ///< made by a newer version of this program
inline constexpr std::int64_t kDatabaseFailure = 2;  ///< SQLite's message is in the description
inline constexpr std::int64_t kDatabaseClosed = 3;

/// The drive's SQLite file: one writer thread, readers with connections of their own.
///
/// Thread-safety: every operation may be called on any thread, except that `write` must not be
/// called on the writer thread. Ownership: shared; closes when the last reference goes.
class Database {
 public:
  /// Opens or creates the file. An unreadable file is set aside next to itself under a name with
  /// the date (logged), and an empty one takes its place: `needsFirstScan` is then true. A file of
  /// a newer schema is refused with kDatabaseTooNew and left as it is.
  static std::shared_ptr<Database> open(const std::string& path, NSErrorRef* error = nullptr);
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;

  /// Runs `job` on the writer thread inside a transaction and answers when it is committed. Jobs
  /// that wait together share one transaction; a job that fails undoes only itself.
  /// A job reports a failure of its own by answering an error.
  using Job = std::function<NSErrorRef(WriteTransaction&)>;
  [[nodiscard]] NSErrorRef write(const Job& job);
  /// Same without waiting. `done` may be empty; runs on the writer thread after the commit.
  void writeLater(Job job, std::function<void(NSErrorRef)> done);

  /// When it returns, what was committed before survives a loss of power. Commits alone survive
  /// the end of this program only.
  [[nodiscard]] NSErrorRef makeDurable() const;

  /// Runs `job` with a reading connection of the calling thread's own choosing.
  using Read = std::function<void(Connection&)>;
  [[nodiscard]] NSErrorRef read(const Read& job) const;

  /// Builds the whole content anew in a file aside, and puts it in place when `load` answers nil;
  /// otherwise (or after a crash) everything stays as it was. Sinks are not told.
  [[nodiscard]] NSErrorRef rebuild(const std::function<NSErrorRef(BulkLoad&)>& load);

  /// Sinks are held weakly and called in the order they were added.
  void addSink(std::weak_ptr<ChangeSink> sink);

  /// Held weakly; replaces the one before.
  void setParticipant(std::weak_ptr<CommitParticipant> participant);
  [[nodiscard]] BusyFiles& busyFiles() const;
  [[nodiscard]] RecentBackups& recentBackups() const;

  /// No complete scan of the tree has been stored yet.
  [[nodiscard]] bool needsFirstScan() const;
  /// The rank of the last committed change. Only grows, also over restarts and rebuilds.
  [[nodiscard]] std::uint64_t currentRank() const;
  /// Changes up to this rank can no longer be told one by one.
  [[nodiscard]] std::uint64_t oldestAnswerableRank() const;
  /// Names this very database; a rebuilt one has another.
  [[nodiscard]] std::uint64_t identity() const;

 private:
  struct State;
  explicit Database(std::shared_ptr<State> state);
  const std::shared_ptr<State> state_;
};

}  // namespace yomber
