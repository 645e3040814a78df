#pragma once

#include <memory>

#include "protocols/sharing.capnp.h"
#include "zarn/content/shares.h"
#include "zarn/drive.h"

namespace yomber {

/// What a client asks about shares, and does with them (protocols/sharing.capnp). Loop thread only.
///
/// Everything asks the store or the database, and so runs on the pool.
class SharingServer final : public protocol::Sharing::Server {
 public:
  explicit SharingServer(std::shared_ptr<Drive> drive) : drive_(std::move(drive)) {}

  kj::Promise<void> checkIfShareable(CheckIfShareableContext context) override;
  kj::Promise<void> copyShare(CopyShareContext context) override;
  kj::Promise<void> newShare(NewShareContext context) override;
  kj::Promise<void> saveShare(SaveShareContext context) override;
  kj::Promise<void> destroyShare(DestroyShareContext context) override;
  kj::Promise<void> copyShareURL(CopyShareURLContext context) override;
  kj::Promise<void> copyShareToken(CopyShareTokenContext context) override;
  kj::Promise<void> refreshSharingState(RefreshSharingStateContext context) override;
  kj::Promise<void> shareOptions(ShareOptionsContext context) override;
  kj::Promise<void> acceptShare(AcceptShareContext context) override;
  kj::Promise<void> sharesWithMe(SharesWithMeContext context) override;

 private:
  /// Runs `work(shares, value)`, which answers an error or nil, on the pool once the database has
  /// rows and somebody is signed in, and gives value and error to `answer(results, value, error)`
  /// on the loop thread.
  template <typename Value, typename Context, typename Work, typename Answer>
  kj::Promise<void> run(Context context, Work work, Answer answer);

  const std::shared_ptr<Drive> drive_;
};

}  // namespace yomber
