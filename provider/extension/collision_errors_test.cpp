#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fileprovider/file_operations.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;

class CollisionErrorsTest : public OperationsTest {
 protected:
  static NSErrorRef clashAt(const NSURLRef& url) {
    NSErrorUserInfo userInfo;
    if (url != nullptr) userInfo[FPCollidingURLKey] = url;
    return NSError::errorWithDomain(NSCocoaErrorDomain, 516, std::move(userInfo));
  }
};

TEST_F(CollisionErrorsTest, NothingStaysNothing) {
  EXPECT_EQ(extension->fileProviderErrorFromFSError(nullptr), nullptr);
}

TEST_F(CollisionErrorsTest, AClashWithAnItemCarriesTheItem) {
  addDocument(5, "taken.txt");
  const auto error = extension->fileProviderErrorFromFSError(clashAt(urlInRoot("taken.txt")));
  EXPECT_EQ(domainAndCode(error), "NSFileProviderErrorDomain -1001");
  const auto& object = std::get<NSObjectRef>(error->userInfo().at(NSFileProviderErrorItemKey));
  const auto item = std::dynamic_pointer_cast<const NSFileProviderItem>(object);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->itemIdentifier(), "d:5");
  EXPECT_THAT(daemon.calls(),
              Contains(ScriptedDaemon::Call{"itemAtLocation", {inRoot("taken.txt"), "false"}}));
}

TEST_F(CollisionErrorsTest, AClashWithoutALocationIsTheVerySameError) {
  const auto error = clashAt(nullptr);
  EXPECT_EQ(extension->fileProviderErrorFromFSError(error), error);
}

TEST_F(CollisionErrorsTest, AClashWithWhatIsNoItemIsTheVerySameError) {
  for (const auto& url : {urlInRoot("unknown"), NSURL::fileURLWithPath("/etc/passwd")}) {
    const auto error = clashAt(url);
    EXPECT_EQ(extension->fileProviderErrorFromFSError(error), error);
  }
  EXPECT_EQ(log.countContaining("[ERROR]"), 0U);
}

TEST_F(CollisionErrorsTest, AnyOtherErrorIsTheVerySame) {
  addDocument(5, "taken.txt");
  for (const auto& [domain, code] :
       {std::pair(NSPOSIXErrorDomain, 17), std::pair(NSPOSIXErrorDomain, 516),
        std::pair(NSCocoaErrorDomain, 512)}) {
    const auto error =
        NSError::errorWithDomain(domain, code, {{FPCollidingURLKey, urlInRoot("taken.txt")}});
    EXPECT_EQ(extension->fileProviderErrorFromFSError(error), error);
  }
}

}  // namespace
}  // namespace yomber
