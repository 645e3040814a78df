#include "yomber/eviction.h"

#include <gtest/gtest.h>

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

}  // namespace
}  // namespace yomber
