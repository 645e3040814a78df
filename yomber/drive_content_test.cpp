#include "yomber/drive_content.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <thread>

#include "platform/foundation/drive_paths.h"
#include "platform/ipc/listener.h"
#include "platform/ostrell/scripted_daemon.h"
#include "yomber/drive_client.h"

namespace yomber {
namespace {

/// A host that answers nothing but whether it is there.
class SilentHost final : public protocol::Control::Server {
 public:
  kj::Promise<void> status(StatusContext /*context*/) override { return kj::READY_NOW; }
};

class DriveContentTest : public testing::Test {
 protected:
  DriveContentTest() {
    setenv("YOMBER_DAEMON_TIMEOUT_MS", "50", 1);
    daemon = std::make_unique<ScriptedDaemon>();
    const DrivePaths paths = DrivePaths::forHome(daemon->home());
    NSErrorRef error;
    host = ipc::Listener::listen(
        paths.controlSocket,
        [](const ipc::PeerCredentials&) -> capnp::Capability::Client {
          return kj::heap<SilentHost>();
        },
        &error);
    EXPECT_NE(host, nullptr) << error->description();
    client = std::make_unique<DriveClient>(paths);
    content = DriveContent::open(*client, &error);
    EXPECT_TRUE(content) << error->description();
  }
  ~DriveContentTest() override {
    content.reset();
    client.reset();
    host.reset();
    daemon.reset();
    unsetenv("YOMBER_DAEMON_TIMEOUT_MS");
  }

  std::unique_ptr<ScriptedDaemon> daemon;
  std::unique_ptr<ipc::Listener> host;
  std::unique_ptr<DriveClient> client;
  std::optional<DriveContent> content;
};

TEST_F(DriveContentTest, EmptyingALargeTrashIsWaitedForWhileTheDaemonAnswers) {
  daemon->hold("emptyTrash");
  std::thread worker([&] {
    // So often it was asked whether it is stuck.
    EXPECT_TRUE(daemon->waitForCalls("describe", 5));
    daemon->release("emptyTrash");
  });
  std::uint64_t removed = 0;
  const NSErrorRef error = content->emptyTrash(removed);
  worker.join();
  EXPECT_EQ(error, nullptr) << error->description();
}

TEST_F(DriveContentTest, EmptyingTheTrashOfAStuckDaemonEndsAndSaysWhatToDo) {
  daemon->hold("*");
  std::uint64_t removed = 0;
  const NSErrorRef error = content->emptyTrash(removed);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut)) << error->description();
  EXPECT_NE(error->localizedDescription().find("yomber down"), std::string::npos);
  daemon->release("*");
}

}  // namespace
}  // namespace yomber
