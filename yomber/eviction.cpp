#include "yomber/eviction.h"

#include <cerrno>

#include "yomber/failure_text.h"

namespace yomber {

const char* nameOf(Eviction::Outcome outcome) {
  switch (outcome) {
    case Eviction::Outcome::Evicted:
      return "evicted";
    case Eviction::Outcome::Absent:
      return "absent";
    case Eviction::Outcome::Kept:
      return "kept";
  }
  return "kept";
}

std::string reasonToKeep(const ContentState& state) {
  if (state.local == ContentState::Local::DOWNLOADING) return "it is being downloaded";
  if (state.isPinned) return "it is pinned; 'yomber unpin' lets it go";
  switch (state.upload) {
    case ContentState::Upload::NONE:
      return "it is not uploaded at all";
    case ContentState::Upload::UPLOADING:
      return "it is being uploaded";
    case ContentState::Upload::WAITING:
      return state.lastFailure ? "it could not be uploaded yet: " + failureText(state.lastFailure)
                               : "it is not uploaded yet";
    case ContentState::Upload::CONFIRMED:
      return "";
  }
  return "";
}

namespace {

Eviction failed(const NSErrorRef& error) {
  Eviction eviction;
  eviction.error = error;
  return eviction;
}

Eviction ended(Eviction::Outcome outcome, const ContentState& state) {
  Eviction eviction;
  eviction.outcome = outcome;
  eviction.localBytes = state.localBytes;
  return eviction;
}

Eviction kept(const ContentState& state, const std::string& reason) {
  Eviction eviction = ended(Eviction::Outcome::Kept, state);
  eviction.reason = reason;
  return eviction;
}

}  // namespace

Eviction evictContent(const DriveContent& content, const std::string& path) {
  ContentState state;
  if (NSErrorRef error = content.state(path, state)) return failed(error);
  if (state.local == ContentState::Local::FAULT) return ended(Eviction::Outcome::Absent, state);

  const NSErrorRef refused = content.stopProviding(path);
  if (refused && refused->is(NSPOSIXErrorDomain, EBUSY)) {
    return kept(state, failureText(refused));
  }
  if (refused) return failed(refused);
  if (NSErrorRef error = content.state(path, state)) return failed(error);
  if (state.local == ContentState::Local::FAULT) return ended(Eviction::Outcome::Evicted, state);
  if (const std::string reason = reasonToKeep(state); !reason.empty()) return kept(state, reason);

  // The state does not say why: the daemon's own refusal does.
  if (const NSErrorRef reason = content.evict(path)) {
    return kept(state, failureText(reason));
  }
  if (NSErrorRef error = content.state(path, state)) return failed(error);
  return ended(Eviction::Outcome::Evicted, state);
}

}  // namespace yomber
