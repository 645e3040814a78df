#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

#include <kj/async.h>

#include "fileproviderd/extension_supervisor.h"
#include "fileproviderd/listing.h"
#include "platform/ipc/pending_call.h"
#include "platform/ipc/remote.h"
#include "protocols/thumbnails.capnp.h"

namespace yomber {

/// The thumbnails that one client asked for, on their way from the extension to it.
///
/// The extension is asked for a few hundred items at a time, and for some of them while others
/// are under way, so that its lookups hold up nobody's pictures. What it delivers is passed on as
/// it comes, once for each item; the extension's calls are answered when the client has answered,
/// which holds the extension back. What is lost with an extension is asked for again, of the next
/// one.
///
/// Thread-safety: loop thread only. Ownership: the client's call has it; dropping it cancels what
/// is under way.
class ThumbnailFetch final : public std::enable_shared_from_this<ThumbnailFetch> {
 public:
  using Handler = std::function<void(NSErrorRef)>;
  struct Request {
    std::vector<std::string> identifiers;  ///< one that is there twice counts once
    double width = 0;                      ///< points
    double height = 0;
  };

  /// The supervisor must outlive it.
  ThumbnailFetch(ExtensionSupervisor& supervisor, ErrorExplainer explain, Request request,
                 ipc::Remote<protocol::ThumbnailReceiver> receiver);
  ~ThumbnailFetch();
  ThumbnailFetch(const ThumbnailFetch&) = delete;
  ThumbnailFetch& operator=(const ThumbnailFetch&) = delete;

  /// `handler` is called once, when the client has taken the last thumbnail: with the last failure,
  /// if there was one; or at once when the client takes no more. To be called once.
  void start(Handler handler);

 private:
  class PartReceiver;
  struct Part {
    std::vector<std::string> identifiers;
    int attempts = 0;  ///< that are left
    ipc::CallHandle call;
  };
  using PartRef = std::shared_ptr<Part>;

  void askForMore();
  void ask(const PartRef& part);
  void askSession(const PartRef& part, const ExtensionSessionRef& session);
  void didAnswer(const PartRef& part, const ExtensionSessionRef& session, const NSErrorRef& lost,
                 const NSErrorRef& failure);
  /// Passes on what the client has not been told.
  kj::Promise<void> forward(protocol::ThumbnailReceiver::DidFetchParams::Reader params);
  void didForward(NSErrorRef error);
  /// Tells of the items that the extension said nothing of.
  void settle(const PartRef& part, const NSErrorRef& failure);
  void partIsDone(const PartRef& part);
  void clientDidFail(NSErrorRef error);
  void finish();

  ExtensionSupervisor& supervisor_;
  const ErrorExplainer explain_;
  const Request request_;
  const ipc::Remote<protocol::ThumbnailReceiver> receiver_;

  Handler handler_;
  std::unordered_set<std::string> untold_;
  std::size_t next_ = 0;  ///< of the identifiers, the first not asked for
  std::vector<PartRef> underWay_;
  std::size_t forwarding_ = 0;  ///< calls that the client has not answered
  NSErrorRef failure_;
  NSErrorRef extensionFailure_;  ///< why no extension can be had
};

}  // namespace yomber
