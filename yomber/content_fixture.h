#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <optional>

#include "platform/foundation/drive_paths.h"
#include "platform/ipc/listener.h"
#include "platform/ostrell/scripted_daemon.h"
#include "yomber/drive_client.h"
#include "yomber/drive_content.h"

namespace yomber {

/// A host that is there, and does nothing about what it is told.
class IdleHost final : public protocol::Control::Server {
 public:
  kj::Promise<void> status(StatusContext /*context*/) override { return kj::READY_NOW; }
  kj::Promise<void> stopProviding(StopProvidingContext /*context*/) override {
    return kj::READY_NOW;
  }
};

/// The content of a drive whose daemon answers what the test says, and whose host is idle.
class ContentFixture : public testing::Test {
 protected:
  ContentFixture() {
    const DrivePaths paths = DrivePaths::forHome(daemon->home());
    NSErrorRef error;
    host = ipc::Listener::listen(
        paths.controlSocket,
        [](const ipc::PeerCredentials&) -> capnp::Capability::Client {
          return kj::heap<IdleHost>();
        },
        &error);
    EXPECT_NE(host, nullptr) << error->description();
    client = std::make_unique<DriveClient>(paths);
    content = DriveContent::open(*client, &error);
    EXPECT_TRUE(content) << error->description();
  }
  ~ContentFixture() override {
    content.reset();
    client.reset();
    host.reset();
    daemon.reset();
  }

  std::unique_ptr<ScriptedDaemon> daemon = std::make_unique<ScriptedDaemon>();
  std::unique_ptr<ipc::Listener> host;
  std::unique_ptr<DriveClient> client;
  std::optional<DriveContent> content;
};

}  // namespace yomber
