#include "platform/fileprovider/changes_server.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/served_extension.h"
#include "platform/fileprovider/tags_data.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Changes;
using protocol::Extension;

NSFileProviderItemRef itemNamed(const std::string& identifier, std::uint32_t capabilities = ~0U) {
  ItemFields fields;
  fields.identifier = identifier;
  fields.filename = "name of " + identifier;
  fields.capabilities = capabilities;
  return std::make_shared<WireItem>(fields);
}

/// Notes what it is asked for, and answers an item that is called so.
class NotingExtension final : public NSFileProviderExtension {
 public:
  NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                          NSErrorRef* error) override {
    if (identifier == "fixed") return itemNamed(identifier, 0);
    if (identifier != "unknown") return itemNamed(identifier);
    storeError(error, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    return nullptr;
  }
  void importDocumentAtURL(const NSURLRef& url, const std::string& parent,
                           ItemHandler handler) override {
    note("import " + url->path() + " to " + parent, handler);
  }
  void createDirectoryWithName(const std::string& name, const std::string& parent,
                               ItemHandler handler) override {
    note("mkdir " + name + " in " + parent, handler);
  }
  void renameItemWithIdentifier(const std::string& identifier, const std::string& name,
                                ItemHandler handler) override {
    note("rename " + identifier + " " + name, handler);
  }
  void reparentItemWithIdentifier(const std::string& identifier, const std::string& parent,
                                  const std::optional<std::string>& name,
                                  ItemHandler handler) override {
    note("reparent " + identifier + " " + parent + " " + name.value_or("-"), handler);
  }
  void trashItemWithIdentifier(const std::string& identifier, ItemHandler handler) override {
    note("trash " + identifier, handler);
  }
  void untrashItemWithIdentifier(const std::string& identifier,
                                 const std::optional<std::string>& parent,
                                 ItemHandler handler) override {
    note("untrash " + identifier + " " + parent.value_or("-"), handler);
  }
  void deleteItemWithIdentifier(const std::string& identifier, ErrorHandler handler) override {
    asked = "delete " + identifier;
    handler(failure);
  }
  void setLastUsedDate(const std::optional<NSDate>& date, const std::string& identifier,
                       ItemHandler handler) override {
    note("used " + identifier + " " + (date ? std::to_string(date->nanoseconds()) : "-"), handler);
  }
  void setTagData(const NSDataRef& data, const std::string& identifier,
                  ItemHandler handler) override {
    std::string labels;
    for (const auto& tag : FPGetTagsFromTagsData(data)) labels += " " + tag->label();
    note("tags " + identifier + labels, handler);
  }
  void setFavoriteRank(const std::optional<std::int64_t>& rank, const std::string& identifier,
                       ItemHandler handler) override {
    note("favorite " + identifier + " " + (rank ? std::to_string(*rank) : "-"), handler);
  }
  void _defaultApplicationContainerForBundleIdentifier(const std::optional<std::string>& bundle,
                                                       ItemHandler handler) override {
    note("container " + bundle.value_or("-"), handler);
  }

  std::string asked;
  NSErrorRef failure;
  bool forgets = false;
  bool answersTwice = false;
  bool answersNothing = false;

 private:
  void note(const std::string& what, const ItemHandler& handler) {
    asked = what;
    if (forgets) return;
    if (failure != nullptr) return handler(nullptr, failure);
    const bool again = answersTwice;  // read before the test goes on
    handler(answersNothing ? nullptr : itemNamed("done"), nullptr);
    if (again) handler(nullptr, fileProviderErrorForUnsupportedFeature("two answers"));
  }
};

class ChangesServer : public testing::Test {
 protected:
  ChangesServer() {
    EXPECT_EQ(nullptr,
              ipc::callAndWait(
                  served_.remote, &Extension::Client::changesRequest, [](auto) {},
                  [this](auto results) { changes_ = ipc::Remote<Changes>(results.getChanges()); }));
  }

  /// What the extension was asked for, and which item came back.
  template <typename Method, typename Fill>
  std::string change(Method method, const Fill& fill) {
    error_ = nullptr;
    extension_->asked = "nothing";
    std::string item = "no item";
    EXPECT_EQ(nullptr, ipc::callAndWait(changes_, method, fill, [&](auto changed) {
                if (changed.isError()) error_ = ipc::decodeError(changed.getError());
                if (changed.isItem()) item = stringFromWire(changed.getItem().getIdentifier());
              }));
    return extension_->asked + ": " + item;
  }

  std::string rename(const std::string& identifier, const std::string& name) {
    return change(&Changes::Client::renameRequest, [&](auto params) {
      params.setIdentifier(wireText(identifier));
      params.setName(wireData(name));
    });
  }

  const std::shared_ptr<NotingExtension> extension_ = std::make_shared<NotingExtension>();
  const ServedExtension served_{extension_};
  ipc::Remote<Changes> changes_;
  NSErrorRef error_;
};

TEST_F(ChangesServer, HandsEachChangeToTheExtension) {
  EXPECT_EQ(change(&Changes::Client::importDocumentRequest,
                   [](auto params) {
                     params.setPath(wireData("/a/file"));
                     params.setParent("i:1");
                   }),
            "import /a/file to i:1: done");
  EXPECT_EQ(change(&Changes::Client::createDirectoryRequest,
                   [](auto params) {
                     params.setName(wireData("\xff new"));
                     params.setParent("i:1");
                   }),
            "mkdir \xff new in i:1: done");
  EXPECT_EQ(rename("d:1", "new"), "rename d:1 new: done");
  EXPECT_EQ(
      change(&Changes::Client::trashRequest, [](auto params) { params.setIdentifier("d:1"); }),
      "trash d:1: done");
  EXPECT_EQ(
      change(&Changes::Client::deleteRequest, [](auto params) { params.setIdentifier("d:1"); }),
      "delete d:1: no item");
  EXPECT_EQ(error_, nullptr);
}

TEST_F(ChangesServer, TellsWhatIsNotGivenFromWhatIs) {
  const auto reparent = [&](const char* name) {
    return change(&Changes::Client::reparentRequest, [&](auto params) {
      params.setIdentifier("d:1");
      params.setParent("i:2");
      if (name != nullptr) params.initNewName().setValue(wireData(name));
    });
  };
  EXPECT_EQ(reparent("new"), "reparent d:1 i:2 new: done");
  EXPECT_EQ(reparent(nullptr), "reparent d:1 i:2 -: done");
  const auto untrash = [&](const char* parent) {
    return change(&Changes::Client::untrashRequest, [&](auto params) {
      params.setIdentifier("d:1");
      params.setParent(parent);
    });
  };
  EXPECT_EQ(untrash("i:2"), "untrash d:1 i:2: done");
  EXPECT_EQ(untrash(""), "untrash d:1 -: done");
  const auto container = [&](const char* bundle) {
    return change(&Changes::Client::defaultApplicationContainerRequest,
                  [&](auto params) { params.setBundleIdentifier(bundle); });
  };
  EXPECT_EQ(container("org.example.App"), "container org.example.App: done");
  EXPECT_EQ(container(""), "container -: done");
}

TEST_F(ChangesServer, SetsAndTakesAwayAttributes) {
  const auto used = [&](bool given) {
    return change(&Changes::Client::setLastUsedDateRequest, [&](auto params) {
      params.setIdentifier("d:1");
      if (given) params.initDate().setValue(-5);
    });
  };
  EXPECT_EQ(used(true), "used d:1 -5: done");
  EXPECT_EQ(used(false), "used d:1 -: done");
  const auto favorite = [&](bool given) {
    return change(&Changes::Client::setFavoriteRankRequest, [&](auto params) {
      params.setIdentifier("d:1");
      if (given) params.initRank().setValue(7);
    });
  };
  EXPECT_EQ(favorite(true), "favorite d:1 7: done");
  EXPECT_EQ(favorite(false), "favorite d:1 -: done");
  const auto tag = [&](const std::vector<std::string>& labels) {
    return change(&Changes::Client::setTagsRequest, [&](auto params) {
      params.setIdentifier("d:1");
      auto list = params.initLabels(static_cast<unsigned>(labels.size()));
      for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(labels[i]));
    });
  };
  EXPECT_EQ(tag({"red", "blue"}), "tags d:1 red blue: done");
  EXPECT_EQ(tag({}), "tags d:1: done");
  EXPECT_EQ(tag({"red", ""}), "nothing: no item");
  EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, EINVAL));
}

TEST_F(ChangesServer, RefusesWhatAnItemDoesNotAllow) {
  EXPECT_EQ(rename("fixed", "new"), "nothing: no item");
  EXPECT_TRUE(error_->is(NSCocoaErrorDomain, NSFileWriteNoPermissionError));
  EXPECT_EQ(error_->localizedDescription(), "\"name of fixed\" cannot be renamed");
  EXPECT_EQ(
      change(&Changes::Client::deleteRequest, [](auto params) { params.setIdentifier("fixed"); }),
      "nothing: no item");
  EXPECT_EQ(error_->localizedDescription(), "\"name of fixed\" cannot be deleted");
  EXPECT_EQ(change(&Changes::Client::createDirectoryRequest,
                   [](auto params) {
                     params.setName(wireData("new"));
                     params.setParent("fixed");
                   }),
            "nothing: no item");
  EXPECT_EQ(error_->localizedDescription(), "\"name of fixed\" cannot be added to");
  EXPECT_EQ(change(&Changes::Client::importDocumentRequest,
                   [](auto params) {
                     params.setPath(wireData("/tmp/new"));
                     params.setParent("fixed");
                   }),
            "nothing: no item");
  EXPECT_EQ(change(&Changes::Client::reparentRequest,
                   [](auto params) {
                     params.setIdentifier("d:1");
                     params.setParent("fixed");
                   }),
            "nothing: no item");
  EXPECT_EQ(change(&Changes::Client::untrashRequest,
                   [](auto params) {
                     params.setIdentifier("d:1");
                     params.setParent("fixed");
                   }),
            "nothing: no item");
  EXPECT_EQ(rename("unknown", "new"), "rename unknown new: done")
      << "what is not known is the extension's to say";
}

TEST_F(ChangesServer, HandsOnErrorsWithTheItemInTheWay) {
  extension_->failure = fileProviderErrorForCollisionWithItem(itemNamed("in the way"));
  EXPECT_EQ(rename("d:1", "new"), "rename d:1 new: no item");
  ASSERT_TRUE(error_->is(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision));
  const auto object = std::get<NSObjectRef>(error_->userInfo().at(NSFileProviderErrorItemKey));
  const auto* const item = dynamic_cast<const NSFileProviderItem*>(object.get());
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->itemIdentifier(), "in the way");
}

TEST_F(ChangesServer, AnswersOnceWhateverTheExtensionDoes) {
  extension_->answersNothing = true;
  EXPECT_EQ(rename("d:1", "new"), "rename d:1 new: no item");
  EXPECT_EQ(error_, nullptr) << "neither an item nor an error is an answer too";
  extension_->answersNothing = false;
  extension_->answersTwice = true;
  EXPECT_EQ(rename("d:1", "new"), "rename d:1 new: done");
  extension_->forgets = true;
  EXPECT_EQ(rename("d:1", "new"), "rename d:1 new: no item");
  ASSERT_NE(error_, nullptr);
  EXPECT_TRUE(error_->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ChangesServer, RefusesWhatIsTooLongAndWhatIsNoPath) {
  EXPECT_EQ(rename(std::string(5'000, 'x'), "new"), "nothing: no item");
  EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, EINVAL));
  EXPECT_EQ(change(&Changes::Client::importDocumentRequest,
                   [](auto params) {
                     params.setPath(wireData("relative"));
                     params.setParent("i:1");
                   }),
            "nothing: no item");
  EXPECT_TRUE(error_->is(NSPOSIXErrorDomain, EINVAL));
}

}  // namespace
}  // namespace yomber
