#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "zarn/content/content_core.h"

namespace yomber {

/// A document's content, and what is made of it.
struct ThumbnailSubject {
  std::string name;  ///< decides whether it is drawn at all
  RZAsset content;

  enum class Outcome {
    None,         ///< it has no thumbnail
    Ready,        ///< `thumbnail` is in the store
    Later,        ///< not made in time, or its maker died; another attempt may do
    StoreFailed,  ///< with `error`: the store could not be asked, or took nothing
    Unavailable,  ///< there is nobody to draw it
  };
  Outcome outcome = Outcome::None;
  std::optional<RZAsset> thumbnail = {};
  NSErrorRef error = {};
  bool isNew = false;  ///< what came of it is to be stored (`storeThumbnail`)
};

/// Makes thumbnails of what the store has, and brings them there.
///
/// Nothing here fails: what cannot be had now is `Later`, `StoreFailed` or `Unavailable`, what
/// cannot be had at all is `None`. Thread-safety: one thread.
class ThumbnailMaker {
 public:
  ThumbnailMaker(ContentCore& core, std::shared_ptr<ContentStore> store)
      : core_(core), store_(std::move(store)) {}

  /// Whether a document of that name and content may have a thumbnail. Opens no document.
  [[nodiscard]] bool isCandidate(const std::string& name, const RZAsset& content) const;

  /// Equal contents are drawn once, or once by each who may. What is not begun after `patience` is
  /// left for later.
  void make(std::vector<ThumbnailSubject>& subjects, std::chrono::milliseconds patience);

 private:
  /// False when it has to be drawn.
  [[nodiscard]] bool isKnown(ThumbnailSubject& subject) const;
  void draw(ThumbnailSubject& subject);
  NSErrorRef import(int file, RZAsset& asset);
  [[nodiscard]] NSErrorRef commit();

  ContentCore& core_;
  const std::shared_ptr<ContentStore> store_;
  std::unique_ptr<RZAssetGroup> group_;
};

}  // namespace yomber
