#include "platform/ostrell/item_additions.h"

#include <fstream>
#include <string>
#include <string_view>

#include "platform/foundation/file_manager.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/locations.h"
#include "platform/ostrell/trash_info.h"
#include "platform/ostrell/url_additions.h"
#include "platform/ostrell/waiting_call.h"

namespace yomber {
namespace {

/// Bytes; longer than any path can make it.
constexpr std::size_t kMaximumTrashInfoSize = 64 * std::size_t{1024};

/// The two containers whose Documents are ordinary folders, which the user may remove.
bool isInFolderOfRoot(const QSContainer& container) {
  return container.containerID() == QSUbiquitousDocumentsContainerID ||
         container.containerID() == QSUbiquitousDesktopContainerID;
}

bool holds(const QSContainer& container, std::string_view path) {
  const auto& documents = container.documentsURL();
  if (!documents) return false;
  if (path != documents->path() && !isPathBelow(path, documents->path())) return false;
  return !isInFolderOfRoot(container) ||
         NSFileManager::defaultManager().isDirectoryAtPath(documents->path());
}

/// What the trash says of the item in it that the path is, or is in; empty when it says nothing.
std::string containerOfTrashed(std::string_view path, const DriveLocations& locations) {
  const std::string files = locations.trashFiles() + "/";
  if (!path.starts_with(files)) return {};
  const std::string_view below = path.substr(files.size());
  const std::string name(below.substr(0, below.find('/')));
  std::ifstream file(locations.trashInfo() + "/" + name + std::string(kTrashInfoSuffix));
  std::string text(kMaximumTrashInfoSize, '\0');
  file.read(text.data(), static_cast<std::streamsize>(text.size()));
  text.resize(static_cast<std::size_t>(file.gcount()));
  const auto info = parseTrashInfo(text);
  return info ? info->containerID : std::string();
}

/// The innermost container that holds the path.
QSContainerRef containerHolding(std::string_view path) {
  QSContainerRef innermost;
  for (const auto& each : QSContainer::allContainers()) {
    if (!holds(*each, path)) continue;
    const bool isDeeper = !innermost || each->documentsURL()->path().size() >
                                            innermost->documentsURL()->path().size();
    if (isDeeper) innermost = each;
  }
  return innermost;
}

}  // namespace

bool qs_isPromiseURL(const NSURLRef& url) {
  return qs_isInSyncedLocation(url) &&
         isPathBelow(url->path(), DaemonLink::current()->locations().promises());
}

bool qs_isParentOfURL(const NSURLRef& url, const NSURLRef& other) {
  return url && other && isPathBelow(other->path(), url->path());
}

std::uint32_t qs_capabilityToMoveToURL(const NSURLRef& url, const NSURLRef& toURL,
                                       NSErrorRef* error) {
  if (!url || !toURL) return QSMoveCapabilityNone;
  std::uint32_t capability = QSMoveCapabilityNone;
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  proxy->capabilityToMoveItemAtURL(url, toURL, [&](std::uint32_t bits, const NSErrorRef& failure) {
    capability = bits;
    proxy->setBoolResult(!failure, failure);
  });
  if (const auto failure = proxy->error()) storeError(error, failure);
  return capability;
}

NSURLRef qs_physicalURL(const NSURLRef& url) {
  if (!qs_isInSyncedLocation(url)) return url;
  auto physical = waitForURL(
      url,
      [&](QSDaemonProtocol& daemon, const auto& reply) {
        daemon.physicalURLForItemAtURL(url, reply);
      },
      nullptr);
  return physical ? physical : url;
}

bool qs_setTagNames(const NSURLRef& url, const std::vector<std::string>& names, NSErrorRef* error) {
  const NSErrorRef failure = waitForReply(url, [&](QSDaemonProtocol& daemon, const auto& reply) {
    daemon.setTagNames(names, url, reply);
  });
  if (failure) storeError(error, failure);
  return failure == nullptr;
}

QSContainerRef qs_ostrellContainer(const NSURLRef& url) {
  if (!url) return nullptr;
  const auto& locations = DaemonLink::current()->locations();
  if (!locations.isInTrash(url->path())) return containerHolding(url->path());
  const auto containers = QSContainer::allContainersByContainerID();
  const auto known = containers.find(containerOfTrashed(url->path(), locations));
  if (known != containers.end()) return known->second;
  // Other programs' trash information has nothing but where the item was.
  const auto origin = qs_putBackURLForTrashedItemAtURL(NSFileManager::defaultManager(), url);
  if (auto container = origin ? containerHolding(origin->path()) : nullptr) return container;
  const auto own = containers.find(QSUbiquitousDefaultContainerID);
  return own == containers.end() ? nullptr : own->second;
}

}  // namespace yomber
