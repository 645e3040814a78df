#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/foundation/error.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"
#include "zarn/trash.h"

namespace yomber {

/// Tells what kind of move it would be to take an item from one location to another.
///
/// Looks at the items as they are on disk at the moment; whether the move then succeeds (a taken
/// name, a full disk) is another matter. Locations may be logical or physical.
/// Thread-safety: every operation may be called on any thread but the database's writer thread.
class MoveCapabilities {
 public:
  MoveCapabilities(std::shared_ptr<ItemStore> store, std::shared_ptr<Scanner> scanner,
                   std::shared_ptr<Trash> trash)
      : store_(std::move(store)), scanner_(std::move(scanner)), trash_(std::move(trash)) {}

  /// QSMoveCapability bits; `destination` is where the item would be then and need not exist, its
  /// folder has to. A refused move has none of the bits that allow, and an error that says why. 0
  /// with an error when there is no such item or folder (NSCocoaErrorDomain 4), or the source lies
  /// outside the drive (QSOstrellErrorDomain 3).
  [[nodiscard]] std::uint32_t capability(std::string_view source, std::string_view destination,
                                         NSErrorRef* error = nullptr) const;

 private:
  /// Where moves are plain: a container, or a folder in it that somebody shares.
  struct Zone {
    std::string containerID;
    std::uint64_t sharedFolder = 0;  ///< 0: none

    friend bool operator==(const Zone&, const Zone&) = default;
  };
  /// What a move is, and why it is refused where it is.
  struct Verdict {
    std::uint32_t capability = 0;
    NSErrorRef error;
  };

  [[nodiscard]] Verdict judge(std::string_view source, std::string_view destination) const;
  [[nodiscard]] Verdict judgeIntoFolder(const ItemRow& row, std::string_view source,
                                        std::string_view destination) const;
  [[nodiscard]] std::uint32_t betweenFolders(const ItemRow& row, const ItemRow& folder,
                                             std::string_view source) const;
  /// Of what lies in that folder.
  [[nodiscard]] Zone zoneIn(std::uint64_t folder) const;
  [[nodiscard]] std::string containerOfTrashed(std::string_view path) const;

  const std::shared_ptr<ItemStore> store_;
  const std::shared_ptr<Scanner> scanner_;
  const std::shared_ptr<Trash> trash_;
};

}  // namespace yomber
