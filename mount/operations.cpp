#include "mount/operations.h"

#include "mount/file_system.h"

namespace yomber {
namespace {

FileSystem& filesOf(fuse_req_t request) {
  return static_cast<KernelSession*>(fuse_req_userdata(request))->files();
}

/// A request about a node.
template <auto method>
struct OnNode;
template <typename... Arguments, void (FileSystem::*method)(fuse_req_t, Node&, Arguments...)>
struct OnNode<method> {
  static void call(fuse_req_t request, fuse_ino_t node, Arguments... arguments) {
    FileSystem& files = filesOf(request);
    (files.*method)(request, files.nodeOf(node), arguments...);
  }
};

/// The first version of the protocol whose kernels ask for as much of a folder as its reader has
/// room for: before, a page at a time, which room for attributes that are not told makes several.
constexpr unsigned kAsksForMuch = 44;

void begin(void* session, fuse_conn_info* connection) {
  constexpr unsigned kWanted = FUSE_CAP_PARALLEL_DIROPS | FUSE_CAP_CACHE_SYMLINKS |
                               FUSE_CAP_READDIRPLUS | FUSE_CAP_AUTO_INVAL_DATA |
                               FUSE_CAP_ATOMIC_O_TRUNC | FUSE_CAP_ASYNC_READ | FUSE_CAP_EXPIRE_ONLY;
  const bool isOurChoice = connection->proto_minor >= kAsksForMuch;
  static_cast<KernelSession*>(session)->files().setChoosesAttributes(isOurChoice);
  const unsigned itsChoice = isOurChoice ? 0 : FUSE_CAP_READDIRPLUS_AUTO;
  connection->want = (kWanted | itsChoice) & connection->capable;
  connection->time_gran = 1;
  // Requests that wait for content must not hold up those that do not.
  constexpr unsigned kWaiting = 1024;
  connection->max_background = kWaiting;
  connection->congestion_threshold = kWaiting;
}

void symlink(fuse_req_t request, const char* target, fuse_ino_t folder, const char* name) {
  filesOf(request).symlink(request, target, folder, name);
}

void forgetMany(fuse_req_t request, std::size_t count, fuse_forget_data* forgotten) {
  filesOf(request).forgetMany(request, count, forgotten);
}

}  // namespace

fuse_lowlevel_ops mountOperations() {
  fuse_lowlevel_ops operations{};
  operations.init = begin;
  operations.lookup = OnNode<&FileSystem::lookup>::call;
  operations.forget = OnNode<&FileSystem::forget>::call;
  operations.forget_multi = forgetMany;
  operations.getattr = OnNode<&FileSystem::getattr>::call;
  operations.setattr = OnNode<&FileSystem::setattr>::call;
  operations.readlink = OnNode<&FileSystem::readlink>::call;
  operations.statfs = OnNode<&FileSystem::statfs>::call;
  operations.setxattr = OnNode<&FileSystem::setxattr>::call;
  operations.getxattr = OnNode<&FileSystem::getxattr>::call;
  operations.listxattr = OnNode<&FileSystem::listxattr>::call;
  operations.removexattr = OnNode<&FileSystem::removexattr>::call;
  operations.opendir = OnNode<&FileSystem::opendir>::call;
  operations.readdir = OnNode<&FileSystem::readdir>::call;
  operations.readdirplus = OnNode<&FileSystem::readdirplus>::call;
  operations.releasedir = OnNode<&FileSystem::releasedir>::call;
  operations.fsyncdir = OnNode<&FileSystem::fsyncdir>::call;
  operations.mknod = OnNode<&FileSystem::mknod>::call;
  operations.mkdir = OnNode<&FileSystem::mkdir>::call;
  operations.symlink = symlink;
  operations.link = OnNode<&FileSystem::link>::call;
  operations.unlink = OnNode<&FileSystem::unlink>::call;
  operations.rmdir = OnNode<&FileSystem::rmdir>::call;
  operations.rename = OnNode<&FileSystem::rename>::call;
  operations.create = OnNode<&FileSystem::create>::call;
  operations.open = OnNode<&FileSystem::open>::call;
  operations.release = OnNode<&FileSystem::release>::call;
  operations.read = OnNode<&FileSystem::read>::call;
  operations.write = OnNode<&FileSystem::write>::call;
  operations.fsync = OnNode<&FileSystem::fsync>::call;
  operations.fallocate = OnNode<&FileSystem::fallocate>::call;
  operations.lseek = OnNode<&FileSystem::lseek>::call;
  operations.copy_file_range = OnNode<&FileSystem::copyFileRange>::call;
  return operations;
}

}  // namespace yomber
