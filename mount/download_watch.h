#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "mount/wish_deadline.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/content.capnp.h"

namespace yomber {

/// Asks zarn whether bytes come, as long as anybody waits for content, and tells those who wait in
/// vain. A zarn that does not answer brings none.
///
/// Thread-safety: every operation may be called on any thread.
class DownloadWatch : public std::enable_shared_from_this<DownloadWatch> {
 public:
  /// `limit` is how long nothing may come.
  static std::shared_ptr<DownloadWatch> create(std::string daemonSocket,
                                               std::chrono::milliseconds limit);

  /// Somebody who waits, until it is dropped.
  class Watched {
   public:
    Watched(WishDeadline deadline, std::function<void()> onStuck)
        : deadline_(std::move(deadline)), onStuck_(std::move(onStuck)) {}

   private:
    friend class DownloadWatch;
    WishDeadline deadline_;  // guarded by the watch's lock
    const std::function<void()> onStuck_;
  };
  /// `onStuck` is called at most once, on the loop thread, soon after the limit.
  [[nodiscard]] std::shared_ptr<Watched> watch(const std::string& path,
                                               std::function<void()> onStuck);

 private:
  using Content = protocol::Content;

  DownloadWatch(std::string daemonSocket, std::chrono::milliseconds limit)
      : daemonSocket_(std::move(daemonSocket)), limit_(limit) {}

  // Loop thread.
  void lookInAMoment();
  void look();
  void ask();
  void didConnect(const ipc::Connection::Ref& connection);
  void askForDownloads();
  void didAnswer(Downloads downloads);
  void didFail();
  [[nodiscard]] std::chrono::milliseconds pause() const { return limit_ / 8; }

  const std::string daemonSocket_;
  const std::chrono::milliseconds limit_;
  Mutex mutex_;
  std::vector<std::weak_ptr<Watched>> watched_ GUARDED_BY(mutex_);
  bool isLooking_ GUARDED_BY(mutex_) = false;

  // Loop thread only.
  bool isAsking_ = false;
  ipc::Connection::Ref connection_;
  ipc::Remote<Content> content_;
  Downloads last_;
};

}  // namespace yomber
