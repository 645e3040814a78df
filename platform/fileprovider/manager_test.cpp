#include "platform/fileprovider/manager.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

namespace yomber {
namespace {

using namespace std::chrono_literals;

struct Signal {
  NSErrorRef error;
  std::thread::id thread;
};

/// Signals and waits for the handler.
Signal signal(NSFileProviderManager& manager, const std::string& container) {
  auto answer = std::make_shared<std::promise<Signal>>();
  auto future = answer->get_future();
  manager.signalEnumeratorForContainerItemIdentifier(container, [answer](NSErrorRef error) {
    answer->set_value({std::move(error), std::this_thread::get_id()});
  });
  if (future.wait_for(10s) != std::future_status::ready) {
    ADD_FAILURE() << "the handler was not called";
    return {};
  }
  return future.get();
}

class RecordingTransport final : public NSFileProviderManager::Transport {
 public:
  void signalEnumerator(const NSFileProviderItemIdentifier& container,
                        std::function<void(NSErrorRef)> completionHandler) override {
    signalled.push_back(container);
    completionHandler(error);
  }
  std::vector<std::string> signalled;
  NSErrorRef error;
};

TEST(FileProviderManager, AnswersInvalidWithoutAHost) {
  NSFileProviderManager manager;
  const auto answer = signal(manager, "d:1");
  ASSERT_NE(answer.error, nullptr);
  EXPECT_TRUE(answer.error->is(NSCocoaErrorDomain, NSXPCConnectionInvalid));
  EXPECT_NE(answer.thread, std::this_thread::get_id())
      << "handlers never run on the caller's stack";
}

TEST(FileProviderManager, HandsSignalsToTheTransport) {
  NSFileProviderManager manager;
  const auto transport = std::make_shared<RecordingTransport>();
  manager.setTransport(transport);
  EXPECT_EQ(signal(manager, "i:7").error, nullptr);
  transport->error = NSError::errorWithErrno(5);
  EXPECT_EQ(signal(manager, "i:8").error, transport->error);
  EXPECT_EQ(transport->signalled, (std::vector<std::string>{"i:7", "i:8"}));
  manager.signalEnumeratorForContainerItemIdentifier("i:9", nullptr);
  EXPECT_EQ(transport->signalled.size(), 3U) << "a signal needs no handler";
}

}  // namespace
}  // namespace yomber
