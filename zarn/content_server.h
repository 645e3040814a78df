#pragma once

#include <memory>

#include "protocols/content.capnp.h"
#include "zarn/content_engine.h"
#include "zarn/drive.h"

namespace yomber {

/// What a client asks about the content of items, and does with items (protocols/content.capnp).
/// Loop thread only.
///
/// Everything looks at the disk, and so runs on the pool. A call that is dropped is cancelled where
/// that is still possible.
class ContentServer final : public protocol::Content::Server {
 public:
  ContentServer(std::shared_ptr<Drive> drive, std::shared_ptr<ContentEngine> engine);

  kj::Promise<void> startProviding(StartProvidingContext context) override;
  kj::Promise<void> startDownloading(StartDownloadingContext context) override;
  kj::Promise<void> evict(EvictContext context) override;
  kj::Promise<void> setPinned(SetPinnedContext context) override;
  kj::Promise<void> contentState(ContentStateContext context) override;
  kj::Promise<void> transfers(TransfersContext context) override;

  kj::Promise<void> capabilityToMove(CapabilityToMoveContext context) override;
  kj::Promise<void> trash(TrashContext context) override;
  kj::Promise<void> putBackLocation(PutBackLocationContext context) override;
  kj::Promise<void> emptyTrash(EmptyTrashContext context) override;
  kj::Promise<void> physicalLocation(PhysicalLocationContext context) override;
  kj::Promise<void> containerLocation(ContainerLocationContext context) override;
  kj::Promise<void> setLastUsedDate(SetLastUsedDateContext context) override;
  kj::Promise<void> setFavoriteRank(SetFavoriteRankContext context) override;
  kj::Promise<void> setTagNames(SetTagNamesContext context) override;

 private:
  enum class SignedIn { Needed, NotNeeded };
  /// Runs `work(cancelFlag)` on the pool once the database has rows, and gives what it answers, an
  /// `Outcome`, to `answer(outcome)` on the loop thread.
  template <typename Context, typename Work, typename Answer>
  kj::Promise<void> run(Context context, SignedIn signedIn, Work work, Answer answer);
  /// The same for operations of the engine that complete later.
  template <typename Context, typename Begin>
  kj::Promise<void> runUntilDone(Context context, Begin begin);
  template <typename Context, typename Work>
  kj::Promise<void> answerFailure(Context context, Work work);
  template <typename Context, typename Work>
  kj::Promise<void> answerLocation(Context context, SignedIn signedIn, Work work);

  const std::shared_ptr<Drive> drive_;
  const std::shared_ptr<ContentEngine> engine_;
};

}  // namespace yomber
