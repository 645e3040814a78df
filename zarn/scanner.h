#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/dirty_folders.h"
#include "zarn/item_row.h"
#include "zarn/item_store.h"
#include "zarn/tree_layout.h"

namespace yomber {

/// Told of every folder that a scan reads, so that it can be observed without a gap: a watch that
/// is set in `willReadFolder` sees whatever happens after the scan has read the folder.
class FolderVisitor {
 public:
  virtual ~FolderVisitor() = default;
  /// On the thread that reads, before the entries are read. `visit` names this reading of the
  /// folder; `descriptor` is open on the folder during the call only.
  virtual void willReadFolder(std::uint64_t visit, int descriptor) = 0;
  /// On any thread, later: the folder of that visit has this id. Not called when the folder turned
  /// out to be gone.
  virtual void didIdentifyFolder(std::uint64_t visit, std::uint64_t id) = 0;
  /// On any thread: the folder has a row, but when its turn came to be read it was not to be found,
  /// or not readable. It has to be scanned again, with everything below it.
  virtual void didNotReadFolder(std::uint64_t id) = 0;
};

struct ScanReport {
  std::uint64_t folders = 0;     ///< read
  std::uint64_t entries = 0;     ///< seen
  std::uint64_t changes = 0;     ///< rows added, changed or removed
  std::uint64_t unreadable = 0;  ///< folders that could not be read; their rows were left alone
};

/// Brings the database in line with the tree: the tree decides names and content, the database
/// decides ids.
///
/// Never follows symbolic links, never leaves the tree's file system, skips what is neither file
/// nor folder nor symbolic link, and leaves alone what it cannot read.
///
/// Thread-safety: every operation may be called on any thread, also at the same time; a change that
/// was committed after a scan has looked is never undone by that scan. Each blocks until the rows
/// are right; none may be called on the writer thread.
class Scanner {
 public:
  Scanner(std::shared_ptr<ItemStore> store, std::weak_ptr<FolderVisitor> visitor);
  ~Scanner();
  Scanner(const Scanner&) = delete;
  Scanner& operator=(const Scanner&) = delete;

  /// The whole tree: the first scan where the database is empty, else a reconciling one.
  [[nodiscard]] NSErrorRef scanAll(ScanReport* report = nullptr);
  /// Whether that has succeeded in this process: rows may be behind the disk until then.
  [[nodiscard]] bool hasScannedAll() const;

  /// Folders by id, as one change: an item that moved between two of them keeps its id and is
  /// reported once. Folders that are new in them are scanned with all that they hold.
  [[nodiscard]] NSErrorRef scanFolders(const std::vector<std::uint64_t>& folders,
                                       ScanReport* report = nullptr);
  /// The same for single names in folders; what it costs does not depend on how many entries they
  /// have. Folders that are not where their rows say are moving: they are answered in `notFound`,
  /// to be tried again when more of the move has been seen. After `kMaximumAttempts` of that, the
  /// folder above is scanned instead.
  [[nodiscard]] NSErrorRef scanDirty(const std::vector<DirtyFolder>& folders,
                                     std::vector<DirtyFolder>& notFound,
                                     ScanReport* report = nullptr);
  static constexpr unsigned kMaximumAttempts = 4;
  /// A folder with everything below it.
  [[nodiscard]] NSErrorRef scanSubtree(std::uint64_t folder, ScanReport* report = nullptr);

  /// One location, together with those ancestors of it that are not known yet. Answers the row as
  /// it is then; nothing with NSCocoaErrorDomain 4 when the location has no item (its row, if there
  /// was one, is gone).
  [[nodiscard]] std::optional<ItemRow> scanLocation(std::string_view path,
                                                    NSErrorRef* error = nullptr);

  /// Writes the ids of up to `limit` items that the first scan left unmarked into their files'
  /// attributes, so that a lost database can be rebuilt with the same ids. Each write shows as an
  /// attribute change to observers, so pace it. `count` is how many were looked at; 0 when all is
  /// done.
  [[nodiscard]] NSErrorRef stampSome(std::uint32_t limit, std::uint32_t& count);

 private:
  class State;
  std::unique_ptr<State> state_;
};

}  // namespace yomber
