#include "platform/fileprovider/extension.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "platform/fileprovider/errors.h"

namespace yomber {
namespace {

TEST(FileProviderExtension, AnswersWhatNobodyOverrides) {
  NSFileProviderExtension extension;
  NSErrorRef error;
  EXPECT_EQ(extension.URLForItemWithPersistentIdentifier("d:1"), nullptr);
  EXPECT_FALSE(extension.persistentIdentifierForItemAtURL(NSURL::fileURLWithPath("/x")));
  EXPECT_EQ(extension.itemForIdentifier("d:1", &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, 3328));
  EXPECT_EQ(extension.itemForIdentifier("d:1"), nullptr);
  error = nullptr;
  EXPECT_EQ(extension.enumeratorForContainerItemIdentifier("d:1", &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, 3328));
}

/// Calls every asynchronous operation, each with a handler made by `handler`.
template <typename Handler>
void callEverything(NSFileProviderExtension& extension, const Handler& handler) {
  const auto url = NSURL::fileURLWithPath("/x");
  extension.providePlaceholderAtURL(url, handler());
  extension.startProvidingItemAtURL(url, handler());
  extension.startProvidingItemAtURL(url, 1, handler());
  extension.movingItemAtURL(url, url, handler());
  extension.importDocumentAtURL(url, "i:1", handler());
  extension.createDirectoryWithName("name", "i:1", handler());
  extension.renameItemWithIdentifier("d:1", "name", handler());
  extension.reparentItemWithIdentifier("d:1", "i:1", std::nullopt, handler());
  extension.trashItemWithIdentifier("d:1", handler());
  extension.untrashItemWithIdentifier("d:1", std::nullopt, handler());
  extension.deleteItemWithIdentifier("d:1", handler());
  extension._trashItemAtURLWithoutCoordination(url, handler());
  extension.setLastUsedDate(NSDate(), "d:1", handler());
  extension.setTagData(NSData::dataWithString(""), "d:1", handler());
  extension.setFavoriteRank(1, "d:1", handler());
  extension._defaultApplicationContainerForBundleIdentifier(std::nullopt, handler());
}

/// A handler of whatever kind an operation takes; counts its calls.
struct CountingHandler {
  int* calls;
  void operator()(const NSErrorRef& error) const {
    ++*calls;
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFeatureUnsupportedError));
  }
  void operator()(bool flag, const NSErrorRef& error) const {
    EXPECT_FALSE(flag);
    (*this)(error);
  }
  void operator()(const NSObjectRef& result, const NSErrorRef& error) const {
    EXPECT_EQ(result, nullptr);
    (*this)(error);
  }
};

TEST(FileProviderExtension, AnswersEachHandlerOnceThatItIsUnsupported) {
  NSFileProviderExtension extension;
  int calls = 0;
  int operations = 0;
  callEverything(extension, [&] {
    ++operations;
    return CountingHandler{&calls};
  });
  EXPECT_EQ(operations, 16);
  EXPECT_EQ(calls, operations);
}

TEST(FileProviderExtension, TakesEmptyHandlers) {
  NSFileProviderExtension extension;
  callEverything(extension, [] { return nullptr; });
  extension.stopProvidingItemAtURL(nullptr);
  extension.itemChangedAtURL(nullptr);
}

/// Provides without looking at options.
class PlainExtension final : public NSFileProviderExtension {
 public:
  using NSFileProviderExtension::startProvidingItemAtURL;
  void startProvidingItemAtURL(const NSURLRef& url, ErrorHandler completionHandler) override {
    provided = url;
    completionHandler(nullptr);
  }
  NSURLRef provided;
};

TEST(FileProviderExtension, ProvidesWithOptionsAsWithoutThemWhenNobodyTellsThemApart) {
  PlainExtension extension;
  const auto url = NSURL::fileURLWithPath("/x");
  NSErrorRef error = NSError::errorWithErrno(EIO);
  extension.startProvidingItemAtURL(url, 0x20000, [&](NSErrorRef given) { error = given; });
  EXPECT_EQ(extension.provided, url);
  EXPECT_EQ(error, nullptr);
}

}  // namespace
}  // namespace yomber
