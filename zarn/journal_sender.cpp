#include "zarn/journal_sender.h"

#include <chrono>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"

namespace yomber {

namespace {

using Observer = protocol::TreeObserver;
using Names = capnp::List<protocol::ShownName>::Builder;
using Entries = capnp::List<protocol::Entry>::Builder;

/// Between two calls.
constexpr auto kPause = 2 * kj::MILLISECONDS;
/// An observer may take as long as it likes: what waits for it is bounded.
constexpr ipc::CallOptions kPatient{.timeout = std::chrono::milliseconds(0)};

void encodeNames(const std::vector<ShownName>& names, Names builder) {
  for (unsigned i = 0; i < builder.size(); ++i) {
    builder[i].setFolder(names[i].folder);
    builder[i].setName(wireData(names[i].name));
    builder[i].setShownName(wireData(names[i].shownName));
    builder[i].setLocation(wireData(names[i].location));
  }
}

void encodeEntries(const std::vector<DiskEntry>& entries, Entries builder) {
  for (unsigned i = 0; i < builder.size(); ++i) {
    builder[i].setFolder(entries[i].folder);
    builder[i].setName(wireData(entries[i].name));
  }
}

class JournalSender final : public JournalReceiver {
 public:
  explicit JournalSender(ipc::Remote<Observer> remote) : remote_(std::move(remote)) {}
  ~JournalSender() override { keep({}); }

  void start(std::vector<ShownName> shownNames, Answered answered) override {
    send(
        &Observer::Client::didStartRequest,
        [names = std::move(shownNames)](Observer::DidStartParams::Builder params) {
          encodeNames(names, params.initShownNames(static_cast<unsigned>(names.size())));
        },
        std::move(answered));
  }

  void change(JournalBatch batch, Answered answered) override {
    send(
        &Observer::Client::didChangeRequest,
        [batch = std::move(batch)](Observer::DidChangeParams::Builder params) {
          const auto& [entries, names] = batch;
          encodeEntries(entries, params.initEntries(static_cast<unsigned>(entries.size())));
          encodeNames(names, params.initShownNames(static_cast<unsigned>(names.size())));
        },
        std::move(answered));
  }

  void loseTrack(Answered answered) override {
    send(
        &Observer::Client::didLoseTrackRequest, [](Observer::DidLoseTrackParams::Builder) {},
        std::move(answered));
  }

 private:
  template <typename Method, typename Fill>
  void send(Method method, Fill fill, Answered answered) {
    keep(ipc::call(
        remote_, method, std::move(fill),
        [answered = std::move(answered)](const NSErrorRef& error, const auto*) mutable {
          if (error) return answered(false);
          auto& loop = ipc::EventLoop::shared();
          loop.detach(loop.timer().afterDelay(kPause).then(
              [answered = std::move(answered)] { answered(true); }));
        },
        kPatient));
  }

  /// Gives up the call that was kept before; one that was answered is over already.
  void keep(ipc::CallHandle call) {
    {
      LockGuard guard(mutex_);
      std::swap(call_, call);
    }
    call.cancel();
  }

  const ipc::Remote<Observer> remote_;
  Mutex mutex_;
  ipc::CallHandle call_ GUARDED_BY(mutex_);
};

}  // namespace

std::shared_ptr<JournalReceiver> makeJournalSender(ipc::Remote<Observer> observer) {
  return std::make_shared<JournalSender>(std::move(observer));
}

}  // namespace yomber
