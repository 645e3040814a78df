#include "zarn/content/thumbnail_maker.h"

#include <cerrno>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/glimmet/content_types.h"
#include "zarn/content/thumbnail_rows.h"

namespace yomber {
namespace {

constexpr std::uint32_t kSide = 1024;

FaultPoint thumbnailDrawn("zarn.thumbnail.drawn");

using Outcome = ThumbnailSubject::Outcome;

/// What a failed attempt to draw means.
Outcome outcomeOf(const NSErrorRef& error) {
  if (error->is(NSCocoaErrorDomain, NSFileReadCorruptFileError) ||
      error->is(NSPOSIXErrorDomain, EFBIG))
    return Outcome::None;
  const bool hasDied = error->is(NSPOSIXErrorDomain, EIO) || error->is(NSPOSIXErrorDomain, ETIME) ||
                       error->is(NSPOSIXErrorDomain, EPROTO);
  return hasDied ? Outcome::Later : Outcome::Unavailable;
}

void noteStoreFailed(ThumbnailSubject& subject, const NSErrorRef& error) {
  subject.outcome = Outcome::StoreFailed;
  subject.error = error;
  subject.thumbnail.reset();
  subject.isNew = false;
}

/// Those of one batch that have been seen to, by their content.
class Twins {
 public:
  /// One that says what becomes of this one too: whoever cannot draw it under another name need not
  /// be who draws it under this one.
  [[nodiscard]] const ThumbnailSubject* find(const ThumbnailSubject& subject) const {
    const auto found = seen_.find(subject.content.hash);
    if (found == seen_.end()) return nullptr;
    for (const ThumbnailSubject* const each : found->second) {
      if (each->outcome == Outcome::Ready || typeOf(*each) == typeOf(subject)) return each;
    }
    return nullptr;
  }
  void add(const ThumbnailSubject& subject) { seen_[subject.content.hash].push_back(&subject); }

 private:
  static const std::string& typeOf(const ThumbnailSubject& subject) {
    return ContentTypes::system().typeForName(subject.name);
  }

  std::map<RZAssetHash, std::vector<const ThumbnailSubject*>> seen_;
};

}  // namespace

bool ThumbnailMaker::isCandidate(const std::string& name, const RZAsset& content) const {
  return content.size > 0 && core_.drawer->mayDraw(name);
}

bool ThumbnailMaker::isKnown(ThumbnailSubject& subject) const {
  std::optional<ThumbnailRow> row;
  const NSErrorRef error = core_.database().read(
      [&](Connection& connection) { row = findThumbnail(connection, subject.content); });
  if (error || !row) return false;
  if (!row->thumbnail) return true;
  // The store drops what nobody has referred to for long.
  FileDescriptor descriptor;
  if (const NSErrorRef failure = store_->open(*row->thumbnail, descriptor)) {
    if (!isOutOfReach(failure)) return false;
    noteStoreFailed(subject, failure);
    return true;
  }
  subject.outcome = Outcome::Ready;
  subject.thumbnail = row->thumbnail;
  return true;
}

NSErrorRef ThumbnailMaker::import(int file, RZAsset& asset) {
  if (thumbnailDrawn.hit()) return NSError::errorWithErrno(EIO);
  NSErrorRef error;
  if (!group_) group_ = store_->newGroup(&error);
  return group_ ? store_->take(*group_, file, {}, asset) : error;
}

void ThumbnailMaker::draw(ThumbnailSubject& subject) {
  FileDescriptor original;
  NSErrorRef error = store_->open(subject.content, original);
  if (error) return noteStoreFailed(subject, error);
  // Nothing is remembered of the content: under another name it may be drawn.
  if (!core_.drawer->mayDraw(subject.name, original.get())) return;
  const auto picture = core_.drawer->draw(subject.name, original.get(), kSide, &error);
  if (!picture) {
    subject.outcome = outcomeOf(error);
    subject.isNew = subject.outcome == Outcome::None;
    if (subject.outcome == Outcome::None) return;
    log_default(defaultLog(), "[NOTICE] no thumbnail of %s: %@", subject.name, error);
    return;
  }
  RZAsset thumbnail;
  error = import(picture->file.get(), thumbnail);
  if (error) return noteStoreFailed(subject, error);
  subject.outcome = Outcome::Ready;
  subject.thumbnail = thumbnail;
  subject.isNew = true;
}

NSErrorRef ThumbnailMaker::commit() {
  const auto group = std::exchange(group_, nullptr);
  return group ? store_->commit(*group) : nullptr;
}

void ThumbnailMaker::make(std::vector<ThumbnailSubject>& subjects,
                          std::chrono::milliseconds patience) {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  Twins twins;
  for (ThumbnailSubject& subject : subjects) {
    if (!isCandidate(subject.name, subject.content)) continue;
    if (const ThumbnailSubject* const twin = twins.find(subject)) {
      subject.outcome = twin->outcome;
      subject.thumbnail = twin->thumbnail;
      subject.error = twin->error;
      continue;
    }
    twins.add(subject);
    if (isKnown(subject)) continue;
    if (core_.queue->isEnding() || std::chrono::steady_clock::now() > deadline) {
      subject.outcome = Outcome::Later;
    } else {
      draw(subject);
    }
  }
  const NSErrorRef error = commit();
  if (!error) return;
  for (ThumbnailSubject& subject : subjects) {
    if (subject.outcome == Outcome::Ready) noteStoreFailed(subject, error);
  }
}

}  // namespace yomber
