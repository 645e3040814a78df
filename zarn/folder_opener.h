#pragma once

#include <cstdint>
#include <list>
#include <memory>

#include "zarn/file_descriptor.h"
#include "zarn/item_store.h"

namespace yomber {

/// Opens folders by id, going on from those that it opened last: a tree that is gone through from
/// above costs one step a folder, however deep it is.
///
/// For one thread at a time, and for a short time: what it has opened may have moved since.
class FolderOpener {
 public:
  explicit FolderOpener(const ItemStore& store) : store_(store) {}

  /// Null when the folder is not where its row says.
  [[nodiscard]] std::shared_ptr<const FileDescriptor> open(std::uint64_t folder);

 private:
  struct Opened {
    std::uint64_t id = 0;
    std::shared_ptr<const FileDescriptor> folder;
  };
  [[nodiscard]] std::shared_ptr<const FileDescriptor> find(std::uint64_t folder);
  void keep(std::uint64_t folder, std::shared_ptr<const FileDescriptor> opened);
  [[nodiscard]] std::shared_ptr<const FileDescriptor> openPlace(const ItemRow& row) const;

  const ItemStore& store_;
  std::list<Opened> opened_;  // the most recently used first
};

}  // namespace yomber
