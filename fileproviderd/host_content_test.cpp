#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <cerrno>
#include <fstream>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "fileproviderd/host_fixture.h"
#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Changes;
using protocol::Control;
using protocol::Need;
using Lines = std::vector<std::string>;

class HostContentTest : public HostTest {
 protected:
  HostContentTest() {
    startZarn();
    startHost();
  }

  /// What a request for content came to, when it does.
  struct Provided {
    ipc::Remote<Need> need;
    NSErrorRef error;
  };
  struct Request {
    ipc::CallHandle call;
    std::future<Provided> answer;
  };
  Request ask(const ipc::Remote<Control>& served, const std::string& path,
              std::uint64_t options = 0) const {
    auto promise = std::make_shared<std::promise<Provided>>();
    Request request;
    request.answer = promise->get_future();
    request.call = ipc::call(
        served, &Control::Client::startProvidingRequest,
        [path, options](Control::StartProvidingParams::Builder params) {
          params.setPath(wireData(path));
          params.setOptions(options);
        },
        [promise](NSErrorRef error, const Control::StartProvidingResults::Reader* results) {
          Provided provided;
          provided.error = std::move(error);
          if (results != nullptr) {
            provided.error = ipc::decodeOptional(results->getFailure());
            if (results->hasNeed()) provided.need = ipc::Remote<Need>(results->getNeed());
          }
          promise->set_value(std::move(provided));
        });
    return request;
  }
  Provided provide(const std::string& path, std::uint64_t options = 0) const {
    return ask(remote, path, options).answer.get();
  }
  NSErrorRef stop(const std::string& path) const {
    NSErrorRef failure;
    const NSErrorRef transport = ipc::callAndWait(
        remote, &Control::Client::stopProvidingRequest,
        [&](auto params) { params.setPath(wireData(path)); },
        [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return transport != nullptr ? transport : failure;
  }
  NSErrorRef rename(const std::string& identifier, const std::string& name,
                    std::uint64_t* version = nullptr) const {
    ipc::Remote<Changes> changes;
    NSErrorRef failure = ipc::callAndWait(
        remote, &Control::Client::changesRequest, [](auto) {},
        [&](auto results) { changes = ipc::Remote<Changes>(results.getChanges()); });
    EXPECT_EQ(failure, nullptr);
    const NSErrorRef transport = ipc::callAndWait(
        changes, &Changes::Client::renameRequest,
        [&](auto params) {
          params.setIdentifier(wireText(identifier));
          params.setName(wireData(name));
        },
        [&](auto changed) {
          if (changed.isError()) failure = ipc::decodeError(changed.getError());
          if (changed.isItem() && version != nullptr) *version = changed.getItem().getVersion();
        });
    return transport != nullptr ? transport : failure;
  }

  /// What the extension noted.
  [[nodiscard]] Lines journal() const {
    std::ifstream file(home + "/fake/journal");
    Lines lines;
    for (std::string line; std::getline(file, line);) lines.push_back(line);
    return lines;
  }
  /// Waits until the extension has noted so many lines.
  [[nodiscard]] Lines waitForJournal(std::size_t count) const {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (journal().size() < count && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    return journal();
  }
};

TEST_F(HostContentTest, ProvidesContentAndKeepsItNeeded) {
  auto provided = provide("/root/a", 0x20000);
  ASSERT_EQ(provided.error, nullptr);
  ASSERT_TRUE(provided.need);
  EXPECT_EQ(journal(), Lines{"start /root/a 131072"});
  EXPECT_TRUE(stop("/root/a")->is(NSPOSIXErrorDomain, EBUSY));
  EXPECT_EQ(stop("/root/b"), nullptr);
  provided.need = nullptr;
  while (stop("/root/a") != nullptr) std::this_thread::yield();
  EXPECT_EQ(journal(), (Lines{"start /root/a 131072", "stop /root/b", "stop /root/a"}));
}

TEST_F(HostContentTest, TakesOneLocationForAnotherFormOfIt) {
  const auto provided = provide("/root//./a");
  ASSERT_EQ(provided.error, nullptr);
  EXPECT_TRUE(stop("/root/a/")->is(NSPOSIXErrorDomain, EBUSY));
  EXPECT_TRUE(provide("relative").error->is(NSPOSIXErrorDomain, EINVAL));
}

TEST_F(HostContentTest, ADroppedRequestIsGivenUp) {
  command("slow");
  const auto request = ask(remote, "/root/a");
  EXPECT_EQ(waitForJournal(1), Lines{"start /root/a 0"});
  request.call.cancel();
  EXPECT_EQ(waitForJournal(2), (Lines{"start /root/a 0", "stop /root/a"}));
}

TEST_F(HostContentTest, AConnectionThatEndsDropsItsNeeds) {
  command("slow");
  const auto kept = ask(remote, "/root/a");
  {
    const auto other = ipc::Connection::connect(paths.controlSocket);
    const auto lost = ask(other->bootstrap<Control>(), "/root/b");
    EXPECT_THAT(waitForJournal(2),
                testing::UnorderedElementsAre("start /root/a 0", "start /root/b 0"));
  }
  EXPECT_THAT(waitForJournal(3), testing::Contains("stop /root/b"));
  EXPECT_THAT(journal(), testing::Not(testing::Contains("stop /root/a")));
}

TEST_F(HostContentTest, AsksTheNextExtensionWhenOneEndsUnderARequest) {
  command("die-on-content");
  const auto provided = provide("/root/a");
  EXPECT_EQ(provided.error, nullptr) << provided.error->description();
  EXPECT_EQ(journal(), (Lines{"start /root/a 0", "start /root/a 0"}));
  EXPECT_EQ(status().starts, 2U);
}

TEST_F(HostContentTest, AsksNobodyElseForWhatWasGivenUp) {
  command("slow");
  const auto request = ask(remote, "/root/a");
  EXPECT_EQ(waitForJournal(1), Lines{"start /root/a 0"});
  const auto first = status().extension;
  command("die-on-stop");
  request.call.cancel();
  ASSERT_TRUE(waitForStatus([&](const Status& now) { return now.extension != first; }));
  countermand("slow");
  EXPECT_EQ(provide("/root/b").error, nullptr);
  EXPECT_EQ(journal(), (Lines{"start /root/a 0", "stop /root/a", "start /root/b 0"}));
}

TEST_F(HostContentTest, NeverBeginsWhatWasGivenUpBeforeThereWasAnExtension) {
  countermand("root");
  {
    const auto request = ask(remote, "/root/a");
    request.call.cancel();
    (void)status();  // it follows the cancellation
  }
  command("root");
  EXPECT_EQ(provide("/root/b").error, nullptr);
  EXPECT_THAT(journal(), testing::Not(testing::Contains("start /root/a 0")));
}

TEST_F(HostContentTest, AsksAgainForContentThatIsGoneAgain) {
  const std::string file = home + "/file";
  std::ofstream(file) << "x";
  ASSERT_EQ(setxattr(file.c_str(), kFaultAttribute, "x", 1, 0), 0);
  const auto provided = provide(file);
  ASSERT_NE(provided.error, nullptr);
  EXPECT_TRUE(provided.error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
  EXPECT_EQ(journal().size(), 8U) << "not for ever";
  removexattr(file.c_str(), kFaultAttribute);
  EXPECT_EQ(provide(file).error, nullptr);
}

TEST_F(HostContentTest, PassesChangesOn) {
  std::uint64_t version = 0;
  EXPECT_EQ(rename("a", "\xff new", &version), nullptr);
  EXPECT_EQ(version, 2U);
  EXPECT_EQ(journal(), Lines{"rename a \xff new"});
}

TEST_F(HostContentTest, NeverMakesAChangeTwice) {
  command("die-on-rename");
  const auto error = rename("a", "new");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable));
  EXPECT_NE(error->localizedDescription().find("look whether it was carried out"),
            std::string::npos);
  EXPECT_EQ(journal(), Lines{"rename a new"});
  EXPECT_EQ(rename("a", "newer"), nullptr) << "the next extension goes on";
}

TEST_F(HostContentTest, SaysWhenThereIsNobodyToMakeAChange) {
  stopZarn();
  ASSERT_TRUE(waitForStatus([](const Status& status) { return !status.daemonReachable; }));
  const auto error = provide("/root/a").error;
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->localizedDescription(), "zarn is not running: start the drive with 'yomber up'");
}

TEST_F(HostContentTest, PassesOnWhatThePathsSay) {
  NSErrorRef failure;
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                remote, &Control::Client::itemChangedRequest,
                [](auto params) { params.setPath(wireData("/root/a")); },
                [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); }));
  EXPECT_EQ(failure, nullptr);
  bool requiresProviding = false;
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                remote, &Control::Client::movingItemRequest,
                [](auto params) {
                  params.setPath(wireData("/root/a"));
                  params.setDestination(wireData("/root/b"));
                },
                [&](auto results) { requiresProviding = results.getRequiresProviding(); }));
  EXPECT_TRUE(requiresProviding);
  EXPECT_EQ(journal(), (Lines{"changed /root/a", "moving /root/a /root/b"}));
}

}  // namespace
}  // namespace yomber
