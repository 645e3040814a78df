#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <utility>

#include "platform/fileprovider/extension.h"
#include "platform/fileprovider/extension_server.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/ipc/connection.h"
#include "protocols/extension.capnp.h"

namespace yomber {

/// For tests: an extension at one end of a socket pair, and its host at the other.
class ServedExtension {
 public:
  explicit ServedExtension(std::shared_ptr<NSFileProviderExtension> extension) {
    registerItemsInErrors();
    ipc::UniqueFd ours;
    ipc::UniqueFd theirs;
    EXPECT_TRUE(ipc::makeSocketPair(ours, theirs));
    served_ = ipc::Connection::adopt(
        theirs.release(), [extension = std::move(extension)] { return serveExtension(extension); });
    host_ = ipc::Connection::adopt(ours.release());
    remote = host_->bootstrap<protocol::Extension>();
  }

  ipc::Remote<protocol::Extension> remote;

 private:
  ipc::Connection::Ref served_;
  ipc::Connection::Ref host_;
};

}  // namespace yomber
