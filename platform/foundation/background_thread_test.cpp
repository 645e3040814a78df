#include "platform/foundation/background_thread.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <thread>

namespace yomber {
namespace {

int niceness() { return getpriority(PRIO_PROCESS, static_cast<id_t>(gettid())); }

TEST(BackgroundThreadTest, GivesWayTogetherWithWhatItStartsAndLeavesOthersAlone) {
  const int usual = niceness();
  int own = usual;
  int started = usual;
  std::thread([&] {
    giveWayToOthers();
    own = niceness();
    std::thread([&] { started = niceness(); }).join();
  }).join();
  EXPECT_GT(own, usual);
  EXPECT_EQ(started, own);
  EXPECT_EQ(niceness(), usual);
}

}  // namespace
}  // namespace yomber
