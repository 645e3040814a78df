#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "tests/manifest/load.h"

namespace yomber::testing {

/// Compares a drive with the manifest of a load that is stopped. What is wrong fails the test.
class ManifestCheck {
 public:
  explicit ManifestCheck(Load& load) : load_(load) {}

  /// At once, whatever the drive is doing: what can be read is the content.
  void nothingWrongCanBeRead() const;
  /// Waits until the drive is up again and has ended all its jobs; finds out what came of the calls
  /// that were not answered. False, with a failure, when that does not come.
  bool settles();
  /// Notes that a settled drive has confirmed all.
  void everythingIsSafe();
  /// Of a settled drive: every document is there once, under its id, confirmed, and nothing else.
  void everythingIsThere() const;
  /// Brings up to so many of each worker's documents here, and compares them.
  void someCanBeProvided(std::size_t count) const;
  /// Gives all up, brings all back, and compares.
  void allGoAndComeBack() const;

  // After the power was cut.

  /// Before the drive is up: what can be read is a content that may be there after a cut. Removes
  /// what its writer had not made to last, as its user would.
  void nothingWrongSurvived(const std::string& boot);
  /// When the drive is up: all that cannot be lost is there. From here on the manifest is what is
  /// there.
  void nothingSafeWasLost();

 private:
  [[nodiscard]] bool isUp(LoadWorker& worker) const;
  [[nodiscard]] bool isSettled(LoadWorker& worker, std::string& reason) const;
  bool resolve(LoadWorker& worker, std::string& reason) const;
  void expectFolders(LoadWorker& worker) const;
  void expectTrash() const;
  /// Where on disk the trash keeps what is in it.
  [[nodiscard]] std::string trashFolder() const;
  void expectProvided(LoadWorker& worker, const Document& document) const;
  [[nodiscard]] std::map<int, std::vector<std::string>> filesByNumber(LoadWorker& worker) const;
  void look(Document& document, const std::vector<std::string>& files,
            const std::string& boot) const;
  bool takeAsIs(LoadWorker& worker, Document& document) const;

  Load& load_;
};

/// How many jobs the database of the drive at `home` holds; nothing when it cannot be read.
[[nodiscard]] std::optional<std::int64_t> jobsInDatabase(const std::string& home);
/// Whether SQLite finds nothing wrong with a database.
[[nodiscard]] bool isSoundDatabase(const std::string& path);

}  // namespace yomber::testing
