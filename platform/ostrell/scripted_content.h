#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/ostrell/content_protocol.h"
#include "platform/ostrell/move_capability.h"

namespace yomber {

/// A location that the scripted daemon answers.
struct ScriptedLocation {
  std::string path;
  NSErrorRef error;  ///< sent instead when set
};

/// What the scripted daemon answers about content; see ScriptedDaemon::Answers. Of what is left
/// alone, `trash` moves the file and the item that was added, `containerLocation` knows the
/// containers that were added, locations are their own physical ones, a put-back location fails
/// with Cocoa 4, moves stay in their container, and everything else succeeds and does nothing.
struct ScriptedContentAnswers {
  struct Capability {
    std::uint32_t bits = QSMoveCapabilityNone;
    NSErrorRef error;
  };
  struct ContainerLocation {
    std::optional<std::string> path;
    NSErrorRef error;
  };
  struct State {
    QSContentState state;
    NSErrorRef error;
  };

  using Path = const std::string&;
  std::function<NSErrorRef(Path path, std::uint64_t options)> startProviding;
  std::function<NSErrorRef(const std::vector<std::string>& paths, std::uint64_t options)>
      startDownloading;
  std::function<NSErrorRef(Path path)> evict;
  std::function<NSErrorRef(Path path, bool pinned)> setPinned;
  std::function<Capability(Path source, Path destination)> capabilityToMove;
  std::function<ScriptedLocation(Path path)> trash;
  std::function<ScriptedLocation(Path path)> putBackLocation;
  std::function<NSErrorRef()> emptyTrash;
  std::function<ScriptedLocation(Path path)> physicalLocation;
  std::function<ContainerLocation(const std::string& containerID, bool recreateDocuments)>
      containerLocation;
  std::function<NSErrorRef(Path path, std::optional<std::int64_t> date)> setLastUsedDate;
  std::function<NSErrorRef(Path path, std::optional<std::int64_t> rank)> setFavoriteRank;
  std::function<NSErrorRef(Path path, const std::vector<std::string>& names)> setTagNames;
  std::function<State(Path path)> contentState;
  std::function<QSTransfers()> transfers;
};

}  // namespace yomber
