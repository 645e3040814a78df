#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "protocols/daemon.capnp.h"
#include "zarn/drive.h"

namespace yomber {

/// What one connection sees of the daemon (protocols/daemon.capnp). Loop thread only.
///
/// Lookups by id and by location are answered right here: they take some ten microseconds, and are
/// what a file browser waits for. Everything else that reads or scans runs on the pool; so does the
/// lookup of a location that has no row yet, but a file.
class DaemonServer final : public protocol::Daemon::Server {
 public:
  explicit DaemonServer(std::shared_ptr<Drive> drive);
  ~DaemonServer();

  kj::Promise<void> describe(DescribeContext context) override;

  kj::Promise<void> urlForItemIdentifier(UrlForItemIdentifierContext context) override;
  kj::Promise<void> documentLocation(DocumentLocationContext context) override;
  kj::Promise<void> itemAtLocation(ItemAtLocationContext context) override;
  kj::Promise<void> containers(ContainersContext context) override;
  kj::Promise<void> containerItem(ContainerItemContext context) override;

  kj::Promise<void> enumerateItemsInFolder(EnumerateItemsInFolderContext context) override;
  kj::Promise<void> enumerateAllFolders(EnumerateAllFoldersContext context) override;

  kj::Promise<void> currentNotifRank(CurrentNotifRankContext context) override;
  kj::Promise<void> enumerateWorkingSetChanges(EnumerateWorkingSetChangesContext context) override;

  kj::Promise<void> getItemUpdateSender(GetItemUpdateSenderContext context) override;

  kj::Promise<void> account(AccountContext context) override;
  kj::Promise<void> signIn(SignInContext context) override;
  kj::Promise<void> signOut(SignOutContext context) override;

  kj::Promise<void> observe(ObserveContext context) override;
  kj::Promise<void> registerHost(RegisterHostContext context) override;

  kj::Promise<void> status(StatusContext context) override;

  kj::Promise<void> contentRecords(ContentRecordsContext context) override;
  kj::Promise<void> content(ContentContext context) override;
  kj::Promise<void> sharing(SharingContext context) override;

  kj::Promise<void> observeTree(ObserveTreeContext context) override;

 private:
  class RegistrationServer;

  /// Runs `work` once the database has rows, at once when it has; it gets the failure otherwise.
  template <typename Context, typename Work>
  kj::Promise<void> whenScanned(Context context, Work work);
  template <typename Context, typename Find>
  kj::Promise<void> answerPage(Context context, Find find);
  template <typename Context>
  kj::Promise<void> scanAndAnswer(Context context, std::string path);

  const std::shared_ptr<Drive> drive_;
  const std::uint64_t connection_;  // names this connection to the listing
};

}  // namespace yomber
