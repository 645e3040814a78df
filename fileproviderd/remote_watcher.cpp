#include "fileproviderd/remote_watcher.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/remote.h"

namespace yomber {
namespace {

using protocol::Watcher;

class RemoteWatcher final : public ContainerWatcher {
 public:
  explicit RemoteWatcher(Watcher::Client client) : remote_(kj::mv(client)) {}

  void didList(const std::vector<ItemFields>& items, bool last, Answered answered) override {
    auto request = remote_.client().didListRequest(sizeHint(items));
    write(items, request.initItems(static_cast<unsigned>(items.size())));
    request.setLast(last);
    send(kj::mv(request), std::move(answered));
  }
  void didUpdate(const std::vector<ItemFields>& items, Answered answered) override {
    auto request = remote_.client().didUpdateRequest(sizeHint(items));
    write(items, request.initItems(static_cast<unsigned>(items.size())));
    send(kj::mv(request), std::move(answered));
  }
  void didDelete(const std::vector<std::string>& identifiers, Answered answered) override {
    auto request = remote_.client().didDeleteRequest();
    auto list = request.initIdentifiers(static_cast<unsigned>(identifiers.size()));
    for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(identifiers[i]));
    send(kj::mv(request), std::move(answered));
  }
  void didPause(const NSErrorRef& error, Answered answered) override {
    auto request = remote_.client().didPauseRequest();
    ipc::encodeError(error, request.initError());
    send(kj::mv(request), std::move(answered));
  }
  void didResume(Answered answered) override {
    send(remote_.client().didResumeRequest(), std::move(answered));
  }
  void didEnd(const NSErrorRef& error, Answered answered) override {
    auto request = remote_.client().didEndRequest();
    ipc::encodeError(error, request.initError());
    send(kj::mv(request), std::move(answered));
  }

 private:
  static capnp::MessageSize sizeHint(const std::vector<ItemFields>& items) {
    std::uint64_t words = 64;
    for (const auto& item : items) words += encodedItemWords(item);
    return {words, 0};
  }
  static void write(const std::vector<ItemFields>& items,
                    capnp::List<protocol::Item>::Builder list) {
    for (unsigned i = 0; i < list.size(); ++i) encodeItem(items[i], list[i]);
  }

  template <typename Request>
  static void send(Request&& request, Answered answered) {
    auto done = std::make_shared<Answered>(std::move(answered));
    ipc::EventLoop::shared().detach(
        request.send().then([done](auto&&) { (*done)(); }, [done](kj::Exception&&) { (*done)(); }));
  }

  const ipc::Remote<Watcher> remote_;
};

}  // namespace

std::shared_ptr<ContainerWatcher> makeRemoteWatcher(Watcher::Client client) {
  return std::make_shared<RemoteWatcher>(kj::mv(client));
}

}  // namespace yomber
