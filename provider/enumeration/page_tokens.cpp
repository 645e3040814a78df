#include "provider/enumeration/page_tokens.h"

#include <array>
#include <optional>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/daemon_connection.h"

namespace yomber {
namespace {

struct PageRecord {
  std::uint64_t offset = 0;
  std::uint8_t sortOrder = 0;
  std::array<std::uint8_t, 7> reserved{};
};
static_assert(sizeof(PageRecord) == 16);

/// The sort order of an initial page; nothing for any other.
std::optional<std::uint8_t> initialPageSortOrder(const NSData& page) {
  if (page.isEqualToData(NSFileProviderInitialPageSortedByDate)) return QSSortOrderByDate;
  if (page.isEqualToData(NSFileProviderInitialPageSortedByName)) return QSSortOrderByName;
  return std::nullopt;
}

PageRecord readRecord(const NSData& page) {
  PageRecord record;
  page.getBytes(&record, sizeof(record));
  return record;
}

}  // namespace

NSDataRef qs_pageTokenFromSortOrder(std::uint64_t sortOrder, std::uint64_t offset) {
  if (offset == 0) return nullptr;
  const PageRecord record{.offset = offset, .sortOrder = static_cast<std::uint8_t>(sortOrder)};
  return NSData::dataWithBytes(&record, sizeof(record));
}

std::uint64_t qs_pageTokenSortOrder(const NSDataRef& page) {
  if (page == nullptr) return 0;
  if (const auto sortOrder = initialPageSortOrder(*page)) return *sortOrder;
  return readRecord(*page).sortOrder;
}

std::uint64_t qs_pageTokenOffset(const NSDataRef& page) {
  if (page == nullptr || initialPageSortOrder(*page)) return 0;
  return readRecord(*page).offset;
}

}  // namespace yomber
