#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/item_store.h"
#include "zarn/located_item.h"
#include "zarn/scanner.h"

namespace yomber {

/// Sets what is known of an item beside its content: when it was last used, its rank among the
/// favourites, its tags. The content and its modification date stay.
///
/// Files and folders carry it as extended attributes, also while their content is away. For those
/// that cannot (symbolic links, files with several hard links) the database keeps it.
///
/// Each answers when the row is right: nil, or why it could not be set, with nothing changed.
/// Locations may be logical or physical. Thread-safety: every operation may be called on any thread
/// but the database's writer thread.
class ItemSetters {
 public:
  ItemSetters(std::shared_ptr<ItemStore> store, std::shared_ptr<Scanner> scanner)
      : store_(std::move(store)), scanner_(std::move(scanner)) {}

  /// ns since the epoch; nothing: never.
  [[nodiscard]] NSErrorRef setLastUsedDate(std::string_view path, std::optional<std::int64_t> date);
  /// Nothing: no favourite.
  [[nodiscard]] NSErrorRef setFavoriteRank(std::string_view path, std::optional<std::int64_t> rank);
  /// In their order, each once; blanks around a name do not count. A name cannot be empty or hold a
  /// comma (which separates them on disk), and must be text: QSOstrellErrorDomain 3. What is longer
  /// than a file can carry is NSCocoaErrorDomain 512.
  [[nodiscard]] NSErrorRef setTagNames(std::string_view path,
                                       const std::vector<std::string>& names);

 private:
  struct Change {
    const char* attribute = nullptr;
    std::optional<std::string> value;  ///< of the attribute
    std::function<void(ItemExtra&)> apply;
  };
  NSErrorRef make(std::string_view path, const Change& change);

  const std::shared_ptr<ItemStore> store_;
  const std::shared_ptr<Scanner> scanner_;
};

}  // namespace yomber
