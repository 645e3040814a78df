#include "platform/ostrell/user_defaults.h"

#include <algorithm>
#include <atomic>
#include <charconv>
#include <cstdlib>
#include <string_view>

namespace yomber {
namespace {

constexpr std::uint32_t kRecordsInFetch = 50'000;
constexpr std::uint64_t kThumbnailTransferBytes = std::uint64_t{64} << 20U;

/// A number of the environment; what is none is not heeded.
template <typename Number>
Number fromEnvironment(const char* variable, Number otherwise) {
  const char* const value = std::getenv(variable);
  if (value == nullptr) return otherwise;
  const std::string_view text(value);
  Number number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  return error == std::errc() && end == text.data() + text.size() ? number : otherwise;
}

std::uint32_t recordsInFetchAtStart() {
  static const auto count = fromEnvironment("YOMBER_RECORDS_IN_FETCH", kRecordsInFetch);
  return count;
}

std::uint64_t thumbnailTransferBytesAtStart() {
  static const auto size =
      fromEnvironment("YOMBER_THUMBNAIL_TRANSFER_BYTES", kThumbnailTransferBytes);
  return size;
}

std::atomic<std::uint32_t>& recordsInFetch() {
  static std::atomic<std::uint32_t> count = recordsInFetchAtStart();
  return count;
}

std::atomic<std::uint64_t>& thumbnailTransferBytes() {
  static std::atomic<std::uint64_t> size = thumbnailTransferBytesAtStart();
  return size;
}

}  // namespace

QSCUserDefaults& QSCUserDefaults::defaultsForMangledID(
    const std::optional<std::string>& /*mangledID*/) {
  static QSCUserDefaults defaults;
  return defaults;
}

std::uint32_t QSCUserDefaults::maxRecordCountInFetchRecordsOperation() const {
  return std::max(recordsInFetch().load(), 1U);
}

void QSCUserDefaults::setMaxRecordCountInFetchRecordsOperation(std::optional<std::uint32_t> count) {
  recordsInFetch() = count.value_or(recordsInFetchAtStart());
}

QSRemoteUserDefaults& QSRemoteUserDefaults::sharedDefaults() {
  static QSRemoteUserDefaults defaults;
  return defaults;
}

std::uint64_t QSRemoteUserDefaults::minFileSizeForThumbnailTransfer() const {
  return thumbnailTransferBytes();
}

void QSRemoteUserDefaults::setMinFileSizeForThumbnailTransfer(std::optional<std::uint64_t> size) {
  thumbnailTransferBytes() = size.value_or(thumbnailTransferBytesAtStart());
}

}  // namespace yomber
