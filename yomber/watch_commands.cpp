#include <iostream>
#include <utility>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "yomber/change_printer.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"

namespace yomber {

namespace {

/// A watch under way: prints what the host tells, on the loop thread, and ends for whoever waits.
class RunningWatch {
 public:
  explicit RunningWatch(const ChangePrinter::Options& options)
      : printer(std::cout, std::cerr, options) {}

  /// The first time counts.
  void finish(NSErrorRef error) {
    LockGuard guard(mutex_);
    if (std::exchange(isFinished_, true)) return;
    error_ = std::move(error);
    ended_.notifyAll();
  }
  NSErrorRef waitUntilFinished() {
    LockGuard guard(mutex_);
    while (!isFinished_) ended_.wait(mutex_);
    return error_;
  }

  ChangePrinter printer;  // loop thread

 private:
  Mutex mutex_;
  Condition ended_;
  bool isFinished_ GUARDED_BY(mutex_) = false;
  NSErrorRef error_ GUARDED_BY(mutex_);
};

/// The capability that the host calls; hands everything to the watch.
class WatcherServer final : public protocol::Watcher::Server {
 public:
  explicit WatcherServer(std::shared_ptr<RunningWatch> watch) : watch_(std::move(watch)) {}

  kj::Promise<void> didList(DidListContext context) override {
    const auto params = context.getParams();
    const bool isAll = watch_->printer.listed(decoded(params.getItems()), params.getLast());
    if (isAll) watch_->finish(nullptr);
    return kj::READY_NOW;
  }
  kj::Promise<void> didUpdate(DidUpdateContext context) override {
    watch_->printer.updated(decoded(context.getParams().getItems()));
    return kj::READY_NOW;
  }
  kj::Promise<void> didDelete(DidDeleteContext context) override {
    std::vector<std::string> identifiers;
    for (const auto identifier : context.getParams().getIdentifiers())
      identifiers.emplace_back(identifier.cStr());
    watch_->printer.deleted(identifiers);
    return kj::READY_NOW;
  }
  kj::Promise<void> didPause(DidPauseContext context) override {
    const NSErrorRef error = ipc::decodeError(context.getParams().getError());
    if (watch_->printer.paused(error)) watch_->finish(error);
    return kj::READY_NOW;
  }
  kj::Promise<void> didResume(DidResumeContext) override {
    watch_->printer.resumed();
    return kj::READY_NOW;
  }
  kj::Promise<void> didEnd(DidEndContext context) override {
    watch_->finish(ipc::decodeError(context.getParams().getError()));
    return kj::READY_NOW;
  }

 private:
  static std::vector<ItemFields> decoded(capnp::List<protocol::Item>::Reader items) {
    std::vector<ItemFields> fields;
    fields.reserve(items.size());
    for (const auto item : items) fields.push_back(decodeItem(item));
    return fields;
  }

  const std::shared_ptr<RunningWatch> watch_;
};

NSErrorRef startWatch(const ipc::Remote<protocol::Control>& control,
                      const NSFileProviderItemIdentifier& container,
                      const std::shared_ptr<RunningWatch>& watch,
                      ipc::Remote<protocol::Watch>& registration) {
  return ipc::callAndWait(
      control, &protocol::Control::Client::watchRequest,
      [&](auto params) {
        params.setContainer(container);
        params.setWatcher(kj::heap<WatcherServer>(watch));
      },
      [&](auto results) {
        registration = ipc::Remote<protocol::Watch>(results.getRegistration());
      });
}

/// Watches until the folder or the host is gone, or the user interrupts; the signal's default
/// action ends us.
void watchContainer(CommandContext& context, const NSFileProviderItemIdentifier& container,
                    ChangePrinter::Options options) {
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto control = client.control(&error);
  if (error) return context.fail(error);
  options.json = context.json;
  const auto watch = std::make_shared<RunningWatch>(options);
  client.controlConnection()->onDisconnect(
      [watch](NSErrorRef failure) { watch->finish(std::move(failure)); });
  ipc::Remote<protocol::Watch> registration;
  error = startWatch(control, container, watch, registration);
  if (!error) error = watch->waitUntilFinished();
  if (error) context.fail(error);
}

void runWatch(CommandContext& context, const std::string& where, bool listFirst) {
  DriveClient client(context.paths());
  NSFileProviderItemIdentifier container;
  if (NSErrorRef error = client.identifierFor(where, container)) return context.fail(error);
  watchContainer(context, container, {.listFirst = listFirst});
}

}  // namespace

void addWatchCommands(CLI::App& app, CommandContext& context) {
  CLI::App* watch = app.add_subcommand("watch", "Print each change of a folder as it comes");
  auto where = std::make_shared<std::string>();
  auto listFirst = std::make_shared<bool>(false);
  watch->add_option("item", *where, "The folder; the drive's root when none is given");
  watch->add_flag("--list", *listFirst, "Print what is there first");
  watch->callback([&context, where, listFirst] { runWatch(context, *where, *listFirst); });

  CLI::App* workingSet = app.add_subcommand(
      "working-set", "Print the items that matter: favourite, tagged, shared, recently used");
  auto follow = std::make_shared<bool>(false);
  workingSet->add_flag("--follow", *follow, "Stay, and print each change as it comes");
  workingSet->callback([&context, follow] {
    watchContainer(context, NSFileProviderWorkingSetContainerItemIdentifier,
                   {.listFirst = true, .once = !*follow});
  });
}

}  // namespace yomber
