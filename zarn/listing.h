#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/item_row.h"

namespace yomber {

enum class ListingOrder : std::uint8_t {
  Name = 0,  ///< as files browsers sort: numbers by value, ties by bytes
  Date = 1,  ///< last modified first, ties by name
};

struct ListingPage {
  std::vector<ItemRow> rows;
  std::vector<const std::string*> contentTypes;  ///< the rows', in their order; never null
  std::uint64_t nextOffset = 0;                  ///< 0 when nothing is left
};

/// Pages of a folder, or of all folders of the drive.
///
/// A page costs the same at any offset: where the previous page ended is remembered by (connection,
/// folder, order, offset), and otherwise found through fences every 200 entries. A page that
/// follows another goes on after that one's last entry, whatever changed in between; with several
/// listings of one connection under way, after the last entry of the one that stands earliest.
///
/// Who has taken a second page will take a third: it is read ahead, by whoever answered the second,
/// once he has done so.
///
/// Thread-safety: every operation may be called on any thread. Memory: bounded.
class Listing {
 public:
  static constexpr std::uint32_t kMaximumLimit = 1000;

  explicit Listing(std::shared_ptr<Database> database);
  ~Listing();
  Listing(const Listing&) = delete;
  Listing& operator=(const Listing&) = delete;

  /// Reads the page that follows, to be called when the page has been handed out; null when there
  /// is nothing to be done. Where it is never called, the next page is read when it is asked for.
  using ReadAhead = std::function<void()>;

  /// Items of a folder. `connection` is whatever names the caller's connection. `limit` is cut to
  /// kMaximumLimit; 0 is an error. A folder that is gone has no entries.
  [[nodiscard]] NSErrorRef page(std::uint64_t connection, std::uint64_t folder, ListingOrder order,
                                std::uint64_t offset, std::uint32_t limit, ListingPage& out,
                                ReadAhead& readAhead);
  /// All folders outside the trash, the root not among them.
  [[nodiscard]] NSErrorRef foldersPage(std::uint64_t connection, ListingOrder order,
                                       std::uint64_t offset, std::uint32_t limit, ListingPage& out,
                                       ReadAhead& readAhead);

  /// Forgets what is remembered for a connection that has ended.
  void connectionEnded(std::uint64_t connection);

 private:
  class State;
  std::shared_ptr<State> state_;
};

}  // namespace yomber
