#include "yomber/eviction.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>

#include "platform/foundation/file_descriptor.h"
#include "platform/ostrell/constants.h"
#include "yomber/content_fixture.h"

namespace yomber {
namespace {

ContentState stateOf(ContentState::Local local, ContentState::Upload upload, bool pinned = false) {
  ContentState state;
  state.local = local;
  state.upload = upload;
  state.isPinned = pinned;
  return state;
}

using Local = ContentState::Local;
using Upload = ContentState::Upload;

TEST(Eviction, SaysWhatKeepsContentHere) {
  EXPECT_EQ(reasonToKeep(stateOf(Local::HERE, Upload::WAITING)), "it is not uploaded yet");
  EXPECT_EQ(reasonToKeep(stateOf(Local::HERE, Upload::UPLOADING)), "it is being uploaded");
  EXPECT_EQ(reasonToKeep(stateOf(Local::HERE, Upload::NONE)), "it is not uploaded at all");
  EXPECT_EQ(reasonToKeep(stateOf(Local::DOWNLOADING, Upload::CONFIRMED)), "it is being downloaded");
  EXPECT_EQ(reasonToKeep(stateOf(Local::HERE, Upload::CONFIRMED, true)),
            "it is pinned; 'yomber unpin' lets it go");
}

TEST(Eviction, SaysWhyAnUploadWaits) {
  auto state = stateOf(Local::HERE, Upload::WAITING);
  state.lastFailure = NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
      {{NSLocalizedDescriptionKey, std::string("the store is out of reach")}});
  EXPECT_EQ(reasonToKeep(state), "it could not be uploaded yet: the store is out of reach");
}

TEST(Eviction, LeavesTheReasonToTheDaemonWhereTheStateHasNone) {
  EXPECT_EQ(reasonToKeep(stateOf(Local::HERE, Upload::CONFIRMED)), "");
}

// ---- What stays although nothing is said against its going
// ---------------------------------------

/// The host is told to stop, and the extension does not: as while it keeps an item for a move.
class RefusedEviction : public ContentFixture {
 protected:
  RefusedEviction() {
    std::ofstream(path) << "content";
    daemon->scriptContent([this](ScriptedContentAnswers& answers) {
      answers.contentState = [](const std::string&) {
        QSContentState state;
        state.local = QSContentState::Local::Here;
        state.upload = QSContentState::Upload::Confirmed;
        return ScriptedContentAnswers::State{.state = state, .error = nullptr};
      };
      answers.evict = [this](const std::string&) { return giveUp(); };
    });
  }
  /// As the daemon does: only what nobody has open.
  NSErrorRef giveUp() {
    const FileDescriptor file(open(onDisk.c_str(), O_RDONLY | O_CLOEXEC));
    if (fcntl(file.get(), F_SETLEASE, F_WRLCK) != 0) return refusal("it is open somewhere");
    isGivenUp = true;
    return nullptr;
  }
  static NSErrorRef refusal(const std::string& reason) {
    return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict,
                                    {{NSLocalizedDescriptionKey, reason}});
  }
  void expectKept(const std::string& reason) {
    const Eviction eviction = evictContent(*content, path);
    EXPECT_EQ(eviction.error, nullptr);
    EXPECT_STREQ(nameOf(eviction.outcome), "kept");
    EXPECT_EQ(eviction.reason, reason);
    EXPECT_FALSE(isGivenUp);
  }

  const std::string path = daemon->root() + "/report.txt";
  std::string onDisk = path;
  std::atomic<bool> isGivenUp{false};
};

TEST_F(RefusedEviction, IsNotMadeBehindTheExtensionsBack) { expectKept("it is open somewhere"); }

TEST_F(RefusedEviction, IsNotMadeEitherWhereTheFileHasAnotherNameOnThisDisk) {
  onDisk = daemon->root() + "/short";
  std::filesystem::rename(path, onDisk);
  daemon->scriptContent([this](ScriptedContentAnswers& answers) {
    answers.physicalLocation = [this](const std::string&) {
      return ScriptedLocation{onDisk, nullptr};
    };
  });
  expectKept("it is open somewhere");
}

TEST_F(RefusedEviction, SaysTheDaemonsReason) {
  daemon->scriptContent([](ScriptedContentAnswers& answers) {
    answers.evict = [](const std::string&) { return refusal("it has several names (hard links)"); };
  });
  expectKept("it has several names (hard links)");
}

TEST_F(RefusedEviction, IsNotAskedForWhereTheFileCannotBeOpened) {
  std::filesystem::remove(path);
  const Eviction eviction = evictContent(*content, path);
  EXPECT_STREQ(nameOf(eviction.outcome), "kept");
  EXPECT_EQ(daemon->callCount("evict"), 0U);
}

}  // namespace
}  // namespace yomber
