#include "yomber/drive_content.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <thread>

#include "yomber/content_fixture.h"

namespace yomber {
namespace {

/// While it lives, the daemon is soon thought to be stuck.
class LittlePatience {
 protected:
  LittlePatience() { setenv("YOMBER_DAEMON_TIMEOUT_MS", "50", 1); }
  ~LittlePatience() { unsetenv("YOMBER_DAEMON_TIMEOUT_MS"); }
};

class DriveContentTest : LittlePatience, public ContentFixture {};

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
