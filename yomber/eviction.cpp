#include "yomber/eviction.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/foundation/file_descriptor.h"
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

/// The daemon's own reason; nil when the content has gone meanwhile. Asked with the file open, with
/// which nothing is given up: the extension may have kept it for a move, of which the daemon does
/// not know.
NSErrorRef askForReason(const DriveContent& content, const std::string& path) {
  struct stat status{};
  std::string onDisk = path;
  const bool isElsewhere = lstat(path.c_str(), &status) != 0;
  if (isElsewhere) {
    if (NSErrorRef error = content.physicalLocation(path, onDisk)) return error;
  }
  constexpr int kOpening = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  const FileDescriptor file(open(onDisk.c_str(), kOpening));
  return file ? content.evict(path) : NSError::errorWithErrno(errno, onDisk);
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

  if (const NSErrorRef reason = askForReason(content, path)) {
    return kept(state, failureText(reason));
  }
  if (NSErrorRef error = content.state(path, state)) return failed(error);
  return ended(Eviction::Outcome::Evicted, state);
}

}  // namespace yomber
