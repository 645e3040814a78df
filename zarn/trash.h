#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/serial_queue.h"
#include "zarn/database.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"
#include "zarn/trash_folder.h"

namespace yomber {

/// The drive's trash: items go there with what is needed to put them back, and are put back by
/// moving them out again, by whomever.
///
/// Answers when the rows are right. Information about what has left the trash goes a moment after
/// the row has changed. Locations may be logical or physical; those that are answered are logical.
///
/// Thread-safety: every operation may be called on any thread but the database's writer thread.
/// Ownership: shared; the database holds it weakly as a sink.
class Trash final : public ChangeSink {
 public:
  using IsCancelled = std::function<bool()>;

  static std::shared_ptr<Trash> create(std::shared_ptr<ItemStore> store,
                                       std::shared_ptr<Scanner> scanner);
  ~Trash() override = default;

  /// Takes away what an earlier process left when it was killed: information about nothing, and
  /// emptied items that were not removed yet (in the background). To be called before serving.
  void recover();

  /// Moves an item to the trash; answers where it is there. Places, and what is in the trash
  /// already, are refused.
  [[nodiscard]] std::optional<std::string> trash(std::string_view path,
                                                 const IsCancelled& isCancelled, NSErrorRef* error);
  /// Where a trashed item came from, whether or not there is anything now. NSCocoaErrorDomain 4
  /// when that is not known.
  [[nodiscard]] std::optional<std::string> putBackLocation(std::string_view path,
                                                           NSErrorRef* error) const;
  /// Removes everything in the trash. Answers how many items went, those in folders included; with
  /// an error when something stayed.
  [[nodiscard]] std::uint64_t empty(const IsCancelled& isCancelled, NSErrorRef* error);

  void committed(const std::vector<ItemChange>& changes) override;

 private:
  Trash(std::shared_ptr<ItemStore> store, std::shared_ptr<Scanner> scanner);
  [[nodiscard]] std::optional<TrashInfo> describe(const ItemRow& row, NSErrorRef* error) const;
  [[nodiscard]] std::optional<std::string> locationOf(const TrashInfo& info) const;
  void scanMove(std::uint64_t folder, const std::string& before, const std::string& after);

  const std::shared_ptr<ItemStore> store_;
  const std::shared_ptr<Scanner> scanner_;
  const std::shared_ptr<TrashFolder> folder_;
  /// What is done to information, in the order of the changes.
  const std::shared_ptr<SerialQueue> queue_;
};

}  // namespace yomber
