#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "fileproviderd/container_watch.h"
#include "fileproviderd/content_needs.h"
#include "fileproviderd/extension_content.h"
#include "fileproviderd/extension_services.h"
#include "fileproviderd/extension_supervisor.h"
#include "fileproviderd/host_clock.h"
#include "fileproviderd/remote_session.h"
#include "fileproviderd/thumbnail_fetch.h"
#include "fileproviderd/zarn_link.h"
#include "platform/foundation/drive_paths.h"

namespace yomber {

/// The host of one drive: the extension, the connection to zarn, and the watches; wired together.
///
/// Thread-safety: loop thread only.
/// Ownership: shared; made with `create`.
class Host final : public EnumeratorSource, public std::enable_shared_from_this<Host> {
 public:
  struct Options {
    DrivePaths paths;
    std::string extensionProgram;
    std::chrono::milliseconds callLimit{30'000};  ///< for one request to the extension
    ExtensionSupervisor::Limits supervision;
    ContainerWatch::Limits watching;
    ContentNeeds::Limits needs;
    std::size_t maximumWatches = 4'096;
    std::size_t maximumThumbnailFetches = 32;
  };
  static std::shared_ptr<Host> create(Options options);

  /// Connects to zarn.
  void start();

  void enumerator(const std::string& container, EnumeratorHandler handler) override;
  void isGone(const std::string& container, std::function<void(bool)> handler) override;

  // What clients ask for. Handlers are called once, within a bounded time. A request that was lost
  // with the extension is made once more.
  using ItemHandler = std::function<void(std::optional<ItemFields>, NSErrorRef)>;
  using TextHandler = std::function<void(std::optional<std::string>, NSErrorRef)>;
  void item(const std::string& identifier, ItemHandler handler);
  void locate(const std::string& identifier, TextHandler handler);
  void identify(const std::string& path, TextHandler handler);
  using VendedServicesHandler =
      std::function<void(std::optional<std::vector<VendedService>>, NSErrorRef)>;
  /// Asking twice does no harm: an endpoint that nobody connects to goes away.
  void services(const ServicesRequest& request, VendedServicesHandler handler);

  /// Null when there are too many watches already. The watch ends when the caller lets go of it.
  std::shared_ptr<ContainerWatch> watch(const std::string& container,
                                        std::shared_ptr<ContainerWatcher> watcher);

  /// Null when there are too many already. The fetch ends when the caller lets go of it.
  std::shared_ptr<ThumbnailFetch> thumbnailFetch(ThumbnailFetch::Request request,
                                                 ipc::Remote<protocol::ThumbnailReceiver> receiver);

  /// Puts an error into words: one that comes from zarn not being there says so.
  void explain(const NSErrorRef& error, std::function<void(NSErrorRef)> handler);

  /// Content as the extension has it, and who needs it. Both live as long as the host.
  [[nodiscard]] ExtensionContent& content();
  [[nodiscard]] ContentNeeds& contentNeeds();

  [[nodiscard]] ExtensionSupervisor& supervisor() { return *supervisor_; }
  [[nodiscard]] bool isDaemonReachable() const { return zarn_->isReachable(); }
  [[nodiscard]] std::uint32_t watchCount() const;
  [[nodiscard]] std::chrono::milliseconds callLimit() const { return options_.callLimit; }

 private:
  explicit Host(Options options);
  void wire();
  void didSignal(const std::string& container);
  /// `wasLost`: the error says that the extension was.
  void explain(const NSErrorRef& error, bool wasLost, std::function<void(NSErrorRef)> handler);
  /// Every watch that lives.
  [[nodiscard]] std::vector<std::shared_ptr<ContainerWatch>> watches();

  template <typename Answer, typename Ask>
  void ask(Ask ask, std::function<void(std::optional<Answer>, NSErrorRef)> handler, int attempts);

  const Options options_;
  LoopClock clock_;
  const Backoff::Random random_ = Backoff::systemRandom();
  ProcessLauncher launcher_;
  std::shared_ptr<ZarnLink> zarn_;
  std::shared_ptr<ExtensionSupervisor> supervisor_;
  std::shared_ptr<ExtensionContent> content_;  ///< made when it is first asked for
  std::shared_ptr<ContentNeeds> needs_;
  std::vector<std::weak_ptr<ContainerWatch>> watches_;
  std::vector<std::weak_ptr<ThumbnailFetch>> thumbnailFetches_;
};

}  // namespace yomber
