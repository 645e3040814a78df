#include "platform/ostrell/container.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/notification_center.h"
#include "platform/ostrell/awaited.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/scripted_daemon.h"
#include "platform/ostrell/url_additions.h"

namespace yomber {
namespace {

class ContainerTest : public testing::Test {
 protected:
  ScriptedDaemon::Container application() {
    return {"org.example.App", "App",
            DriveLocations(daemon.home()).containerDocuments("org.example.App"),
            "org.example.App.desktop", "app-icon"};
  }

  ScriptedDaemon daemon;
};

TEST_F(ContainerTest, TheListIsASnapshot) {
  daemon.addContainer(application());
  const auto all = QSContainer::allContainersByContainerID();
  ASSERT_EQ(all.size(), 4U);
  EXPECT_EQ(all.at(QSUbiquitousDefaultContainerID)->documentsURL()->path(), daemon.root());
  const auto& app = all.at("org.example.App");
  EXPECT_EQ(app->containerID(), "org.example.App");
  EXPECT_EQ(app->displayName(), "App");
  EXPECT_EQ(app->applicationID(), "org.example.App.desktop");
  EXPECT_EQ(app->iconName(), "app-icon");
  EXPECT_EQ(QSContainer::allContainers().size(), 4U);
  EXPECT_EQ(QSContainer::allContainersByContainerID().at("org.example.App"), app);
  EXPECT_EQ(daemon.callCount("containers"), 1U);
}

TEST_F(ContainerTest, WithoutADaemonItIsEmptyAndNotKept) {
  daemon.stop();
  EXPECT_TRUE(QSContainer::allContainers().empty());
  EXPECT_TRUE(QSContainer::allContainersByContainerID().empty());
  daemon.start();
  EXPECT_EQ(QSContainer::allContainers().size(), 3U);
}

TEST_F(ContainerTest, AChangeIsAnnouncedAfterTheSnapshotIsGone) {
  EXPECT_EQ(QSContainer::allContainers().size(), 3U);
  const auto observer = std::make_shared<int>(0);
  Awaited<std::size_t> sizes;
  NSNotificationCenter::defaultCenter().addObserver(
      observer, QSContainerListDidChangeNotification,
      [&] { sizes.add(QSContainer::allContainers().size()); });
  daemon.addContainer(application());
  daemon.postContainerListDidChange();
  EXPECT_EQ(sizes.wait(), std::vector<std::size_t>{4});
  // Asking for the list is enough for hearing of a daemon that was lost and is back.
  daemon.stop();
  daemon.start();
  EXPECT_EQ(sizes.wait(2), (std::vector<std::size_t>{4, 4}));
  NSNotificationCenter::defaultCenter().removeObserver(observer.get());
}

TEST_F(ContainerTest, DocumentsFoldersAreToldByPathAndSnapshot) {
  daemon.addContainer(application());
  const auto idOf = [](const std::string& path) {
    return qs_containerIDIfIsDocumentsContainerURL(NSURL::fileURLWithPath(path));
  };
  const DriveLocations locations(daemon.home());
  const std::string stray = locations.containerDocuments("org.stray");
  EXPECT_EQ(idOf(stray), "org.stray");  // nothing better is known yet, and nobody is asked
  EXPECT_EQ(daemon.connectionCount(), 0U);
  ASSERT_FALSE(QSContainer::allContainers().empty());
  EXPECT_EQ(idOf(stray), std::nullopt);
  EXPECT_EQ(idOf(application().documentsPath), "org.example.App");
  EXPECT_EQ(idOf(daemon.root()), QSUbiquitousDefaultContainerID);
  EXPECT_EQ(idOf(daemon.root() + "/Desktop"), QSUbiquitousDesktopContainerID);
  EXPECT_EQ(idOf(daemon.root() + "/folder"), std::nullopt);
  EXPECT_EQ(daemon.callCount("containers"), 1U);
}

}  // namespace
}  // namespace yomber
