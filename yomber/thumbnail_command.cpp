#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/ostrell/constants.h"
#include "yomber/command.h"
#include "yomber/drive_thumbnails.h"
#include "yomber/failure_text.h"
#include "yomber/item_output.h"
#include "yomber/item_walk.h"
#include "yomber/thumbnail_files.h"

namespace yomber {

namespace {

struct ThumbnailOptions {
  std::vector<std::string> items;
  std::string size = "256x256";
  std::string folder = ".";
  bool recursive = false;
};

std::optional<CGSize> parseSize(const std::string& text) {
  unsigned width = 0;
  unsigned height = 0;
  int end = 0;
  const int count = std::sscanf(text.c_str(), "%5ux%5u%n", &width, &height, &end);
  const bool isSize =
      count == 2 && static_cast<std::size_t>(end) == text.size() && width > 0 && height > 0;
  if (!isSize) return std::nullopt;
  return CGSize{.width = static_cast<double>(width), .height = static_cast<double>(height)};
}

/// Whether it says that an application has no icon for its folder.
bool isMissingIcon(const NSErrorRef& error) {
  if (error == nullptr || !error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter)) {
    return false;
  }
  const auto parameter = error->userInfo().find(QSOstrellErrorParameterKey);
  return parameter != error->userInfo().end() &&
         parameter->second == NSErrorValue(std::string("size"));
}

/// One line of standard error that says how far the command is. Only at a terminal.
class ProgressLine {
 public:
  explicit ProgressLine(std::size_t total)
      : total_(total), isShown_(total > 1 && isatty(STDERR_FILENO) == 1) {}

  [[nodiscard]] bool isShown() const { return isShown_; }
  void show(std::size_t done) {
    const auto now = std::chrono::steady_clock::now();
    if (!isShown_ || (done < total_ && now < next_)) return;
    next_ = now + std::chrono::milliseconds(100);
    std::cerr << "\r" << done << " of " << total_ << std::flush;
  }
  void clear() const {
    if (isShown_) std::cerr << "\r\x1b[K" << std::flush;
  }

 private:
  const std::size_t total_;
  const bool isShown_;
  std::chrono::steady_clock::time_point next_;
};

/// Writes each thumbnail into its file, and says of each item what came of it.
class ThumbnailRun {
 public:
  ThumbnailRun(CommandContext& context, const std::string& folder,
               const std::unordered_map<std::string, std::string>& names)
      : context_(context),
        files_(folder),
        names_(names),
        progress_(names.size()),
        isSummed_(progress_.isShown() && !context.json && isatty(STDOUT_FILENO) == 1) {}

  void take(const ItemThumbnail& thumbnail) {
    const auto found = names_.find(thumbnail.identifier);
    if (found == names_.end()) return;
    progress_.show(++done_);
    const std::string& name = found->second;
    if (thumbnail.image == nullptr) return takeNone(thumbnail, name);
    std::string path;
    if (const NSErrorRef error = files_.write(name, thumbnail.image->bytes(), path)) {
      progress_.clear();
      context_.fail(error);
      return;
    }
    ++written_;
    report(thumbnail, name, "thumbnail", {{"path", path}, {"bytes", thumbnail.image->length()}});
  }

  void summarize() const {
    progress_.clear();
    if (!isSummed_) return;
    std::cout << written_ << " of " << names_.size() << " items have a thumbnail" << std::endl;
  }

 private:
  using Json = nlohmann::ordered_json;

  void takeNone(const ItemThumbnail& thumbnail, const std::string& name) {
    const bool isNone = thumbnail.error == nullptr || isMissingIcon(thumbnail.error);
    if (isNone) return report(thumbnail, name, "none", Json::object());
    report(thumbnail, name, "failed", {{"reason", failureText(thumbnail.error)}});
    const ExitCode code = exitCodeFor(thumbnail.error);
    context_.exitCode = code == ExitCode::Ok ? ExitCode::Failure : code;
  }

  void report(const ItemThumbnail& thumbnail, const std::string& name, std::string_view outcome,
              const Json& more) const {
    if (isSummed_ && outcome == "thumbnail") return;
    progress_.clear();
    if (context_.json) {
      Json line{{"id", thumbnail.identifier}, {"name", name}, {"outcome", outcome}};
      if (thumbnail.contentType) line["type"] = *thumbnail.contentType;
      line.update(more);
      std::cout << jsonLine(line) << std::endl;
    } else if (outcome == "none") {
      std::cout << "none  " << printableName(name) << ": it has no thumbnail" << std::endl;
    } else if (outcome == "failed") {
      std::cout << "failed  " << printableName(name) << ": "
                << printableName(more["reason"].get<std::string>()) << std::endl;
    } else {
      std::cout << "thumbnail  " << printableName(more["path"].get<std::string>()) << std::endl;
    }
  }

  CommandContext& context_;
  ThumbnailFiles files_;
  const std::unordered_map<std::string, std::string>& names_;
  ProgressLine progress_;
  /// A person sees how far it is and the sum, in place of a line for each.
  const bool isSummed_;
  std::size_t done_ = 0;
  std::size_t written_ = 0;
};

/// The items that are meant, with their names; those that are not there are said to be missing.
class WantedItems {
 public:
  void add(const NSFileProviderItemIdentifier& identifier, const std::string& name) {
    if (names_.emplace(identifier, name).second) identifiers_.push_back(identifier);
  }
  [[nodiscard]] const std::vector<NSFileProviderItemIdentifier>& identifiers() const {
    return identifiers_;
  }
  [[nodiscard]] const std::unordered_map<std::string, std::string>& names() const { return names_; }

 private:
  std::vector<NSFileProviderItemIdentifier> identifiers_;
  std::unordered_map<std::string, std::string> names_;
};

NSErrorRef findItem(DriveClient& client, const std::string& argument, WantedItems& wanted) {
  NSFileProviderItemIdentifier identifier;
  ItemFields item;
  NSErrorRef error = client.identifierFor(argument, identifier);
  if (!error) error = client.item(identifier, item);
  if (!error) wanted.add(identifier, item.filename.empty() ? "/" : item.filename);
  return error;
}

NSErrorRef findItems(DriveClient& client, const ThumbnailOptions& options,
                     const std::string& argument, WantedItems& wanted) {
  if (!options.recursive) return findItem(client, argument, wanted);
  return walkItem(client, argument, [&](const WalkedItem& found) {
    if (found.item.kind != ItemKind::Folder) wanted.add(found.item.identifier, found.item.filename);
    return true;
  });
}

void runThumbnail(CommandContext& context, const ThumbnailOptions& options) {
  const auto size = parseSize(options.size);
  if (!size) {
    return context.fail(ExitCode::Usage, "--size is a width and a height in points, as 256x256");
  }
  if (const NSErrorRef error = ThumbnailFiles(options.folder).open()) return context.fail(error);
  DriveClient client(context.paths());
  WantedItems wanted;
  for (const std::string& argument : options.items) {
    if (const NSErrorRef error = findItems(client, options, argument, wanted)) context.fail(error);
  }
  ThumbnailRun run(context, options.folder, wanted.names());
  std::size_t told = 0;
  const NSErrorRef error =
      fetchThumbnails(client, wanted.identifiers(), *size, [&](const ItemThumbnail& thumbnail) {
        ++told;
        run.take(thumbnail);
      });
  run.summarize();
  // What befell an item has been said.
  if (error && told < wanted.identifiers().size()) context.fail(error);
}

}  // namespace

void addThumbnailCommand(CLI::App& app, CommandContext& context) {
  auto options = std::make_shared<ThumbnailOptions>();
  CLI::App* command = app.add_subcommand(
      "thumbnail",
      "Write thumbnails of items into a folder of this machine, without their content");
  command
      ->add_option("items", options->items,
                   "Paths from the drive's root, locations in its tree, or identifiers")
      ->required();
  command
      ->add_option("--size", options->size,
                   "Width and height in points, as 256x256, of an application's icon; documents "
                   "have one stored picture, of at most 1024x1024, whatever the size")
      ->capture_default_str();
  command->add_option("--out", options->folder, "The folder, which is made where it is missing")
      ->capture_default_str();
  command->add_flag("--recursive,-r", options->recursive,
                    "Everything below a folder, in place of the folder");
  command->callback([&context, options] { runThumbnail(context, *options); });
}

}  // namespace yomber
