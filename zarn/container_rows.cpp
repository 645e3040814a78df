// ItemStore: the containers' folders in the root.
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/file_time.h"
#include "platform/ostrell/constants.h"
#include "zarn/item_store.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr mode_t kPrivate = 0700;

int makeFolder(const std::string& path) {
  return mkdir(path.c_str(), kPrivate) == 0 || errno == EEXIST ? 0 : errno;
}

std::int64_t nanoseconds(const struct statx_timestamp& time) {
  return nanosecondsOf(time.tv_sec, time.tv_nsec);
}

/// The row of a container's folder as the disk has it; the name comes later.
NSErrorRef describe(const std::string& documents, const std::string& containerID, ItemRow& row) {
  struct statx status{};
  if (statx(AT_FDCWD, documents.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME,
            &status) != 0) {
    return NSError::errorWithErrno(errno, documents);
  }
  if (!S_ISDIR(status.stx_mode)) return NSError::errorWithErrno(ENOTDIR, documents);
  row.parent = kRootID;
  row.kind = ItemKind::Folder;
  row.flags = row_flag::kDownloaded;
  row.mode = status.stx_mode;
  row.inode = status.stx_ino;
  row.mtime = nanoseconds(status.stx_mtime);
  row.ctime = nanoseconds(status.stx_ctime);
  row.btime = (status.stx_mask & STATX_BTIME) != 0 ? nanoseconds(status.stx_btime) : row.mtime;
  row.extra = std::make_shared<const ItemExtra>(
      ItemExtra{.tags = {}, .favoriteRank = {}, .lastUsed = {}, .containerID = containerID});
  return nullptr;
}

std::string displayNameOf(const ContainerFolder& container) {
  std::string name = container.displayName.empty() ? container.containerID : container.displayName;
  std::replace_if(name.begin(), name.end(), [](char c) { return c == '/' || c == '\0'; }, '-');
  if (name == "." || name == "..") name = container.containerID;
  name.resize(std::min(name.size(), kMaximumNameLength));
  return name;
}

std::string freeName(WriteTransaction& transaction, const std::string& name, std::uint64_t self) {
  return bouncedName(name, [&](const std::string& candidate) {
    return transaction.isNameTaken(kRootID, candidate, self, {});
  });
}

NSErrorRef keepContainer(WriteTransaction& transaction, const TreeLayout& layout,
                         const ContainerFolder& container) {
  const std::string documents = layout.documents(container.containerID);
  const auto existing = findByContainer(transaction.connection(), container.containerID);
  const std::string wanted = displayNameOf(container);
  if (existing) {
    const std::string name = freeName(transaction, wanted, existing->id);
    if (existing->name == name) return nullptr;
    ItemRow renamed = *existing;
    renamed.name = name;
    transaction.update(*existing, renamed);
    return nullptr;
  }
  ItemRow row;
  row.id = transaction.issueID();
  if (NSErrorRef error = describe(documents, container.containerID, row)) return error;
  row.name = freeName(transaction, wanted, 0);
  transaction.insert(row);
  return nullptr;
}

bool isOfItsOwn(const std::string& containerID) {
  // These stand for the root and for ordinary folders in it.
  return containerID != QSUbiquitousDefaultContainerID &&
         containerID != QSUbiquitousDocumentsContainerID &&
         containerID != QSUbiquitousDesktopContainerID;
}

bool isSafeID(const std::string& containerID) {
  return !containerID.empty() && containerID.front() != '.' &&
         containerID.size() <= kMaximumNameLength && containerID.find('/') == std::string::npos &&
         containerID.find('\0') == std::string::npos;
}

}  // namespace

NSErrorRef ItemStore::setContainers(const std::vector<ContainerFolder>& containers) {
  std::vector<ContainerFolder> own;
  for (const ContainerFolder& container : containers) {
    if (!isOfItsOwn(container.containerID) || !isSafeID(container.containerID)) continue;
    const std::string folder = layout_.containerFolder(container.containerID);
    for (const std::string& path : {folder, layout_.documents(container.containerID)}) {
      if (const int failure = makeFolder(path)) return NSError::errorWithErrno(failure, path);
    }
    own.push_back(container);
  }
  return database_->write([&](WriteTransaction& transaction) -> NSErrorRef {
    for (const ItemRow& row : findContainerFolders(transaction.connection())) {
      const bool isWanted = std::any_of(own.begin(), own.end(), [&](const ContainerFolder& c) {
        return c.containerID == row.extra->containerID;
      });
      if (!isWanted) transaction.remove(row);
    }
    for (const ContainerFolder& container : own) {
      if (NSErrorRef error = keepContainer(transaction, layout_, container)) return error;
    }
    return nullptr;
  });
}

}  // namespace yomber
