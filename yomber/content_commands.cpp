#include <algorithm>
#include <functional>
#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/foundation/lock.h"
#include "yomber/command.h"
#include "yomber/drive_content.h"
#include "yomber/eviction.h"
#include "yomber/item_output.h"
#include "yomber/item_walk.h"
#include "yomber/side_by_side.h"

namespace yomber {

namespace {

/// So many documents are asked for at a time.
constexpr std::size_t atATime = 32;

using Arguments = std::shared_ptr<std::vector<std::string>>;

/// What a command on content needs; prints what comes of each document.
struct ContentRun {
  explicit ContentRun(CommandContext& given) : context(given), client(given.paths()) {
    NSErrorRef error;
    content = DriveContent::open(client, &error);
    if (!content) context.fail(error);
  }
  ContentRun(const ContentRun&) = delete;
  ContentRun& operator=(const ContentRun&) = delete;

  /// The documents that the arguments name or have below them.
  std::vector<std::string> documents(const std::vector<std::string>& arguments) {
    std::vector<std::string> paths;
    for (const std::string& argument : arguments) {
      const NSErrorRef error = walkItem(client, argument, [&](const WalkedItem& found) {
        if (found.item.kind == ItemKind::Document) paths.push_back(found.path);
        return true;
      });
      if (error) context.fail(error);
    }
    return paths;
  }

  /// Any thread.
  void report(const std::string& path, const char* outcome,
              const nlohmann::ordered_json& more = nlohmann::ordered_json::object()) {
    LockGuard guard(mutex);
    if (context.json) {
      nlohmann::ordered_json line{{"location", path}, {"outcome", outcome}};
      line.update(more);
      std::cout << jsonLine(line);
    } else {
      std::cout << outcome << "  " << printableName(path);
      if (more.contains("reason"))
        std::cout << ": " << printableName(more["reason"].get<std::string>());
    }
    std::cout << "\n" << std::flush;
  }
  void fail(const NSErrorRef& error) {
    LockGuard guard(mutex);
    context.fail(error);
  }
  void fail(ExitCode code) {
    LockGuard guard(mutex);
    context.exitCode = code;
  }

  CommandContext& context;
  DriveClient client;
  std::optional<DriveContent> content;
  Mutex mutex;
};

void runProvide(CommandContext& context, const std::vector<std::string>& arguments) {
  ContentRun run(context);
  if (!run.content) return;
  const auto paths = run.documents(arguments);
  sideBySide(paths.size(), atATime, [&](std::size_t index) {
    if (const NSErrorRef error = run.content->provide(paths[index])) return run.fail(error);
    run.report(paths[index], "here");
  });
}

void runEvict(CommandContext& context, const std::vector<std::string>& arguments) {
  ContentRun run(context);
  if (!run.content) return;
  const auto paths = run.documents(arguments);
  sideBySide(paths.size(), atATime, [&](std::size_t index) {
    const Eviction eviction = evictContent(*run.content, paths[index]);
    if (eviction.error) return run.fail(eviction.error);
    nlohmann::ordered_json more{{"local_bytes", eviction.localBytes}};
    if (!eviction.reason.empty()) more["reason"] = eviction.reason;
    run.report(paths[index], nameOf(eviction.outcome), more);
    if (eviction.outcome == Eviction::Outcome::Kept) run.fail(ExitCode::TryAgain);
  });
}

void setPinned(CommandContext& context, const std::vector<std::string>& arguments, bool pinned) {
  ContentRun run(context);
  if (!run.content) return;
  for (const std::string& argument : arguments) {
    NSFileProviderItemIdentifier identifier;
    std::string path;
    NSErrorRef error = run.client.identifierFor(argument, identifier);
    if (!error) error = run.client.location(identifier, path);
    if (!error) error = run.content->setPinned(path, pinned);
    if (error) {
      run.fail(error);
    } else {
      run.report(path, pinned ? "pinned" : "unpinned");
    }
  }
}

void runPin(CommandContext& context, const std::vector<std::string>& arguments) {
  setPinned(context, arguments, true);
}
void runUnpin(CommandContext& context, const std::vector<std::string>& arguments) {
  setPinned(context, arguments, false);
}

void addContentCommand(CLI::App& app, CommandContext& context, const char* name, const char* what,
                       void (*run)(CommandContext&, const std::vector<std::string>&)) {
  CLI::App* command = app.add_subcommand(name, what);
  auto arguments = std::make_shared<std::vector<std::string>>();
  command
      ->add_option("items", *arguments,
                   "Paths from the drive's root, locations in its tree, or identifiers; folders "
                   "stand for what is below them")
      ->required();
  command->callback([&context, arguments, run] { run(context, *arguments); });
}

}  // namespace

void addContentCommands(CLI::App& app, CommandContext& context) {
  addContentCommand(app, context, "provide", "Bring the content of items here", runProvide);
  addContentCommand(app, context, "evict", "Give up the local content of items", runEvict);
  addContentCommand(app, context, "pin", "Keep the content of items here from now on", runPin);
  addContentCommand(app, context, "unpin", "Let the content of items go when room is needed",
                    runUnpin);
}

}  // namespace yomber
