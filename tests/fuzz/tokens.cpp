// Everything that hands out tokens and reads them back: pages, anchors, identifiers, the working
// set's tokens, and the log level's page.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <string_view>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/log_level.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ostrell/file_object_id.h"
#include "provider/enumeration/change_tokens.h"
#include "provider/enumeration/page_tokens.h"
#include "tests/fuzz/expect.h"
#include "tests/fuzz/quiet_log.h"
#include "zarn/change_feed.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"
#include "zarn/tree_layout.h"

namespace yomber::fuzz {
namespace {

/// A small drive with a working set of a few items.
class WorkingSet {
 public:
  WorkingSet() {
    expect(layout_.createFolders() == 0, "the drive's folders were made");
    for (int i = 0; i < 5; ++i) {
      const std::string path = layout_.root() + "/item " + std::to_string(i);
      std::ofstream(path) << i;
      (void)setxattr(path.c_str(), "user.xdg.tags", "red", 3, 0);
    }
    database_ = Database::open(layout_.databasePath());
    expect(database_ != nullptr, "the database opened");
    const auto store = std::make_shared<ItemStore>(database_, layout_);
    expect(Scanner(store, {}).scanAll() == nullptr, "the tree was scanned");
    feed_ = std::make_unique<ChangeFeed>(database_);
    WorkingSetChanges all;
    expect(feed_->workingSetChanges(std::nullopt, kLimit, all) == nullptr,
           "there is a first token");
    token_ = all.token;
  }

  void readToken(std::string_view bytes) {
    answer(bytes);
    // The same as the parts of a token that begins as a real one does.
    for (const std::size_t kept : {1U, 9U, 17U}) {
      std::string token = token_.substr(0, kept);
      token += bytes.substr(0, token_.size() - kept);
      answer(token);
    }
  }

 private:
  static constexpr std::uint32_t kLimit = 3;

  void answer(std::string_view token) {
    WorkingSetChanges changes;
    if (const auto error = feed_->workingSetChanges(token, kLimit, changes)) {
      expect(error->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired),
             "a token that cannot be answered has expired");
      return;
    }
    const std::size_t count = changes.updated.size() + changes.departed.size();
    expect(count <= kLimit, "no more changes than asked for");
    expect(count > 0 || changes.token == token, "with nothing left the token stays");
    const std::string next = changes.token;
    expect(feed_->workingSetChanges(next, kLimit, changes) == nullptr, "the next token is good");
  }

  TemporaryDirectory directory_;
  const TreeLayout layout_{directory_.path() + "/home"};
  std::shared_ptr<Database> database_;
  std::unique_ptr<ChangeFeed> feed_;
  std::string token_;
};

void readPageToken(const NSDataRef& data) {
  const auto sortOrder = qs_pageTokenSortOrder(data);
  const auto offset = qs_pageTokenOffset(data);
  const auto token = qs_pageTokenFromSortOrder(sortOrder, offset);
  if (token == nullptr) return expect(offset == 0, "only offset 0 has no token");
  expect(qs_pageTokenOffset(token) == offset, "a page token keeps its offset");
  expect(qs_pageTokenSortOrder(token) == sortOrder, "a page token keeps its sort order");
}

void readChangeToken(const NSDataRef& data) {
  UUID generation{};
  const auto rank = qs_changeTokenRankWithUUID(data, generation);
  const auto token = qs_changeTokenFromRank(rank, generation);
  expect(qs_changeTokenRankWithUUID(token, generation) == rank, "a change token keeps its rank");
}

void readIdentifier(std::string_view text) {
  const auto id = QSFileObjectID::fileObjectIDWithString(text);
  if (id != nullptr) expect(id->asString() == text, "an identifier has one form only");
}

void readLevelPage(const std::string& path, std::string_view bytes, bool padded) {
  {
    std::ofstream file(path, std::ios::binary | std::ios::trunc);
    if (padded) file << "yomberL1";
    file << bytes;
  }
  constexpr off_t kPageSize = 4096;
  if (padded) expect(truncate(path.c_str(), kPageSize) == 0, "the page was padded");
  expect(chmod(path.c_str(), S_IRUSR | S_IWUSR) == 0, "the page is private");
  NSErrorRef error;
  const auto page = LogLevelPage::open(path, &error);
  expect(page != nullptr, "a bad page is replaced");
  expect(page->level() <= LogLevel::Fault, "a page holds a level");
  expect(std::filesystem::file_size(path) == kPageSize, "a page has its size");
}

}  // namespace
}  // namespace yomber::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace yomber;
  static fuzz::WorkingSet workingSet;
  static TemporaryDirectory directory;
  static const bool isQuiet = (fuzz::quietLogs(), true);
  (void)isQuiet;
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  fuzz::readPageToken(NSData::dataWithString(bytes));
  fuzz::readChangeToken(NSData::dataWithString(bytes));
  fuzz::readIdentifier(bytes);
  workingSet.readToken(bytes);
  fuzz::readLevelPage(directory / "level", bytes, size % 2 == 0);
  return 0;
}
