#include "platform/foundation/gate.h"
#include "zarn/content/test_sharing.h"

namespace yomber {
namespace {

class SharesLoadTest : public TwoDrives {
 protected:
  /// Bob accepts a folder of so many documents.
  void accept(const std::string& name, std::size_t count) {
    ann->makeFolder(name);
    for (std::size_t i = 0; i < count; ++i)
      ann->write(name + "/" + std::to_string(i), "document " + std::to_string(i));
    ann->settle();
    const auto saved = ann->share(name, {editor("bob")});
    EXPECT_EQ(bob->accept(saved), nullptr);
    EXPECT_EQ(bob->names(name).size(), count);
  }
};

TEST_F(SharesLoadTest, AFolderOfSeveralPagesArrivesWhole) { accept("many", 2'500); }

TEST_F(SharesLoadTest, WhoIsLeftOutInTheMiddleOfADownloadHearsWhy) {
  ann->makeFolder("Plans");
  ann->write("Plans/large", std::string(5'000'000, 'x') + "end");
  ann->settle();
  const auto saved = ann->share("Plans", {editor("bob")});
  ASSERT_EQ(bob->accept(saved), nullptr);
  const std::string gate = storePath + "-go";
  ASSERT_EQ(FaultPoint::arm("zarn.fill.copying=pause-until-file:" + gate), nullptr);
  Answer answer;
  const auto wish = bob->engine->startProviding(bob->at("Plans/large"), 0, answer.take());
  ASSERT_TRUE(waitUntil([&] { return std::filesystem::exists(gate + ".reached"); }));
  ASSERT_NE(ann->share("Plans", {}), nullptr);
  std::string identifier = NSFileProviderRootContainerItemIdentifier;
  ASSERT_EQ(bob->shares().refresh(identifier), nullptr);
  const NSErrorRef error = answer.get();
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_NE(error->localizedDescription().find("no longer shared"), std::string::npos);
  std::ofstream(gate).put('x');
  ASSERT_TRUE(bob->engine->waitUntilIdle(SharingDrive::kPatience));
  EXPECT_EQ(bob->names(), std::vector<std::string>{});
  EXPECT_EQ(answer.calls(), 1);
}

}  // namespace
}  // namespace yomber
