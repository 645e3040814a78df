#include "platform/fileprovider/errors.h"

#include <gtest/gtest.h>

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

}  // namespace
}  // namespace yomber
