#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "zarn/scan_session.h"

namespace yomber {

/// Scans one location and those of its ancestors that are not known as they are.
class LocationScan {
 public:
  LocationScan(const ItemStore& store, const LinkResolver& links,
               std::weak_ptr<FolderVisitor> visitor, TreeWalker::Options options)
      : store_(store), links_(links), visitor_(std::move(visitor)), options_(std::move(options)) {}

  [[nodiscard]] std::optional<ItemRow> run(std::string_view path, NSErrorRef* error);
  /// See Reconciler::takeConflicts.
  [[nodiscard]] std::vector<DirtyFolder> takeConflicts() { return std::exchange(conflicts_, {}); }

 private:
  /// The row of `name` in an open folder, right as of now; nothing with an error when there is
  /// none.
  std::optional<ItemRow> scanName(std::uint64_t folder,
                                  const std::shared_ptr<const FileDescriptor>& opened,
                                  const std::string& name, NSErrorRef& error);
  NSErrorRef compare(std::uint64_t folder, const std::string& diskName,
                     const FolderSnapshot& snapshot);

  const ItemStore& store_;
  const LinkResolver& links_;
  const std::weak_ptr<FolderVisitor> visitor_;
  const TreeWalker::Options options_;
  std::vector<DirtyFolder> conflicts_;
};

}  // namespace yomber
