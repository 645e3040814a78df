#include <csignal>
#include <iostream>
#include <map>
#include <mutex>

#include <unistd.h>

#include <nlohmann/json.hpp>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "yomber/command.h"
#include "yomber/drive_client.h"
#include "yomber/failure_text.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

struct WatchOptions {
  bool listFirst = false;  ///< print what is there at the start as well
  bool once = false;       ///< end after the first listing
};

/// Prints each change as it comes. Lives on the loop thread, as all of its calls do.
class ChangePrinter {
 public:
  ChangePrinter(bool json, WatchOptions options) : json_(json), options_(options) {}

  void listed(const std::vector<ItemFields>& items, bool last) {
    for (const ItemFields& item : items) {
      names_[item.identifier] = item.filename;
      if (options_.listFirst) printItem("present", item);
    }
    if (last && !options_.listFirst && !json_)
      std::cerr << "watching " << names_.size() << " items" << std::endl;
    std::cout << std::flush;
    if (last && options_.once) finish(nullptr);
  }

  void updated(const std::vector<ItemFields>& items) {
    for (const ItemFields& item : items) {
      const auto [known, isNew] = names_.insert_or_assign(item.identifier, item.filename);
      printItem(isNew ? "added" : "changed", item);
    }
    std::cout << std::flush;
  }

  void deleted(const std::vector<std::string>& identifiers) {
    for (const std::string& identifier : identifiers) {
      const auto known = names_.find(identifier);
      printRemoval(identifier, known == names_.end() ? identifier : known->second);
      if (known != names_.end()) names_.erase(known);
    }
    std::cout << std::flush;
  }

  void paused(const NSErrorRef& error) {
    if (json_) {
      std::cout << nlohmann::ordered_json{{"event", "paused"}, {"error", errorJson(error)}}.dump()
                << std::endl;
    } else {
      std::cerr << "waiting: " << failureText(error) << std::endl;
    }
  }

  void resumed() {
    if (json_) {
      std::cout << nlohmann::ordered_json{{"event", "resumed"}}.dump() << std::endl;
    } else {
      std::cerr << "watching again" << std::endl;
    }
  }

  void finish(NSErrorRef error) {
    LockGuard guard(mutex_);
    finished_ = true;
    error_ = std::move(error);
    ended_.notifyAll();
  }

  NSErrorRef waitUntilFinished() {
    LockGuard guard(mutex_);
    while (!finished_) ended_.wait(mutex_);
    return error_;
  }

 private:
  void printItem(const char* event, const ItemFields& item) {
    if (json_) {
      const nlohmann::ordered_json line{{"event", event}, {"item", itemJson(item)}};
      std::cout << line.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace) << "\n";
    } else {
      std::cout << event << std::string(9 - std::string(event).size(), ' ')
                << itemLine(item, OutputForm::Short) << "\n";
    }
  }

  void printRemoval(const std::string& identifier, const std::string& name) {
    if (json_) {
      std::cout << nlohmann::ordered_json{{"event", "removed"}, {"id", identifier}}.dump() << "\n";
    } else {
      std::cout << "removed  " << printableName(name) << "\n";
    }
  }

  const bool json_;
  const WatchOptions options_;
  std::map<NSFileProviderItemIdentifier, std::string> names_;  // loop thread

  Mutex mutex_;
  Condition ended_;
  bool finished_ GUARDED_BY(mutex_) = false;
  NSErrorRef error_ GUARDED_BY(mutex_);
};

/// The capability that the host calls; hands everything to the printer.
class WatcherServer final : public protocol::Watcher::Server {
 public:
  explicit WatcherServer(std::shared_ptr<ChangePrinter> printer) : printer_(std::move(printer)) {}

  kj::Promise<void> didList(DidListContext context) override {
    printer_->listed(decoded(context.getParams().getItems()), context.getParams().getLast());
    return kj::READY_NOW;
  }
  kj::Promise<void> didUpdate(DidUpdateContext context) override {
    printer_->updated(decoded(context.getParams().getItems()));
    return kj::READY_NOW;
  }
  kj::Promise<void> didDelete(DidDeleteContext context) override {
    std::vector<std::string> identifiers;
    for (const auto identifier : context.getParams().getIdentifiers())
      identifiers.emplace_back(identifier.cStr());
    printer_->deleted(identifiers);
    return kj::READY_NOW;
  }
  kj::Promise<void> didPause(DidPauseContext context) override {
    printer_->paused(ipc::decodeError(context.getParams().getError()));
    return kj::READY_NOW;
  }
  kj::Promise<void> didResume(DidResumeContext) override {
    printer_->resumed();
    return kj::READY_NOW;
  }

 private:
  static std::vector<ItemFields> decoded(capnp::List<protocol::Item>::Reader items) {
    std::vector<ItemFields> fields;
    fields.reserve(items.size());
    for (const auto item : items) fields.push_back(decodeItem(item));
    return fields;
  }

  const std::shared_ptr<ChangePrinter> printer_;
};

NSErrorRef startWatch(const ipc::Remote<protocol::Control>& control,
                      const NSFileProviderItemIdentifier& container,
                      const std::shared_ptr<ChangePrinter>& printer,
                      ipc::Remote<protocol::Watch>& registration) {
  return ipc::callAndWait(
      control, &protocol::Control::Client::watchRequest,
      [&](auto params) {
        params.setContainer(container);
        params.setWatcher(kj::heap<WatcherServer>(printer));
      },
      [&](auto results) {
        registration = ipc::Remote<protocol::Watch>(results.getRegistration());
      });
}

/// Watches until the host is lost or the user interrupts; the signal's default action ends us.
void watchContainer(CommandContext& context, const NSFileProviderItemIdentifier& container,
                    const WatchOptions& options) {
  DriveClient client(context.paths());
  NSErrorRef error;
  const auto control = client.control(&error);
  if (error) return context.fail(error);
  auto printer = std::make_shared<ChangePrinter>(context.json, options);
  client.controlConnection()->onDisconnect(
      [printer](NSErrorRef failure) { printer->finish(std::move(failure)); });
  ipc::Remote<protocol::Watch> registration;
  error = startWatch(control, container, printer, registration);
  if (!error) error = printer->waitUntilFinished();
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
