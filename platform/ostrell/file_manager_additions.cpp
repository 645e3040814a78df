#include "platform/ostrell/file_manager_additions.h"

#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/waiting_call.h"

namespace yomber {

bool evictUbiquitousItemAtURL(const NSFileManager& /*manager*/, const NSURLRef& url,
                              NSErrorRef* error) {
  const NSErrorRef failure = waitForReply(
      url, [&](QSDaemonProtocol& daemon, const auto& reply) { daemon.evictItemAtURL(url, reply); });
  if (failure) storeError(error, failure);
  return failure == nullptr;
}

bool qs_trashItemAtURL(const NSFileManager& /*manager*/, const NSURLRef& url,
                       NSURLRef* resultingURL, NSErrorRef* error) {
  auto result = waitForURL(
      url, [&](QSDaemonProtocol& daemon, const auto& reply) { daemon.trashItemAtURL(url, reply); },
      error);
  const bool isTrashed = result != nullptr;
  if (resultingURL != nullptr) *resultingURL = std::move(result);
  return isTrashed;
}

NSURLRef qs_putBackURLForTrashedItemAtURL(const NSFileManager& /*manager*/, const NSURLRef& url,
                                          NSErrorRef* error) {
  return waitForURL(
      url,
      [&](QSDaemonProtocol& daemon, const auto& reply) {
        daemon.putBackURLForTrashedItemAtURL(url, reply);
      },
      error);
}

void qs_setLastOpenDate(const NSFileManager& /*manager*/, const std::optional<NSDate>& date,
                        const NSURLRef& onItemAtURL) {
  if (!onItemAtURL) return;
  const NSErrorRef failure =
      waitForReply(onItemAtURL, [&](QSDaemonProtocol& daemon, const auto& reply) {
        daemon.setLastUsedDate(date, onItemAtURL, reply);
      });
  if (!failure) return;
  log_error(qsc_default_log(), "[ERROR] can't set the last used date of %@: %@", onItemAtURL,
            failure);
}

void qs_setFavoriteRank(const NSFileManager& /*manager*/, const std::optional<std::int64_t>& rank,
                        const NSURLRef& onItemAtURL) {
  if (!onItemAtURL) return;
  const NSErrorRef failure =
      waitForReply(onItemAtURL, [&](QSDaemonProtocol& daemon, const auto& reply) {
        daemon.setFavoriteRank(rank, onItemAtURL, reply);
      });
  if (!failure) return;
  log_error(qsc_default_log(), "[ERROR] can't set the favorite rank of %@: %@", onItemAtURL,
            failure);
}

}  // namespace yomber
