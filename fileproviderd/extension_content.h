#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "fileproviderd/content_needs.h"
#include "fileproviderd/extension_supervisor.h"
#include "fileproviderd/listing.h"

namespace yomber {

/// Content through the extension. What is asked for again when the extension ends in the middle of
/// it is what does no harm twice; everything else fails with an error that says so.
///
/// No request has a time limit of its own: content takes as long as it takes, and an extension that
/// is stuck is ended by its supervisor.
///
/// Thread-safety: loop thread only. Ownership: shared; answers that come when it is gone are
/// dropped.
class ExtensionContent final : public ContentSource,
                               public std::enable_shared_from_this<ExtensionContent> {
 public:
  using MoveHandler = std::function<void(bool requiresProviding, NSErrorRef error)>;

  /// The supervisor must outlive it.
  ExtensionContent(ExtensionSupervisor& supervisor, ErrorExplainer explain)
      : supervisor_(supervisor), explain_(std::move(explain)) {}

  void startProviding(const Request& request, Handler handler) override;
  void stopProviding(const std::string& path, Handler handler) override;
  void isGone(const std::string& path, std::function<void(bool)> handler) override;
  void itemChanged(const std::string& path, Handler handler);
  void movingItem(const std::string& path, const std::string& destination, MoveHandler handler);

 private:
  void start(const Request& request, Handler handler, int attempts);
  void startOn(const ExtensionSessionRef& session, const Request& request, Handler handler,
               int attempts);
  /// Calls `work` with the extension, or `missing` with why there is none.
  void withExtension(std::function<void(const ExtensionSessionRef& session)> work,
                     std::function<void(NSErrorRef error)> missing);
  /// The request on `session` failed; says why in words.
  void fail(const ExtensionSessionRef& session, const NSErrorRef& error, Handler handler);

  ExtensionSupervisor& supervisor_;
  const ErrorExplainer explain_;
};

}  // namespace yomber
