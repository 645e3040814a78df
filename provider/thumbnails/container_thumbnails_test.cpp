#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "platform/foundation/notification_center.h"
#include "provider/testing/thumbnail_fixture.h"

namespace yomber {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

class ContainerThumbnailsTest : public ThumbnailTest {
 protected:
  void addContainer(const std::string& containerID, const std::string& iconName,
                    std::uint64_t rawID = 7000) {
    const std::string documents = daemon.home() + "/tree/" + containerID + "/Documents";
    std::filesystem::create_directories(documents);
    daemon.addContainer({containerID, "App", documents, "org.example.App.desktop", iconName});
    daemon.addItem(scriptedFolder(rawID, "App"), documents);
  }
  ThumbnailAnswer thumbnailOf(const std::string& containerID, CGSize size) {
    extension->_fetchThumbnailForContainerID(
        containerID, "i:7000", size, QSContainer::allContainersByContainerID(),
        [this](const NSFileProviderItemIdentifier& identifier, const NSDataRef& data,
               const std::optional<std::string>& type,
               const NSErrorRef& error) { thumbnails->add({identifier, data, type, error}); });
    return onlyThumbnail();
  }
  CGSize properSize(double width, double height) {
    return extension->_properSizeForContainerThumbnail({.width = width, .height = height});
  }
};

constexpr CGSize kIconSize{.width = 48, .height = 48};

TEST_F(ContainerThumbnailsTest, ALargeSizeIsCutToTheLargestThatIconsHave) {
  EXPECT_EQ(properSize(300, 200), (CGSize{.width = 120, .height = 120}));
  EXPECT_THAT(log.texts(),
              ElementsAre("[DEBUG] width (300.00) is greater than max width (120.00)",
                          "[DEBUG] height (200.00) is greater than max height (120.00)"));
}

TEST_F(ContainerThumbnailsTest, ASizeThatIsNoSquareIsMadeTheSquareOfItsSmallerSide) {
  EXPECT_EQ(properSize(64, 100), (CGSize{.width = 64, .height = 64}));
  EXPECT_EQ(properSize(100, 64), (CGSize{.width = 64, .height = 64}));
  EXPECT_EQ(properSize(300, 64), (CGSize{.width = 64, .height = 64}));
  const std::string should = " should be equal for container's thumbnail";
  EXPECT_THAT(log.texts(), ElementsAre("[DEBUG] width (64.00) and height (100.00)" + should,
                                       "[DEBUG] width (100.00) and height (64.00)" + should,
                                       "[DEBUG] width (300.00) is greater than max width (120.00)",
                                       "[DEBUG] width (120.00) and height (64.00)" + should));
}

TEST_F(ContainerThumbnailsTest, ASizeThatFitsIsLeftWithoutALine) {
  EXPECT_EQ(properSize(120, 120), (CGSize{.width = 120, .height = 120}));
  EXPECT_THAT(log.texts(), IsEmpty());
}

TEST_F(ContainerThumbnailsTest, AnIconOfTheThemeIsAnsweredAsItIs) {
  addContainer("org.example.App", "notes");
  const auto answer = thumbnailOf("org.example.App", kIconSize);
  EXPECT_EQ(answer.identifier, "i:7000");
  EXPECT_EQ(answer.image(), png(48));
  EXPECT_EQ(answer.type, std::nullopt);
  EXPECT_EQ(answer.error, nullptr);
}

TEST_F(ContainerThumbnailsTest, ABareIconIsMarkedForWhoeverShowsIt) {
  writeFile(dataHome() + "/bare.png", png(32));
  addContainer("org.example.App", dataHome() + "/bare.png");
  const auto answer = thumbnailOf("org.example.App", kIconSize);
  EXPECT_EQ(answer.image(), png(32));
  EXPECT_EQ(answer.type, "com.kelvo.fileprovider.qs-undecorated-container");
}

TEST_F(ContainerThumbnailsTest, AnUnknownContainerIsAMissingItem) {
  const auto answer = thumbnailOf("org.stray", kIconSize);
  EXPECT_EQ(answer.data, nullptr);
  EXPECT_EQ(answer.type, std::nullopt);
  EXPECT_EQ(missingIdentifier(answer.error), "i:7000");
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't find container with ID org.stray"), 1U);
}

TEST_F(ContainerThumbnailsTest, AContainerWithoutAnIconIsAnInvalidSize) {
  addContainer("org.example.App", "no such icon");
  const auto answer = thumbnailOf("org.example.App", kIconSize);
  EXPECT_EQ(answer.data, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "QSOstrellErrorDomain 3");
  EXPECT_EQ(std::get<std::string>(answer.error->userInfo().at(QSOstrellErrorParameterKey)), "size");
  EXPECT_EQ(std::get<std::string>(answer.error->userInfo().at(QSOstrellErrorValueKey)),
            "{48.00, 48.00}");
  EXPECT_EQ(log.count(LogLevel::Error,
                      "[ERROR] can't find image with size {48.00, 48.00} for org.example.App"),
            1U);
}

TEST_F(ContainerThumbnailsTest, AMissingHandlerIsToleratedEverywhere) {
  addContainer("org.example.App", "notes");
  addContainer("org.example.Plain", "no such icon");
  const auto known = QSContainer::allContainersByContainerID();
  for (const char* id : {"org.example.App", "org.example.Plain", "org.stray"}) {
    extension->_fetchThumbnailForContainerID(id, "i:7000", kIconSize, known, {});
  }
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't find container with ID org.stray"), 1U);
}

TEST_F(ContainerThumbnailsTest, ARequestForAContainersFolderNeedsNoRecords) {
  addContainer("org.example.App", "notes");
  (void)QSContainer::allContainersByContainerID();  // its folder is known by the list
  EXPECT_EQ(fetchAll({"i:7000"}, {.width = 300, .height = 48}), nullptr);
  EXPECT_EQ(onlyThumbnail().image(), png(48));
  EXPECT_EQ(daemon.callCount("contentRecords"), 0U);
  expectLines(
      {"[DEBUG] width (300.00) is greater than max width (120.00)",
       "[DEBUG] width (120.00) and height (48.00) should be equal for container's thumbnail",
       "[DEBUG] no thumbnail left to fetch"});
}

TEST_F(ContainerThumbnailsTest, TheContainersAreAskedForOnceThoughTheirListChangesMeanwhile) {
  writeFile(dataHome() + "/bare.png", png(32));
  addContainer("org.example.App", "notes");
  addContainer("org.example.Bare", dataHome() + "/bare.png", 7001);
  Gate changed;
  const auto observer = std::make_shared<int>(0);
  NSNotificationCenter::defaultCenter().addObserver(observer, QSContainerListDidChangeNotification,
                                                    [&] { changed.open(); });
  whenAnswered = [&](const std::string& identifier) {
    if (identifier != "i:7000") return;
    daemon.postContainerListDidChange();  // the library forgets the list that it had
    EXPECT_TRUE(changed.wait());
  };
  EXPECT_EQ(fetchAll({"i:7000", "i:7001"}), nullptr);
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(2));
  EXPECT_EQ(answers[0].identifier, "i:7000");
  EXPECT_EQ(answers[0].image(), png(48));
  EXPECT_EQ(answers[0].type, std::nullopt);
  EXPECT_EQ(answers[1].identifier, "i:7001");
  EXPECT_EQ(answers[1].image(), png(32));
  EXPECT_EQ(answers[1].type, "com.kelvo.fileprovider.qs-undecorated-container");
  EXPECT_EQ(daemon.callCount("containers"), 1U);
  NSNotificationCenter::defaultCenter().removeObserver(observer.get());
}

TEST_F(ContainerThumbnailsTest, ARequestWithoutAContainersFolderDoesNotAskForTheContainers) {
  addFolder(20, "folder");
  addRecord(10, "picture");
  EXPECT_EQ(fetchAll({"i:20", "d:10", "rubbish"}), nullptr);
  EXPECT_THAT(thumbnails->values(), SizeIs(3));
  EXPECT_EQ(daemon.callCount("containers"), 0U);
}

}  // namespace
}  // namespace yomber
