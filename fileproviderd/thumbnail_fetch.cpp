#include "fileproviderd/thumbnail_fetch.h"

#include <algorithm>
#include <chrono>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Extension;
using protocol::ThumbnailReceiver;

/// The first items are asked for in a small part, so that somebody who waits sees something soon.
constexpr std::size_t kFirstPart = 16;
constexpr std::size_t kPart = 256;
constexpr std::size_t kPartsAtOnce = 6;
/// So often the extension may end under one part.
constexpr int kAttempts = 3;
constexpr ipc::CallOptions kUnlimited{.timeout = std::chrono::milliseconds::zero()};

}  // namespace

/// What the extension tells of one part. It may outlive the fetch.
class ThumbnailFetch::PartReceiver final : public ThumbnailReceiver::Server {
 public:
  explicit PartReceiver(std::weak_ptr<ThumbnailFetch> fetch) : fetch_(std::move(fetch)) {}

 protected:
  kj::Promise<void> didFetch(DidFetchContext context) override {
    context.allowCancellation();
    const auto fetch = fetch_.lock();
    if (fetch == nullptr) return kj::READY_NOW;
    auto promise = fetch->forward(context.getParams());
    context.releaseParams();
    return promise;
  }

 private:
  const std::weak_ptr<ThumbnailFetch> fetch_;
};

ThumbnailFetch::ThumbnailFetch(ExtensionSupervisor& supervisor, ErrorExplainer explain,
                               Request request, ipc::Remote<ThumbnailReceiver> receiver)
    : supervisor_(supervisor),
      explain_(std::move(explain)),
      request_(std::move(request)),
      receiver_(std::move(receiver)),
      untold_(request_.identifiers.begin(), request_.identifiers.end()) {}

ThumbnailFetch::~ThumbnailFetch() {
  for (const PartRef& part : underWay_) part->call.cancel();
}

void ThumbnailFetch::start(Handler handler) {
  handler_ = std::move(handler);
  askForMore();
}

void ThumbnailFetch::askForMore() {
  const auto& all = request_.identifiers;
  while (handler_ && underWay_.size() < kPartsAtOnce && next_ < all.size()) {
    const std::size_t end = std::min(next_ + (next_ == 0 ? kFirstPart : kPart), all.size());
    const auto part = std::make_shared<Part>();
    part->attempts = kAttempts;
    part->identifiers.assign(all.begin() + static_cast<std::ptrdiff_t>(next_),
                             all.begin() + static_cast<std::ptrdiff_t>(end));
    next_ = end;
    underWay_.push_back(part);
    ask(part);
  }
  if (underWay_.empty() && forwarding_ == 0 && next_ == all.size()) finish();
}

void ThumbnailFetch::ask(const PartRef& part) {
  if (extensionFailure_ != nullptr) return settle(part, extensionFailure_);
  supervisor_.acquire(
      [weak = weak_from_this(), part](const ExtensionSessionRef& session, const NSErrorRef& error) {
        const auto self = weak.lock();
        if (self == nullptr) return;
        if (session != nullptr) return self->askSession(part, session);
        self->extensionFailure_ = error;
        self->settle(part, error);
      });
}

void ThumbnailFetch::askSession(const PartRef& part, const ExtensionSessionRef& session) {
  const auto fill = [weak = weak_from_this(), part, width = request_.width,
                     height = request_.height](Extension::FetchThumbnailsParams::Builder params) {
    auto list = params.initIdentifiers(static_cast<unsigned>(part->identifiers.size()));
    for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(part->identifiers[i]));
    params.setWidth(width);
    params.setHeight(height);
    params.setReceiver(kj::heap<PartReceiver>(weak));
  };
  const auto reply = [weak = weak_from_this(), part, session](
                         const NSErrorRef& error,
                         const Extension::FetchThumbnailsResults::Reader* results) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    const auto failure =
        results != nullptr ? ipc::decodeOptional(results->getFailure()) : NSErrorRef();
    self->didAnswer(part, session, error, failure);
  };
  part->call = ipc::call(session->remote(), &Extension::Client::fetchThumbnailsRequest, fill, reply,
                         kUnlimited);
}

void ThumbnailFetch::didAnswer(const PartRef& part, const ExtensionSessionRef& session,
                               const NSErrorRef& lost, const NSErrorRef& failure) {
  if (!handler_) return;
  if (isConnectionError(lost)) {
    supervisor_.sessionWasLost(session, lost);
    if (--part->attempts > 0) {
      std::erase_if(part->identifiers,
                    [this](const auto& each) { return !untold_.contains(each); });
      return ask(part);
    }
  }
  const NSErrorRef error = lost != nullptr ? lost : failure;
  if (error == nullptr) return settle(part, nullptr);
  explain_(error, [weak = weak_from_this(), part](const NSErrorRef& explained) {
    if (const auto self = weak.lock()) self->settle(part, explained);
  });
}

kj::Promise<void> ThumbnailFetch::forward(ThumbnailReceiver::DidFetchParams::Reader params) {
  const auto thumbnails = params.getThumbnails();
  std::vector<unsigned> wanted;
  for (unsigned i = 0; i < thumbnails.size(); ++i) {
    if (untold_.erase(stringFromWire(thumbnails[i].getIdentifier())) > 0) wanted.push_back(i);
  }
  if (wanted.empty() || !handler_) return kj::READY_NOW;
  auto request = receiver_.client().didFetchRequest();
  auto list = request.initThumbnails(static_cast<unsigned>(wanted.size()));
  for (unsigned i = 0; i < list.size(); ++i) list.setWithCaveats(i, thumbnails[wanted[i]]);
  if (params.hasImages()) request.setImages(params.getImages());
  ++forwarding_;
  // The client takes them also when the extension, which waits for that, ends meanwhile.
  auto taken = request.send()
                   .ignoreResult()
                   .then([weak = weak_from_this()] {
                     if (const auto self = weak.lock()) self->didForward(nullptr);
                   })
                   .catch_([weak = weak_from_this()](kj::Exception&& exception) {
                     if (const auto self = weak.lock())
                       self->didForward(ipc::connectionError(exception));
                     // An answer would say that the client has read the images.
                     kj::throwFatalException(kj::mv(exception));
                   })
                   .fork();
  taken.addBranch().detach([](kj::Exception&&) {});
  return taken.addBranch();
}

void ThumbnailFetch::didForward(NSErrorRef error) {
  --forwarding_;
  if (error != nullptr) return clientDidFail(std::move(error));
  askForMore();
}

void ThumbnailFetch::settle(const PartRef& part, const NSErrorRef& failure) {
  if (failure != nullptr) failure_ = failure;
  std::vector<std::string> rest;
  for (const auto& each : part->identifiers) {
    if (untold_.erase(each) > 0) rest.push_back(each);
  }
  if (rest.empty()) return partIsDone(part);
  const auto fill = [rest = std::move(rest),
                     failure](ThumbnailReceiver::DidFetchParams::Builder params) {
    auto list = params.initThumbnails(static_cast<unsigned>(rest.size()));
    for (unsigned i = 0; i < list.size(); ++i) {
      list[i].setIdentifier(wireText(rest[i]));
      if (failure != nullptr) ipc::encodeOptional(failure, list[i].initFailure());
    }
  };
  const auto reply = [weak = weak_from_this(), part](
                         const NSErrorRef& error,
                         const ThumbnailReceiver::DidFetchResults::Reader*) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    if (error != nullptr) return self->clientDidFail(error);
    self->partIsDone(part);
  };
  part->call =
      ipc::call(receiver_, &ThumbnailReceiver::Client::didFetchRequest, fill, reply, kUnlimited);
}

void ThumbnailFetch::partIsDone(const PartRef& part) {
  std::erase(underWay_, part);
  askForMore();
}

void ThumbnailFetch::clientDidFail(NSErrorRef error) {
  if (!handler_) return;
  failure_ = std::move(error);
  for (const PartRef& part : underWay_) part->call.cancel();
  finish();
}

void ThumbnailFetch::finish() {
  if (const auto handler = std::exchange(handler_, nullptr)) handler(failure_);
}

}  // namespace yomber
