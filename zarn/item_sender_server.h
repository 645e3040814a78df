#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include "platform/ipc/remote.h"
#include "protocols/daemon.capnp.h"
#include "zarn/drive.h"

namespace yomber {

/// One receiver's subscription on the wire. Loop thread only.
class ItemSenderServer final : public protocol::ItemSender::Server {
 public:
  ItemSenderServer(std::shared_ptr<Drive> drive, ipc::Remote<protocol::ItemReceiver> receiver);
  ~ItemSenderServer();

  kj::Promise<void> boostPriority(BoostPriorityContext context) override;
  kj::Promise<void> watchItem(WatchItemContext context) override;
  kj::Promise<void> invalidate(InvalidateContext context) override;

 private:
  kj::Promise<void> watchFolderAt(WatchItemContext context, std::string path,
                                  std::uint32_t options);
  kj::Promise<void> scanAndWatch(WatchItemContext context, std::string path, std::uint32_t options);
  NSErrorRef watchRow(const ItemRow& row, const std::string& path, std::uint32_t options);

  const std::shared_ptr<Drive> drive_;
  const std::shared_ptr<Subscription> subscription_;
  std::size_t watches_ = 0;
};

}  // namespace yomber
