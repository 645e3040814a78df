#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "tests/harness/content_client.h"
#include "tests/harness/host_client.h"
#include "tests/manifest/document.h"

namespace yomber::testing {

/// The machine, as far as it matters to content. Outlives the load.
struct Power {
  /// Set before the power goes: what succeeds from then on means nothing.
  std::atomic<bool> isCut{false};
  /// As the drive's programs see it. Changed while nobody works.
  std::string boot = machineBoot();
};

/// What all workers of a load share.
struct LoadOptions {
  std::string home;     ///< the drive's
  std::string root;     ///< its root folder on disk
  std::string outside;  ///< a folder that is not the drive's, for what is imported
  std::uint64_t seed = 0;
  std::size_t documents = 12;  ///< of one worker
  /// The power may be cut: what counts as safe is then noted more carefully, and nothing is
  /// removed.
  bool mayLosePower = false;
  const Power* power = nullptr;
};

/// One user of a drive who writes, overwrites, renames, moves, trashes, puts back, gives up and
/// brings back documents of their own, in three folders of their own, and keeps the manifest of
/// what has to be there. Half of it goes through the drive, half around it, as programs do.
///
/// For one thread at a time. What it finds wrong by itself fails the test.
class LoadWorker {
 public:
  LoadWorker(LoadOptions options, int number);

  /// Makes the folders. The drive has to be up.
  void begin();
  /// Does one thing, and answers whether anything was done.
  bool step();

  /// Of the drive now; null when there is none.
  const ContentClient* zarn();
  const HostClient* host();
  /// Connections are made anew: the processes behind them may be others.
  void forgetConnections();

  [[nodiscard]] std::list<Document>& documents() { return documents_; }
  struct Folder {
    std::string path;
    std::string id;
  };
  [[nodiscard]] const std::array<Folder, 3>& folders() const { return folders_; }
  /// How often each thing was done with success.
  [[nodiscard]] const std::map<std::string, int>& done() const { return done_; }
  /// Writes another content over what is there, and syncs it.
  void rewrite(Document& document);

 private:
  using Operation = bool (LoadWorker::*)(Document&);

  [[nodiscard]] bool isCut() const { return options_.power->isCut; }
  [[nodiscard]] std::uint64_t pick(std::uint64_t below) { return random_() % below; }
  bool succeeded(Document& document, const char* what);
  /// The call failed, or its answer means nothing any more: left alone until the next check.
  bool leftUncertain(Document& document, const std::string& mayBeAt);
  [[nodiscard]] bool isKnown(Document& document);
  [[nodiscard]] Version newVersion();
  [[nodiscard]] std::string newName(int number);

  bool create();
  bool createByImport(Document& document, const Folder& folder);
  bool createByWriting(Document& document);
  bool overwrite(Document& document);
  bool saveSafely(Document& document);
  bool moveTo(Document& document, const Folder& folder, const std::string& name);
  bool rename(Document& document);
  bool move(Document& document);
  bool trash(Document& document);
  bool untrash(Document& document);
  bool remove(Document& document);
  bool evict(Document& document);
  bool provide(Document& document);
  bool read(Document& document);
  bool askWhetherConfirmed(Document& document);
  void expectContent(const Document& document, const Reading& reading, const char* when) const;

  const LoadOptions options_;
  const int number_;
  std::mt19937_64 random_;
  std::array<Folder, 3> folders_;
  std::list<Document> documents_;
  std::map<std::string, int> done_;
  int lastDocument_ = 0;
  int lastName_ = 0;
  std::optional<ContentClient> zarn_;
  std::optional<HostClient> host_;
  bool mayEvictLater_ = false;  ///< the answer to an eviction was lost: it may come at any time
};

/// The folder and the name of a path.
[[nodiscard]] std::string folderOf(const std::string& path);
[[nodiscard]] std::string nameOf(const std::string& path);

}  // namespace yomber::testing
