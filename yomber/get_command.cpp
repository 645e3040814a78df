#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/fileprovider/staging_folder.h"
#include "platform/foundation/bounced_name.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/tree_copy.h"
#include "platform/foundation/url.h"
#include "yomber/clash_policy.h"
#include "yomber/command.h"
#include "yomber/drive_content.h"
#include "yomber/item_output.h"
#include "yomber/item_walk.h"
#include "yomber/side_by_side.h"

namespace yomber {

namespace {

constexpr std::size_t atATime = 16;

struct GetOptions {
  std::string item;
  std::string destination = ".";
  ClashPolicy clashes;
};

/// What is copied out of the drive: made whole in a staging folder beside its destination.
class Copy {
 public:
  Copy(const DriveContent& content, std::string staged)
      : content_(content), staged_(std::move(staged)) {}

  /// Folders are made at once, everything else is kept for `fill`.
  void add(const WalkedItem& found) {
    if (found.item.kind == ItemKind::Folder) {
      if (mkdir((staged_ + found.relative).c_str(), S_IRWXU) != 0) fail(errno, found.relative);
      folders_.push_back(found);
    } else {
      files_.push_back(found);
    }
  }

  NSErrorRef fill() {
    sideBySide(files_.size(), atATime, [&](std::size_t index) {
      if (const NSErrorRef error = copyFile(files_[index])) keep(error);
    });
    // The deepest first: filling a folder changes its date.
    for (auto folder = folders_.rbegin(); folder != folders_.rend(); ++folder) {
      copyDates(*folder);
    }
    LockGuard guard(mutex_);
    return failure_;
  }

 private:
  NSErrorRef copyFile(const WalkedItem& found) const {
    ipc::Remote<protocol::Need> need;
    if (found.item.kind == ItemKind::Document) {
      if (NSErrorRef error = content_.provide(found.path, &need)) return error;
    }
    TreeCopy copy(TreeCopy::Identity::New);
    return copy.run(onDisk(found.path), staged_ + found.relative);
  }

  /// Where the item is on this disk, where that is elsewhere.
  std::string onDisk(const std::string& path) const {
    struct stat status{};
    std::string physical;
    if (lstat(path.c_str(), &status) == 0 || content_.physicalLocation(path, physical)) return path;
    return physical;
  }

  void copyDates(const WalkedItem& folder) const {
    struct stat status{};
    if (stat(onDisk(folder.path).c_str(), &status) != 0) return;
    const std::array<std::timespec, 2> times{status.st_atim, status.st_mtim};
    const std::string copy = staged_ + folder.relative;
    (void)chmod(copy.c_str(), (status.st_mode & 0777U) | S_IRWXU);
    (void)utimensat(AT_FDCWD, copy.c_str(), times.data(), 0);
  }

  void keep(const NSErrorRef& error) {
    LockGuard guard(mutex_);
    if (!failure_) failure_ = error;
  }
  void fail(int number, const std::string& path) { keep(NSError::errorWithErrno(number, path)); }

  const DriveContent& content_;
  const std::string staged_;
  std::vector<WalkedItem> files_;
  std::vector<WalkedItem> folders_;
  Mutex mutex_;
  NSErrorRef failure_ GUARDED_BY(mutex_);
};

/// Puts what is staged in its place; answers where that is.
NSErrorRef place(const std::string& staged, const ClashPolicy& clashes, const NSURL& wanted,
                 std::string& placed) {
  const std::string folder = wanted.URLByDeletingLastPathComponent()->path();
  int number = 0;
  const auto take = [&](const std::string& name) {
    placed = folder == "/" ? folder + name : folder + "/" + name;
    number = renameat2(AT_FDCWD, staged.c_str(), AT_FDCWD, placed.c_str(), RENAME_NOREPLACE) == 0
                 ? 0
                 : errno;
    return number == EEXIST && clashes.keepBoth;
  };
  (void)bouncedName(wanted.lastPathComponent(), take);
  if (number == EEXIST && clashes.replace) {
    const bool swapped =
        renameat2(AT_FDCWD, staged.c_str(), AT_FDCWD, placed.c_str(), RENAME_EXCHANGE) == 0;
    number = swapped ? 0 : errno;
  }
  if (number != EEXIST) return number == 0 ? nullptr : NSError::errorWithErrno(number, placed);
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileWriteFileExistsError,
      {{NSFilePathErrorKey, placed},
       {NSLocalizedDescriptionKey,
        placed + " is already there; use --keep-both for another name, or --replace"}});
}

/// Where the copy goes: into a folder that is there, else under the name given.
NSURL destinationFor(const GetOptions& options, const std::string& name) {
  std::error_code failure;
  const std::string given = std::filesystem::absolute(options.destination, failure).string();
  struct stat status{};
  const bool isFolder = stat(given.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
  return NSURL(isFolder ? given + "/" + name : given);
}

NSErrorRef get(DriveClient& client, const GetOptions& options, std::string& placed) {
  NSErrorRef error;
  const auto content = DriveContent::open(client, &error);
  if (!content) return error;
  std::unique_ptr<StagingFolder> staging;
  std::unique_ptr<Copy> copy;
  std::optional<NSURL> destination;
  int number = 0;
  error = walkItem(client, options.item, [&](const WalkedItem& found) {
    if (!copy) {
      const std::string name = NSURL(found.path).lastPathComponent();
      destination.emplace(destinationFor(options, name).path());
      staging = StagingFolder::make(destination->URLByDeletingLastPathComponent()->path());
      number = staging ? 0 : errno;
      if (!staging) return false;
      copy = std::make_unique<Copy>(*content, staging->content());
    }
    copy->add(found);
    return true;
  });
  if (error) return error;
  if (!staging) return NSError::errorWithErrno(number, destination ? destination->path() : "");
  if (NSErrorRef failure = copy->fill()) return failure;
  return place(staging->content(), options.clashes, *destination, placed);
}

void runGet(CommandContext& context, const GetOptions& options) {
  DriveClient client(context.paths());
  std::string placed;
  if (const NSErrorRef error = get(client, options, placed)) return context.fail(error);
  context.print({{"path", placed}}, printableName(placed));
}

}  // namespace

void addGetCommand(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<GetOptions>();
  CLI::App* command = app.add_subcommand("get", "Copy an item out of the drive");
  command->add_option("item", options->item, itemHelp)->required();
  command->add_option("path", options->destination,
                      "A folder of this machine, or the copy's name; the working directory by "
                      "default");
  addClashOptions(*command, options->clashes);
  command->callback([&context, options] { runGet(context, *options); });
}

}  // namespace yomber
