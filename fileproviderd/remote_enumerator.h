#pragma once

#include <chrono>
#include <functional>
#include <memory>

#include "fileproviderd/hosted_enumerator.h"
#include "platform/ipc/remote.h"
#include "protocols/extension.capnp.h"

namespace yomber {

/// An enumerator of the extension process.
class RemoteEnumerator final : public HostedEnumerator {
 public:
  /// `watchdog` sees every transport failure; `counted` is held as long as this lives.
  RemoteEnumerator(ipc::Remote<protocol::Enumerator> remote, std::chrono::milliseconds callLimit,
                   std::function<void(const NSErrorRef&)> watchdog, std::shared_ptr<void> counted);

  void items(const NSDataRef& page, std::function<void(PageAnswer)> handler) override;
  void changes(const NSDataRef& anchor, std::function<void(ChangesAnswer)> handler) override;
  void currentAnchor(std::function<void(AnchorAnswer)> handler) override;

 private:
  const ipc::Remote<protocol::Enumerator> remote_;
  const std::chrono::milliseconds callLimit_;
  const std::function<void(const NSErrorRef&)> watchdog_;
  const std::shared_ptr<void> counted_;
};

}  // namespace yomber
