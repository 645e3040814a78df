#include <filesystem>

#include <nlohmann/json.hpp>

#include "yomber/command.h"
#include "yomber/drive_mount.h"

namespace yomber {

namespace {

void runMount(CommandContext& context, MountOptions options) {
  const DrivePaths paths = context.paths();
  if (NSErrorRef error = paths.check()) return context.fail(error);
  options.folder = std::filesystem::absolute(options.folder).lexically_normal().string();
  if (options.folder.size() > 1 && options.folder.ends_with('/')) options.folder.pop_back();
  if (NSErrorRef error = mountDrive(paths, options)) {
    context.fail(ExitCode::CannotCreate, error->localizedDescription());
    return;
  }
  context.print({{"home", paths.home}, {"mounted", options.folder}},
                "The drive is shown in " + options.folder);
}

void runUnmount(CommandContext& context, bool isLazy) {
  const DrivePaths paths = context.paths();
  const auto mayBeInUse = isLazy ? MayBeInUse::Yes : MayBeInUse::No;
  bool wasMounted = false;
  if (NSErrorRef error = unmountDrive(paths, mayBeInUse, wasMounted)) return context.fail(error);
  context.print({{"home", paths.home}, {"was_mounted", wasMounted}},
                wasMounted ? "The drive is not mounted any more." : "The drive was not mounted.");
}

}  // namespace

void addMountCommands(CLI::App& app, CommandContext& context) {
  CLI::App* mount =
      app.add_subcommand("mount", "Show the drive as a folder that every application can use");
  auto options = std::make_shared<MountOptions>();
  mount->add_option("folder", options->folder, "An empty folder")->required();
  mount->add_flag("--allow-other", options->allowOthers,
                  "Other users may use it too (root's mount always allows them)");
  mount
      ->add_option("--keep", options->keep,
                   "Give content up again that takes more than SIZE on this disk (\"20G\"), the "
                   "longest unused first")
      ->transform(CLI::AsSizeValue(false))
      ->type_name("SIZE");
  mount->add_flag("!--no-pass-through", options->mayPassThrough,
                  "The kernel reads no file by itself");
  mount->callback([&context, options] { runMount(context, *options); });

  CLI::App* unmount = app.add_subcommand("unmount", "Do not show the drive as a folder any more");
  auto isLazy = std::make_shared<bool>(false);
  unmount->add_flag("--lazy", *isLazy,
                    "Also when programs have files open there, which they then cannot use");
  unmount->callback([&context, isLazy] { runUnmount(context, *isLazy); });
}

}  // namespace yomber
