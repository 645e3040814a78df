#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "zarn/content/content_rows.h"
#include "zarn/content/job_queue.h"
#include "zarn/database.h"

namespace yomber {

/// Makes jobs of what changes, in the very transaction that stores the change.
///
/// Thread-safety: for the writer thread.
class ContentParticipant : public CommitParticipant {
 public:
  /// `uploadPause` as in the engine's options; in ns, as the clock.
  ContentParticipant(std::shared_ptr<JobQueue> queue, std::function<std::int64_t()> clock,
                     std::int64_t uploadPause)
      : queue_(std::move(queue)), clock_(std::move(clock)), uploadPause_(uploadPause) {}

  std::function<void()> willCommit(WriteTransaction& transaction) override;

  /// Gives jobs to documents that were there before this program made jobs, some thousands at a
  /// time, as far as their files have got their marks. True when that is all for now.
  bool sweep(WriteTransaction& transaction);

 private:
  struct Made {
    bool hasUploads = false;
    bool hasDownloads = false;
    bool hasSpreads = false;
  };
  void noteDocument(Connection& connection, const ItemRow& row, Made& made);
  void addUpload(Connection& connection, std::uint64_t id, std::int64_t account) const;
  void noteFolder(Connection& connection, const ItemRow& row, Made& made) const;
  [[nodiscard]] static bool isLeft(Connection& connection, const ContentRow& content);
  void noteRemoval(Connection& connection, std::uint64_t id, Made& made);
  void noteMovedFolder(Connection& connection, const ItemChange& change, Made& made);
  [[nodiscard]] std::function<void()> announcement(const Made& made) const;

  const std::shared_ptr<JobQueue> queue_;
  const std::function<std::int64_t()> clock_;
  const std::int64_t uploadPause_;
};

/// Documents that the sweep has still to give jobs. Looks at each of them.
[[nodiscard]] std::uint64_t countUnswept(Connection& connection);
/// Whether the store's record says what the row does, and has its content.
[[nodiscard]] bool isConfirmed(const ItemRow& row, const ContentRow& content);
/// The account whose record of a folder has to be made, changed or removed; nothing when it need
/// not. Only in shares do folders have one, and only of the account that takes part in the share,
/// whoever is signed in.
[[nodiscard]] std::optional<std::int64_t> whoseFolderIsBehind(Connection& connection,
                                                              const ItemRow& row);

}  // namespace yomber
