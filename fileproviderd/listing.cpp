#include "fileproviderd/listing.h"

#include <algorithm>
#include <deque>
#include <memory>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/log.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "protocols/extension.capnp.h"

namespace yomber {
namespace {

using protocol::Enumerator;
using protocol::Listing;
using PageResponse = capnp::Response<Enumerator::EnumerateItemsResults>;

/// So many calls of `next` may wait for their page.
constexpr std::size_t kMaximumWaiting = 16;
/// So many pages are kept for the client to come: the extension works on while he takes one in.
constexpr std::size_t kMaximumAhead = 2;

/// The listing itself; the capability holds it, and answers that come when it is gone are dropped.
class ListingState final : public std::enable_shared_from_this<ListingState>,
                           private kj::TaskSet::ErrorHandler {
 public:
  /// One `next`.
  struct Call {
    /// False when the client has taken it back.
    std::function<bool()> isWanted;
    /// Writes a page or an error as its answer; to be called while it is wanted.
    std::function<void(const PageResponse* page, const NSErrorRef& error)> answer;
  };

  ListingState(ExtensionSupervisor& supervisor, ErrorExplainer explain, std::string container,
               protocol::SortOrder order, std::chrono::milliseconds pageLimit)
      : supervisor_(supervisor),
        explain_(std::move(explain)),
        container_(std::move(container)),
        order_(order),
        pageLimit_(pageLimit) {}

  /// False when too many wait already.
  [[nodiscard]] bool next(Call call) {
    dropUnwanted();
    if (waiting_.size() >= kMaximumWaiting) return false;
    waiting_.push_back(std::move(call));
    if (!hasStarted_) open();
    serve();
    return true;
  }

 private:
  void open();
  void requestPage();
  void readAhead();
  void didGetPage(PageResponse&& response);
  void didNotGetPage(const kj::Exception& exception);
  void fail(const NSErrorRef& error);
  void serve();
  void taskFailed(kj::Exception&& exception) override { fail(ipc::connectionError(exception)); }
  void dropUnwanted() {
    std::erase_if(waiting_, [](const Call& call) { return !call.isWanted(); });
  }

  ExtensionSupervisor& supervisor_;
  const ErrorExplainer explain_;
  const std::string container_;
  const protocol::SortOrder order_;
  const std::chrono::milliseconds pageLimit_;

  bool hasStarted_ = false;
  bool isRequesting_ = false;
  bool isComplete_ = false;  ///< the last page has been asked for and is here, or was handed out
  NSErrorRef failure_;
  std::string token_;  ///< of the next page; empty for the first
  ipc::Remote<Enumerator> enumerator_;
  std::size_t handedOut_ = 0;  ///< pages
  std::deque<PageResponse> ready_;
  std::deque<Call> waiting_;
  kj::TaskSet requests_{*this};
};

void ListingState::open() {
  hasStarted_ = true;
  const std::weak_ptr<ListingState> weak = weak_from_this();
  supervisor_.acquire([weak](const ExtensionSessionRef& session, const NSErrorRef& error) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    if (session == nullptr) return self->fail(error);
    session->openEnumerator(self->container_,
                            [weak](ipc::Remote<Enumerator> enumerator, const NSErrorRef& failure) {
                              const auto opened = weak.lock();
                              if (opened == nullptr) return;
                              if (!enumerator) return opened->fail(failure);
                              opened->enumerator_ = std::move(enumerator);
                              opened->requestPage();
                            });
  });
}

void ListingState::requestPage() {
  isRequesting_ = true;
  auto request = enumerator_.client().enumerateItemsRequest();
  auto page = request.initPage();
  if (!token_.empty()) {
    page.setToken(wireData(token_));
  } else if (order_ == protocol::SortOrder::DATE) {
    page.setInitialByDate();
  } else {
    page.setInitialByName();
  }
  auto& timer = ipc::EventLoop::shared().timer();
  const auto weak = weak_from_this();
  kj::Promise<PageResponse> response = request.send();
  requests_.add(timer.timeoutAfter(pageLimit_.count() * kj::MILLISECONDS, kj::mv(response))
                    .then(
                        [weak](PageResponse&& got) {
                          if (const auto self = weak.lock()) self->didGetPage(kj::mv(got));
                        },
                        [weak](kj::Exception&& exception) {
                          if (const auto self = weak.lock()) self->didNotGetPage(exception);
                        }));
}

/// Many ask for one page and no more: the first two are asked for one by one.
void ListingState::readAhead() {
  if (isRequesting_ || isComplete_ || !enumerator_) return;
  if (ready_.size() < std::min(handedOut_, kMaximumAhead)) requestPage();
}

void ListingState::didGetPage(PageResponse&& response) {
  isRequesting_ = false;
  const auto result = response.getResult();
  if (result.isError()) return fail(ipc::decodeError(result.getError()));
  const auto next = result.getPage().getNext();
  auto token = next.isValue() ? stringFromWire(next.getValue()) : std::string();
  isComplete_ = token.empty();
  if (!isComplete_ && token == token_) {
    return fail(extensionUnavailableError("listed the same page again and again"));
  }
  token_ = std::move(token);
  ready_.push_back(kj::mv(response));
  // Before this page is copied: zarn is at work on the next one meanwhile.
  readAhead();
  serve();
}

void ListingState::didNotGetPage(const kj::Exception& exception) {
  if (exception.getType() != kj::Exception::Type::OVERLOADED) {
    return fail(ipc::connectionError(exception));
  }
  supervisor_.suspect();
  fail(ipc::connectionError(NSXPCConnectionTimedOut, "the extension takes too long for a page"));
}

void ListingState::fail(const NSErrorRef& error) {
  enumerator_ = nullptr;
  explain_(error, [weak = weak_from_this()](NSErrorRef explained) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->failure_ = std::move(explained);
    self->serve();
  });
}

void ListingState::serve() {
  // A page goes to whoever still waits: nobody asks for the same one again.
  dropUnwanted();
  while (!ready_.empty() && !waiting_.empty()) {
    const auto call = std::move(waiting_.front());
    waiting_.pop_front();
    const PageResponse page = kj::mv(ready_.front());
    ready_.pop_front();
    ++handedOut_;
    readAhead();
    call.answer(&page, nullptr);
  }
  if (isComplete_) enumerator_ = nullptr;
  if (!ready_.empty() || (failure_ == nullptr && !isComplete_)) return;
  for (const auto& call : std::exchange(waiting_, {})) call.answer(nullptr, failure_);
}

class ListingServer final : public Listing::Server {
 public:
  explicit ListingServer(std::shared_ptr<ListingState> state) : state_(std::move(state)) {}

 protected:
  kj::Promise<void> next(NextContext context) override {
    context.allowCancellation();
    auto pair = kj::newPromiseAndFulfiller<void>();
    struct Pending {
      NextContext context;
      kj::Own<kj::PromiseFulfiller<void>> fulfiller;
    };
    auto pending = std::make_shared<Pending>(Pending{context, kj::mv(pair.fulfiller)});
    const auto answer = [pending](const PageResponse* page, const NSErrorRef& error) {
      write(page, error, pending->context);
      pending->fulfiller->fulfill();
    };
    // The context lives only while somebody waits for the answer.
    const auto isWanted = [pending] { return pending->fulfiller->isWaiting(); };
    if (state_->next({.isWanted = isWanted, .answer = answer})) return kj::mv(pair.promise);
    const auto error = invalidRequestError("too many pages were asked for at a time");
    ipc::encodeError(error, context.getResults().initResult().initError());
    return kj::READY_NOW;
  }

 private:
  static void write(const PageResponse* page, const NSErrorRef& error, NextContext& context) {
    if (error != nullptr) {
      return ipc::encodeError(error, context.getResults().initResult().initError());
    }
    if (page == nullptr) {
      context.getResults().initResult().initPage();
      return;
    }
    const auto from = page->getResult().getPage();
    constexpr std::uint64_t kSlack = 32;
    const auto size = page->totalSize();
    auto to = context.getResults(capnp::MessageSize{size.wordCount + kSlack, 0});
    auto out = to.initResult().initPage();
    out.setItems(from.getItems());
    out.setMore(from.getNext().isValue());
  }

  const std::shared_ptr<ListingState> state_;
};

}  // namespace

protocol::Listing::Client makeListing(ExtensionSupervisor& supervisor, ErrorExplainer explain,
                                      std::string container, protocol::SortOrder order,
                                      std::chrono::milliseconds pageLimit) {
  return kj::heap<ListingServer>(std::make_shared<ListingState>(
      supervisor, std::move(explain), std::move(container), order, pageLimit));
}

}  // namespace yomber
