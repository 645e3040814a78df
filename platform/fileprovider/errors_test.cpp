#include "platform/fileprovider/errors.h"

#include <gtest/gtest.h>

#include "platform/fileprovider/extension.h"
#include "platform/fileprovider/wire_item.h"

namespace yomber {
namespace {

TEST(FileProviderErrors, MissingItemCarriesItsIdentifier) {
  const auto error = fileProviderErrorForNonExistentItemWithIdentifier("d:5");
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, -1005));
  EXPECT_EQ(
      std::get<std::string>(error->userInfo().at(NSFileProviderErrorNonExistentItemIdentifierKey)),
      "d:5");
}

TEST(FileProviderErrors, CollisionCarriesTheVeryItem) {
  ItemFields fields;
  fields.filename = "notes";
  const NSFileProviderItemRef item = std::make_shared<WireItem>(fields);
  const auto error = fileProviderErrorForCollisionWithItem(item);
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, -1001));
  EXPECT_EQ(std::get<NSObjectRef>(error->userInfo().at(NSFileProviderErrorItemKey)), item);
  EXPECT_TRUE(fileProviderErrorForCollisionWithItem(nullptr)->userInfo().empty());
}

TEST(InitialPages, AreToldApart) {
  EXPECT_FALSE(
      NSFileProviderInitialPageSortedByDate->isEqualToData(NSFileProviderInitialPageSortedByName));
}

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

TEST(FileProviderExtension, AnswersEachHandlerOnceAndTakesNone) {
  NSFileProviderExtension extension;
  int calls = 0;
  const auto handler = [&](const NSErrorRef& error) {
    ++calls;
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, 3328));
  };
  extension.startProvidingItemAtURL(NSURL::fileURLWithPath("/x"), handler);
  extension.providePlaceholderAtURL(NSURL::fileURLWithPath("/x"), handler);
  EXPECT_EQ(calls, 2);
  extension.startProvidingItemAtURL(nullptr, nullptr);
  extension.providePlaceholderAtURL(nullptr, nullptr);
}

}  // namespace
}  // namespace yomber
