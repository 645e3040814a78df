#include "platform/fileprovider/changes_server.h"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/extension_code.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/tags_data.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/loop_reply.h"

namespace yomber {
namespace {

using protocol::Changed;
using ExtensionRef = std::shared_ptr<NSFileProviderExtension>;

constexpr std::size_t kLongestText = 4'096;

struct Outcome {
  NSFileProviderItemRef item;
  NSErrorRef error;
};

NSErrorRef invalid(const std::string& reason) {
  return NSError::errorWithDomain(NSPOSIXErrorDomain, EINVAL,
                                  {{NSLocalizedDescriptionKey, reason}});
}

Outcome forgotten() {
  return {nullptr, NSError::errorWithDomain(
                       NSCocoaErrorDomain, NSXPCConnectionReplyInvalid,
                       {{NSLocalizedDescriptionKey,
                         std::string("the extension dropped the request without answering it")}})};
}

void encodeOutcome(const Outcome& outcome, Changed::Builder result) {
  if (outcome.error != nullptr) {
    ipc::encodeError(outcome.error, result.initError());
  } else if (outcome.item != nullptr) {
    encodeItem(outcome.item->fields(), result.initItem());
  }
}

/// What an item has to allow for a change, and how its refusal reads.
struct Permission {
  std::string identifier;
  std::uint32_t capability;
  const char* change;
};
using Permissions = std::vector<Permission>;

Permission addingTo(std::string parent) {
  return {std::move(parent), NSFileProviderItemCapabilitiesAllowsAddingSubItems, "added to"};
}

/// Nil where the item allows the change, or is not known: then the change itself says so.
NSErrorRef refusal(NSFileProviderExtension& extension, const Permission& wanted) {
  const auto item = extension.itemForIdentifier(wanted.identifier);
  if (item == nullptr || (item->fields().capabilities & wanted.capability) != 0) return nullptr;
  const std::string name = item->filename().empty() ? "this item" : "\"" + item->filename() + "\"";
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileWriteNoPermissionError,
      {{NSLocalizedDescriptionKey, name + " cannot be " + std::string(wanted.change)}});
}

/// Why the labels cannot be tags; nil when they can.
NSErrorRef checkLabels(const std::vector<std::string>& labels) {
  const bool areGood = std::none_of(labels.begin(), labels.end(), [](const std::string& label) {
    return label.empty() || label.find('\0') != std::string::npos;
  });
  return areGood ? nullptr : invalid("a tag's name can neither be empty nor contain a NUL");
}

class ChangesServer final : public protocol::Changes::Server {
 public:
  explicit ChangesServer(ExtensionRef extension) : extension_(std::move(extension)) {}

 protected:
  kj::Promise<void> importDocument(ImportDocumentContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getPath().size(), params.getParent().size())) {
      return refuse(context, error);
    }
    const auto url = NSURL::fileURLWithPath(stringFromWire(params.getPath()));
    if (url == nullptr) return refuse(context, invalid("what is imported needs an absolute path"));
    std::string parent = stringFromWire(params.getParent());
    return changeAllowed(context, "importDocument", {addingTo(parent)},
                         [url, parent](NSFileProviderExtension& extension, ItemHandler handler) {
                           extension.importDocumentAtURL(url, parent, std::move(handler));
                         });
  }

  kj::Promise<void> createDirectory(CreateDirectoryContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getName().size(), params.getParent().size())) {
      return refuse(context, error);
    }
    std::string parent = stringFromWire(params.getParent());
    return changeAllowed(context, "createDirectory", {addingTo(parent)},
                         [name = stringFromWire(params.getName()), parent](
                             NSFileProviderExtension& extension, ItemHandler handler) {
                           extension.createDirectoryWithName(name, parent, std::move(handler));
                         });
  }

  kj::Promise<void> rename(RenameContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getName().size(), params.getIdentifier().size())) {
      return refuse(context, error);
    }
    std::string identifier = stringFromWire(params.getIdentifier());
    return changeAllowed(context, "rename",
                         {{identifier, NSFileProviderItemCapabilitiesAllowsRenaming, "renamed"}},
                         [name = stringFromWire(params.getName()), identifier](
                             NSFileProviderExtension& extension, ItemHandler handler) {
                           extension.renameItemWithIdentifier(identifier, name, std::move(handler));
                         });
  }

  kj::Promise<void> reparent(ReparentContext context) override {
    const auto params = context.getParams();
    std::optional<std::string> newName;
    if (params.getNewName().isValue()) newName = stringFromWire(params.getNewName().getValue());
    if (const auto error = tooLong(newName ? newName->size() : 0, params.getIdentifier().size(),
                                   params.getParent().size())) {
      return refuse(context, error);
    }
    std::string identifier = stringFromWire(params.getIdentifier());
    std::string parent = stringFromWire(params.getParent());
    return changeAllowed(
        context, "reparent",
        {{identifier, NSFileProviderItemCapabilitiesAllowsReparenting, "moved"}, addingTo(parent)},
        [newName, identifier, parent](NSFileProviderExtension& extension, ItemHandler handler) {
          extension.reparentItemWithIdentifier(identifier, parent, newName, std::move(handler));
        });
  }

  kj::Promise<void> trash(TrashContext context) override {
    const auto given = context.getParams().getIdentifier();
    if (const auto error = tooLong(given.size())) return refuse(context, error);
    std::string identifier = stringFromWire(given);
    return changeAllowed(
        context, "trash",
        {{identifier, NSFileProviderItemCapabilitiesAllowsTrashing, "moved to the trash"}},
        [identifier](NSFileProviderExtension& extension, ItemHandler handler) {
          extension.trashItemWithIdentifier(identifier, std::move(handler));
        });
  }

  kj::Promise<void> untrash(UntrashContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getIdentifier().size(), params.getParent().size())) {
      return refuse(context, error);
    }
    const auto parent = textOrNothing(params.getParent());
    return changeAllowed(
        context, "untrash", parent ? Permissions{addingTo(*parent)} : Permissions{},
        [identifier = stringFromWire(params.getIdentifier()), parent](
            NSFileProviderExtension& extension, ItemHandler handler) {
          extension.untrashItemWithIdentifier(identifier, parent, std::move(handler));
        });
  }

  kj::Promise<void> delete_(DeleteContext context) override {
    const auto given = context.getParams().getIdentifier();
    if (const auto error = tooLong(given.size())) return refuse(context, error);
    std::string identifier = stringFromWire(given);
    return changeAllowed(context, "delete",
                         {{identifier, NSFileProviderItemCapabilitiesAllowsDeleting, "deleted"}},
                         [identifier](NSFileProviderExtension& extension, ItemHandler handler) {
                           extension.deleteItemWithIdentifier(
                               identifier, [handler = std::move(handler)](NSErrorRef error) {
                                 handler(nullptr, std::move(error));
                               });
                         });
  }

  kj::Promise<void> setLastUsedDate(SetLastUsedDateContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getIdentifier().size())) return refuse(context, error);
    std::optional<NSDate> date;
    if (params.getDate().isValue()) date = NSDate::fromNanoseconds(params.getDate().getValue());
    return change(context, "setLastUsedDate",
                  [date, identifier = stringFromWire(params.getIdentifier())](
                      NSFileProviderExtension& extension, ItemHandler handler) {
                    extension.setLastUsedDate(date, identifier, std::move(handler));
                  });
  }

  kj::Promise<void> setTags(SetTagsContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getIdentifier().size())) return refuse(context, error);
    std::vector<std::string> labels;
    for (const auto label : params.getLabels()) labels.push_back(stringFromWire(label));
    if (const auto error = checkLabels(labels)) return refuse(context, error);
    return change(
        context, "setTags",
        [data = FPTagsDataFromLabels(labels), identifier = stringFromWire(params.getIdentifier())](
            NSFileProviderExtension& extension, ItemHandler handler) {
          extension.setTagData(data, identifier, std::move(handler));
        });
  }

  kj::Promise<void> setFavoriteRank(SetFavoriteRankContext context) override {
    const auto params = context.getParams();
    if (const auto error = tooLong(params.getIdentifier().size())) return refuse(context, error);
    std::optional<std::int64_t> rank;
    if (params.getRank().isValue()) rank = params.getRank().getValue();
    return change(context, "setFavoriteRank",
                  [rank, identifier = stringFromWire(params.getIdentifier())](
                      NSFileProviderExtension& extension, ItemHandler handler) {
                    extension.setFavoriteRank(rank, identifier, std::move(handler));
                  });
  }

  kj::Promise<void> defaultApplicationContainer(
      DefaultApplicationContainerContext context) override {
    const auto given = context.getParams().getBundleIdentifier();
    if (const auto error = tooLong(given.size())) return refuse(context, error);
    return change(
        context, "defaultApplicationContainer",
        [bundle = textOrNothing(given)](NSFileProviderExtension& extension, ItemHandler handler) {
          extension._defaultApplicationContainerForBundleIdentifier(bundle, std::move(handler));
        });
  }

 private:
  template <typename... Sizes>
  static NSErrorRef tooLong(Sizes... sizes) {
    const bool isTooLong = ((sizes > kLongestText) || ...);
    return isTooLong ? invalid("a name, path or identifier is too long") : nullptr;
  }

  static std::optional<std::string> textOrNothing(capnp::Text::Reader text) {
    if (text.size() == 0) return std::nullopt;
    return stringFromWire(text);
  }

  template <typename Context>
  static kj::Promise<void> refuse(Context& context, const NSErrorRef& error) {
    ipc::encodeError(error, context.getResults().initError());
    return kj::READY_NOW;
  }

  /// Runs `start(extension, handler)` on the pool and answers what the handler is given.
  template <typename Context, typename Start>
  kj::Promise<void> change(Context context, const char* operation, Start start) {
    context.releaseParams();
    auto reply = ipc::LoopReply<Outcome>::makeFor(forgotten());
    ItemHandler handler = [fulfill = std::move(reply.fulfill)](NSFileProviderItemRef item,
                                                               NSErrorRef error) {
      fulfill({std::move(item), std::move(error)});
    };
    runExtensionCode(operation, [extension = extension_, start = std::move(start),
                                 handler = std::move(handler)]() mutable {
      start(*extension, std::move(handler));
    });
    return reply.promise.then(
        [context](Outcome outcome) mutable { encodeOutcome(outcome, context.getResults()); });
  }

  /// The same where all of this has to be allowed.
  template <typename Context, typename Start>
  kj::Promise<void> changeAllowed(Context context, const char* operation, Permissions permissions,
                                  Start start) {
    return change(context, operation,
                  [permissions = std::move(permissions), start = std::move(start)](
                      NSFileProviderExtension& extension, ItemHandler handler) {
                    for (const Permission& wanted : permissions) {
                      if (NSErrorRef error = refusal(extension, wanted)) {
                        return handler(nullptr, std::move(error));
                      }
                    }
                    start(extension, std::move(handler));
                  });
  }

  const ExtensionRef extension_;
};

}  // namespace

protocol::Changes::Client serveChanges(std::shared_ptr<NSFileProviderExtension> extension) {
  return kj::heap<ChangesServer>(std::move(extension));
}

}  // namespace yomber
