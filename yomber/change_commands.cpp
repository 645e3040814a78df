#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <iostream>
#include <memory>
#include <optional>
#include <system_error>

#include <nlohmann/json.hpp>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/staging_folder.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/tree_copy.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/locations.h"
#include "yomber/clash_policy.h"
#include "yomber/command.h"
#include "yomber/drive_changes.h"
#include "yomber/drive_content.h"
#include "yomber/item_output.h"
#include "yomber/side_by_side.h"

namespace yomber {

namespace {

/// So many changes are under way at a time: the disk syncs many as fast as one.
constexpr std::size_t atATime = 16;

struct ChangeOptions {
  std::vector<std::string> arguments;
  std::string item;    ///< where a command takes just one
  std::string target;  ///< a folder
  std::string newName;
  ClashPolicy clashes;
  bool withParents = false;
  bool list = false;
  bool empty = false;
};

/// What a command on items needs; prints what comes of each.
struct ChangeRun {
  explicit ChangeRun(CommandContext& given) : context(given), client(given.paths()) {
    NSErrorRef error;
    changes = DriveChanges::open(client, &error);
    if (!changes) context.fail(error);
  }
  ChangeRun(const ChangeRun&) = delete;
  ChangeRun& operator=(const ChangeRun&) = delete;

  [[nodiscard]] bool isReady() const { return changes.has_value(); }

  /// False, and said so, when there is no such item.
  bool identify(const std::string& argument, std::string& identifier) {
    const NSErrorRef error = client.identifierFor(argument, identifier);
    if (error) context.fail(error);
    return !error;
  }

  /// Any thread.
  void report(const ChangeResult& result, const std::string& name) {
    LockGuard guard(mutex);
    if (result.error) return context.fail(result.error);
    if (result.item) {
      std::cout << itemLine(*result.item, context.json ? OutputForm::Json : OutputForm::Short);
    } else if (context.json) {
      std::cout << nlohmann::ordered_json{{"done", true}}.dump();
    } else {
      std::cout << printableName(name);
    }
    std::cout << std::endl;
  }

  /// Makes a change of each item that the arguments name.
  void forEach(const std::vector<std::string>& arguments,
               const std::function<ChangeResult(const std::string& identifier)>& change) {
    std::vector<std::pair<std::string, std::string>> items;
    for (const std::string& argument : arguments) {
      std::string identifier;
      if (identify(argument, identifier)) items.emplace_back(argument, identifier);
    }
    sideBySide(items.size(), atATime,
               [&](std::size_t index) { report(change(items[index].second), items[index].first); });
  }

  CommandContext& context;
  DriveClient client;
  std::optional<DriveChanges> changes;
  Mutex mutex;
};

/// A path of this machine, as given to the command.
std::string absolutePath(const std::string& given) {
  std::error_code failure;  // without a working directory the path stays relative, and is refused
  const auto path = std::filesystem::absolute(given, failure).lexically_normal();
  return path.has_filename() ? path.string() : path.parent_path().string();
}

/// Something of this machine under other names than its own: one copy of it, which is given one
/// name after the other.
class OtherNames {
 public:
  OtherNames(std::string folder, std::string source)
      : folder_(std::move(folder)), source_(std::move(source)) {}

  /// `path` is that of the copy, which goes with this object.
  NSErrorRef give(const std::string& name, std::string& path) {
    if (!staging_) staging_ = StagingFolder::make(folder_);
    if (!staging_) return NSError::errorWithErrno(errno, folder_);
    path = staging_->path() + "/" + name;
    if (NSErrorRef error = copy_.empty() ? makeCopy(path) : renameCopy(path)) return error;
    copy_ = path;
    return nullptr;
  }

 private:
  NSErrorRef makeCopy(const std::string& path) const {
    static FaultPoint copied("yomber.put.copied");
    if (NSErrorRef error = TreeCopy(TreeCopy::Identity::New).run(source_, path)) return error;
    (void)copied.hit();
    return nullptr;
  }
  NSErrorRef renameCopy(const std::string& path) const {
    if (rename(copy_.c_str(), path.c_str()) == 0) return nullptr;
    return NSError::errorWithErrno(errno, path);
  }

  const std::string folder_;
  const std::string source_;
  std::unique_ptr<StagingFolder> staging_;
  std::string copy_;  ///< empty: there is none yet
};

/// False, and said so, when there is no such folder to put something into.
bool identifyTarget(ChangeRun& run, const std::string& target, std::string& identifier) {
  const NSErrorRef error = run.client.identifierFor(target, identifier);
  if (!error) return true;
  const bool isMissing = exitCodeFor(error) == ExitCode::NoSuchItem;
  if (!isMissing) {
    run.context.fail(error);
  } else {
    run.context.fail(ExitCode::NoSuchItem,
                     "there is no folder " + printableName(target) +
                         " in the drive; the folder comes last, and / is the root");
  }
  return false;
}

/// Without --to, the last of several arguments is the folder, as shells have it.
void takeTarget(ChangeOptions& options) {
  if (!options.target.empty() || options.arguments.size() < 2) return;
  options.target = std::move(options.arguments.back());
  options.arguments.pop_back();
}

void runPut(CommandContext& context, const ChangeOptions& given) {
  ChangeOptions options = given;
  takeTarget(options);
  ChangeRun run(context);
  std::string parent;
  if (!run.isReady() || !identifyTarget(run, options.target, parent)) return;
  const DrivePaths paths = context.paths();
  sideBySide(options.arguments.size(), atATime, [&](std::size_t index) {
    const std::string source = absolutePath(options.arguments[index]);
    const std::string own = NSURL(source).lastPathComponent();
    OtherNames others(paths.privateDirectory, source);
    const auto attempt = [&](const std::string& name) -> ChangeResult {
      std::string path = source;
      const NSErrorRef error = name == own ? nullptr : others.give(name, path);
      if (error) return {std::nullopt, error};
      return run.changes->importDocument(path, parent);
    };
    run.report(changeWithPolicy(*run.changes, options.clashes, own, attempt), own);
  });
}

/// Makes every folder on the way from the drive's root.
ChangeResult makeFolders(const DriveChanges& changes, const std::string& path) {
  ChangeResult result;
  std::string parent = NSFileProviderRootContainerItemIdentifier;
  for (std::size_t at = 1; at <= path.size() && !result.error;) {
    const std::size_t slash = std::min(path.find('/', at), path.size());
    result = changes.createDirectory(path.substr(at, slash - at), parent);
    if (result.item) parent = result.item->identifier;
    at = slash + 1;
  }
  return result;
}

void makeFolder(ChangeRun& run, const std::string& argument, bool withParents) {
  NSURLRef path = NSURL::fileURLWithPath("/" + argument);
  if (!path) return run.context.fail(NSError::errorWithErrno(EINVAL, argument));
  if (withParents) {
    const DriveLocations places(run.client.paths().home);
    const bool isInTree = isPathBelow(path->path(), places.root());
    return run.report(makeFolders(*run.changes, isInTree ? path->path().substr(places.root().size())
                                                         : path->path()),
                      argument);
  }
  std::string parent;
  if (!run.identify(path->URLByDeletingLastPathComponent()->path(), parent)) return;
  run.report(run.changes->createDirectory(path->lastPathComponent(), parent), argument);
}

void runMakeFolder(CommandContext& context, const ChangeOptions& options) {
  ChangeRun run(context);
  if (!run.isReady()) return;
  for (const std::string& argument : options.arguments) {
    makeFolder(run, argument, options.withParents);
  }
}

void runRename(CommandContext& context, const ChangeOptions& options) {
  ChangeRun run(context);
  std::string identifier;
  if (!run.isReady() || !run.identify(options.item, identifier)) return;
  const auto attempt = [&](const std::string& name) {
    return run.changes->rename(identifier, name);
  };
  run.report(changeWithPolicy(*run.changes, options.clashes, options.newName, attempt),
             options.item);
}

void runMove(CommandContext& context, const ChangeOptions& given) {
  ChangeOptions options = given;
  takeTarget(options);
  if (options.target.empty()) return context.fail(ExitCode::Usage, "mv needs a folder to move to");
  if (!options.newName.empty() && options.arguments.size() > 1) {
    return context.fail(ExitCode::Usage, "--as is for one item");
  }
  ChangeRun run(context);
  std::string parent;
  if (!run.isReady() || !identifyTarget(run, options.target, parent)) return;
  for (const std::string& argument : options.arguments) {
    std::string identifier;
    ItemFields item;
    if (!run.identify(argument, identifier)) continue;
    if (NSErrorRef error = run.client.item(identifier, item)) {
      context.fail(error);
      continue;
    }
    const std::string wanted = options.newName.empty() ? item.filename : options.newName;
    const auto attempt = [&](const std::string& name) {
      return run.changes->reparent(identifier, parent,
                                   name == item.filename ? std::nullopt : std::optional(name));
    };
    run.report(changeWithPolicy(*run.changes, options.clashes, wanted, attempt), argument);
  }
}

void listTrash(CommandContext& context) {
  DriveClient client(context.paths());
  const std::string folder = DriveLocations(context.paths().home).trashFiles();
  const auto names = NSFileManager::defaultManager().contentsOfDirectoryAtPath(folder);
  for (const std::string& name : names.value_or(std::vector<std::string>())) {
    NSFileProviderItemIdentifier identifier;
    ItemFields item;
    NSErrorRef error = client.identifierAt(folder + "/" + name, identifier);
    if (!error) error = client.item(identifier, item);
    if (error) {
      context.fail(error);
    } else {
      std::cout << itemLine(item, context.json ? OutputForm::Json : OutputForm::Long) << std::endl;
    }
  }
}

void emptyTrash(CommandContext& context) {
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto content = DriveContent::open(client, &error);
  std::uint64_t removed = 0;
  if (content) error = content->emptyTrash(removed);
  if (error) return context.fail(error);
  if (context.json) {
    std::cout << nlohmann::ordered_json{{"removed", removed}}.dump() << std::endl;
  } else {
    std::cout << removed << " items removed from the trash" << std::endl;
  }
}

void runTrash(CommandContext& context, const ChangeOptions& options) {
  if (options.list) return listTrash(context);
  if (options.empty) return emptyTrash(context);
  if (options.arguments.empty()) {
    return context.fail(ExitCode::Usage, "trash needs an item, --list or --empty");
  }
  ChangeRun run(context);
  if (!run.isReady()) return;
  run.forEach(options.arguments,
              [&](const std::string& identifier) { return run.changes->trash(identifier); });
}

/// The identifier of something in the trash, also by its name there.
bool identifyTrashed(ChangeRun& run, const std::string& argument, std::string& identifier) {
  const std::string there = DriveLocations(run.context.paths().home).trashFiles() + "/" + argument;
  const bool isName = argument.find('/') == std::string::npos;
  if (isName && !run.client.identifierAt(there, identifier)) return true;
  return run.identify(argument, identifier);
}

void runPutBack(CommandContext& context, const ChangeOptions& options) {
  ChangeRun run(context);
  std::string parent;
  if (!run.isReady()) return;
  if (!options.target.empty() && !run.identify(options.target, parent)) return;
  for (const std::string& argument : options.arguments) {
    std::string identifier;
    if (identifyTrashed(run, argument, identifier)) {
      run.report(run.changes->untrash(identifier, parent), argument);
    }
  }
}

void runRemove(CommandContext& context, const ChangeOptions& options) {
  ChangeRun run(context);
  if (!run.isReady()) return;
  run.forEach(options.arguments,
              [&](const std::string& identifier) { return run.changes->remove(identifier); });
}

void addMoves(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<ChangeOptions>();
  CLI::App* rename =
      addCommand(app, context, "rename", "Give an item a new name", runRename, options);
  rename->add_option("item", options->item, itemHelp)->required();
  rename->add_option("name", options->newName, "The new name")->required();
  addClashOptions(*rename, options->clashes);

  options = std::make_shared<ChangeOptions>();
  CLI::App* move = addCommand(app, context, "mv", "Move items into a folder", runMove, options);
  move->add_option("items", options->arguments, "The items, and the folder unless --to names it")
      ->required();
  move->add_option("--to", options->target, "The folder");
  move->add_option("--as", options->newName, "A new name, for one item");
  addClashOptions(*move, options->clashes);
}

void addAdditions(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<ChangeOptions>();
  CLI::App* put =
      addCommand(app, context, "put",
                 "Copy files, folders and links of this machine into the drive", runPut, options);
  put->add_option("paths", options->arguments,
                  "What is copied, and, after it, the folder unless --to names it")
      ->required();
  put->add_option("--to", options->target, "The folder; the drive's root when none is named");
  addClashOptions(*put, options->clashes);

  options = std::make_shared<ChangeOptions>();
  CLI::App* make = addCommand(app, context, "mkdir", "Make folders", runMakeFolder, options);
  make->add_option("paths", options->arguments, "Paths from the drive's root")->required();
  make->add_flag("-p,--parents", options->withParents, "Make the folders above as well");
}

void addRemovals(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<ChangeOptions>();
  CLI::App* trash = addCommand(app, context, "trash", "Move items to the trash", runTrash, options);
  trash->add_option("items", options->arguments, itemHelp);
  auto* const list = trash->add_flag("--list", options->list, "Show what is in the trash");
  trash->add_flag("--empty", options->empty, "Remove everything in the trash for good")
      ->excludes(list);

  options = std::make_shared<ChangeOptions>();
  CLI::App* back =
      addCommand(app, context, "untrash", "Put items of the trash back", runPutBack, options);
  back->add_option("items", options->arguments, "A name in the trash, or an identifier")
      ->required();
  back->add_option("--to", options->target, "Where to; by default where it came from");

  options = std::make_shared<ChangeOptions>();
  CLI::App* remove = addCommand(app, context, "rm", "Remove items for good", runRemove, options);
  remove->add_option("items", options->arguments, itemHelp)->required();
}

}  // namespace

void addChangeCommands(CLI::App& app, CommandContext& context) {
  addAdditions(app, context);
  addMoves(app, context);
  addRemovals(app, context);
}

}  // namespace yomber
