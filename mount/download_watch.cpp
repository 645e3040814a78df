#include "mount/download_watch.h"

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/event_loop.h"
#include "protocols/daemon.capnp.h"

namespace yomber {
namespace {

using protocol::Content;
using protocol::Daemon;
using Clock = std::chrono::steady_clock;

Downloads decoded(const Content::TransfersResults::Reader& results) {
  Downloads downloads;
  for (const auto transfer : results.getTransfers()) {
    if (transfer.getKind() != Content::Transfer::Kind::DOWNLOAD) continue;
    if (transfer.getNextAttempt().isValue()) continue;
    downloads.running[stringFromWire(transfer.getPath())] = {.done = transfer.getDone(),
                                                             .total = transfer.getTotal()};
  }
  return downloads;
}

}  // namespace

std::shared_ptr<DownloadWatch> DownloadWatch::create(std::string daemonSocket,
                                                     std::chrono::milliseconds limit) {
  return std::shared_ptr<DownloadWatch>(new DownloadWatch(std::move(daemonSocket), limit));
}

std::shared_ptr<DownloadWatch::Watched> DownloadWatch::watch(const std::string& path,
                                                             std::function<void()> onStuck) {
  auto watched =
      std::make_shared<Watched>(WishDeadline(path, limit_, Clock::now()), std::move(onStuck));
  {
    LockGuard guard(mutex_);
    watched_.push_back(watched);
    if (std::exchange(isLooking_, true)) return watched;
  }
  ipc::EventLoop::shared().post([self = shared_from_this()] { self->lookInAMoment(); });
  return watched;
}

/// What comes at once costs no question.
void DownloadWatch::lookInAMoment() {
  ipc::EventLoop& loop = ipc::EventLoop::shared();
  loop.detach(
      loop.timer().afterDelay(pause().count() * kj::MILLISECONDS).then([self = shared_from_this()] {
        self->look();
      }));
}

void DownloadWatch::look() {
  std::vector<std::shared_ptr<Watched>> stuck;
  bool goesOn = false;
  {
    LockGuard guard(mutex_);
    const auto now = Clock::now();
    std::erase_if(watched_, [&](const std::weak_ptr<Watched>& weak) {
      auto watched = weak.lock();
      if (!watched) return true;
      if (!watched->deadline_.isOver(now)) return false;
      stuck.push_back(std::move(watched));
      return true;
    });
    goesOn = isLooking_ = !watched_.empty();
  }
  if (goesOn) {
    lookInAMoment();
    if (!std::exchange(isAsking_, true)) ask();
  }
  for (const auto& watched : stuck) watched->onStuck_();
}

void DownloadWatch::ask() {
  if (content_ && connection_->isConnected()) return askForDownloads();
  content_ = nullptr;
  ipc::Connection::connectAsync(
      daemonSocket_,
      [self = shared_from_this()](const ipc::Connection::Ref& connection, const NSErrorRef&) {
        ipc::EventLoop::shared().post([self, connection] { self->didConnect(connection); });
      });
}

void DownloadWatch::didConnect(const ipc::Connection::Ref& connection) {
  if (!connection) return didFail();
  connection_ = connection;
  (void)ipc::call(
      connection_->bootstrap<Daemon>(), &Daemon::Client::contentRequest, [](auto) {},
      [self = shared_from_this()](const NSErrorRef&,
                                  const Daemon::ContentResults::Reader* results) {
        if (results == nullptr) return self->didFail();
        self->content_ = ipc::Remote<Content>(results->getContent());
        self->askForDownloads();
      },
      {.timeout = limit_});
}

void DownloadWatch::askForDownloads() {
  (void)ipc::call(
      content_, &Content::Client::transfersRequest, [](auto) {},
      [self = shared_from_this()](const NSErrorRef&,
                                  const Content::TransfersResults::Reader* results) {
        if (results == nullptr) return self->didFail();
        self->didAnswer(decoded(*results));
      },
      {.timeout = limit_});
}

void DownloadWatch::didAnswer(Downloads downloads) {
  isAsking_ = false;
  {
    LockGuard guard(mutex_);
    const auto now = Clock::now();
    for (const auto& weak : watched_) {
      if (const auto watched = weak.lock()) watched->deadline_.look(last_, downloads, now);
    }
  }
  last_ = std::move(downloads);
}

/// It is asked again with the next look.
void DownloadWatch::didFail() {
  isAsking_ = false;
  content_ = nullptr;
  connection_ = nullptr;
}

}  // namespace yomber
