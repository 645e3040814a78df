#include "yomber/clash_policy.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <memory>
#include <string>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/drive_paths.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/listener.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

/// What the host was asked for, and what it says to it.
struct Script {
  std::vector<std::string> calls;
  NSErrorRef trashing;
};

class ScriptedChanges final : public protocol::Changes::Server {
 public:
  explicit ScriptedChanges(std::shared_ptr<Script> script) : script_(std::move(script)) {}

  kj::Promise<void> trash(TrashContext context) override {
    script_->calls.push_back("trash " + stringFromWire(context.getParams().getIdentifier()));
    if (script_->trashing) ipc::encodeError(script_->trashing, context.getResults().initError());
    return kj::READY_NOW;
  }
  kj::Promise<void> untrash(UntrashContext context) override {
    const auto params = context.getParams();
    script_->calls.push_back("untrash " + stringFromWire(params.getIdentifier()) + " to " +
                             stringFromWire(params.getParent()));
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<Script> script_;
};

class ScriptedHost final : public protocol::Control::Server {
 public:
  explicit ScriptedHost(std::shared_ptr<Script> script) : script_(std::move(script)) {}

  kj::Promise<void> status(StatusContext /*context*/) override { return kj::READY_NOW; }
  kj::Promise<void> changes(ChangesContext context) override {
    context.getResults().setChanges(kj::heap<ScriptedChanges>(script_));
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<Script> script_;
};

NSErrorRef failure(int number) { return NSError::errorWithErrno(number); }

class ClashPolicyTest : public testing::Test {
 protected:
  ClashPolicyTest() : client_(DrivePaths::forHome(daemon_.home())) {
    inTheWay_.identifier = "i:7";
    inTheWay_.parentIdentifier = "i:3";
    NSErrorRef error;
    host_ = ipc::Listener::listen(
        client_.paths().controlSocket,
        [script = script_](const ipc::PeerCredentials&) -> capnp::Capability::Client {
          return kj::heap<ScriptedHost>(script);
        },
        &error);
    EXPECT_NE(host_, nullptr) << error->description();
    changes_ = DriveChanges::open(client_, &error);
    EXPECT_TRUE(changes_) << error->description();
  }

  [[nodiscard]] NSErrorRef clash() const {
    return NSError::errorWithDomain(
        NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision,
        {{NSFileProviderErrorItemKey, NSObjectRef(std::make_shared<WireItem>(inTheWay_))}});
  }
  /// Makes a change whose attempts end with these, one after the other.
  ChangeResult change(const ClashPolicy& policy, const std::vector<NSErrorRef>& ends) {
    names_.clear();
    return changeWithPolicy(*changes_, policy, "report.pdf", [&](const std::string& name) {
      ChangeResult result;
      if (names_.size() < ends.size()) result.error = ends[names_.size()];
      names_.push_back(name);
      return result;
    });
  }

  ScriptedDaemon daemon_;
  DriveClient client_;
  const std::shared_ptr<Script> script_ = std::make_shared<Script>();
  std::unique_ptr<ipc::Listener> host_;
  std::optional<DriveChanges> changes_;
  ItemFields inTheWay_;
  std::vector<std::string> names_;  ///< those that were tried
};

constexpr ClashPolicy kReplace{.keepBoth = false, .replace = true};

TEST_F(ClashPolicyTest, WhatIsReplacedGoesToTheTrashAndStaysThere) {
  EXPECT_EQ(change(kReplace, {clash()}).error, nullptr);
  EXPECT_THAT(names_, ElementsAre("report.pdf", "report.pdf"));
  EXPECT_THAT(script_->calls, ElementsAre("trash i:7"));
}

TEST_F(ClashPolicyTest, WhatWasTrashedComesBackWhenTheOtherOneCouldNotBeBrought) {
  const auto result = change(kReplace, {clash(), failure(ENOSPC)});
  ASSERT_NE(result.error, nullptr);
  EXPECT_TRUE(result.error->is(NSPOSIXErrorDomain, ENOSPC)) << result.error->description();
  EXPECT_THAT(script_->calls, ElementsAre("trash i:7", "untrash i:7 to i:3"));
}

TEST_F(ClashPolicyTest, WhatCannotBeTrashedStopsTheChange) {
  script_->trashing = failure(EACCES);
  const auto result = change(kReplace, {clash()});
  ASSERT_NE(result.error, nullptr);
  EXPECT_TRUE(result.error->is(NSPOSIXErrorDomain, EACCES)) << result.error->description();
  EXPECT_THAT(names_, ElementsAre("report.pdf"));
  EXPECT_THAT(script_->calls, ElementsAre("trash i:7"));
}

TEST_F(ClashPolicyTest, WithoutAWishAClashIsAFailureThatSaysWhatCanBeDone) {
  const auto result = change({}, {clash()});
  ASSERT_NE(result.error, nullptr);
  EXPECT_TRUE(clashIn(result.error).isClash);
  EXPECT_THAT(result.error->localizedDescription(), HasSubstr("--replace"));
  EXPECT_THAT(script_->calls, ElementsAre());
}

}  // namespace
}  // namespace yomber
