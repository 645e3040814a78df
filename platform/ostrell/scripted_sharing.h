#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/rozzel/share.h"

namespace yomber {

/// What the scripted daemon answers about sharing; see ScriptedDaemon::Answers. Of what is left
/// alone, everything can be shared and nothing is (QSOstrellErrorNotShared), a new share is a
/// document's by "someone", saving answers the share with the tag "1" and a link, tokens are
/// "share" and "base", a link leads to "d:5", and everything else succeeds.
struct ScriptedSharingAnswers {
  struct Shareable {
    bool isShareable = true;
    NSErrorRef error;  ///< sent besides when set
  };
  /// Without a share and an error, one that cannot be understood is sent.
  struct Share {
    RZShareRef share;
    std::optional<std::string> rootPath = {};
    NSErrorRef error = {};
  };
  struct Tokens {
    std::string share;
    std::string base;
    NSErrorRef error = {};
  };
  struct Options {
    bool isShared = false;
    bool mayWrite = false;
    bool isSharedItself = false;
    std::optional<std::string> folderName = {};
    NSErrorRef error = {};
  };
  struct Text {
    std::optional<std::string> text;
    NSErrorRef error = {};
  };

  using Path = const std::string&;
  std::function<Shareable(std::uint64_t rawID)> checkIfShareable;
  std::function<Share(Path path)> copyShare;
  std::function<Share(Path path)> newShare;
  std::function<Share(const RZShareRef& share)> saveShare;
  std::function<NSErrorRef(const RZShareRef& share)> destroyShare;
  std::function<Text(Path path, const std::string& documentType)> copyShareURL;
  std::function<Tokens(Path path)> copyShareToken;
  std::function<NSErrorRef(const std::string& identifier)> refreshSharingState;
  std::function<Options(const std::string& identifier)> shareOptions;
  std::function<Text(const std::string& url)> acceptShare;
  std::function<std::vector<RZShareRef>()> sharesWithMe;
};

/// A share of "someone", of a document with that title unless `type` says otherwise. Without a tag,
/// one that the store does not know.
[[nodiscard]] RZShareRef scriptedShare(const std::string& title, const std::string& changeTag = "1",
                                       const std::string& type = RZShareTypeDocument);

}  // namespace yomber
