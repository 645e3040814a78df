#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/rozzel/container.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {

/// The record store of a drive, and thumbnails put there without anybody drawing them.
class StoredThumbnails {
 public:
  /// Of the account that is signed in.
  explicit StoredThumbnails(const TestDrive& drive);

  /// Gives the records of these documents ("d:5") the pictures that `picture` says. The store must
  /// have their content. Throws when it has not.
  void put(const std::vector<std::string>& identifiers,
           const std::function<std::string(std::size_t index)>& picture) const;
  /// The file of the store that holds the thumbnail.
  [[nodiscard]] std::string fileOf(const std::string& identifier) const;
  /// What the store has of a document.
  [[nodiscard]] RZRecordRef recordOf(const std::string& identifier) const;

 private:
  RZEngineRef engine_;
  std::shared_ptr<RZContainer> container_;
};

}  // namespace yomber::testing
