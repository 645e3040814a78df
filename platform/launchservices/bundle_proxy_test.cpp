#include "platform/launchservices/bundle_proxy.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <vector>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

using Strings = std::vector<std::string>;

class BundleProxyTest : public testing::Test {
 protected:
  BundleProxyTest() {
    setenv("XDG_DATA_HOME", (directory / "user").c_str(), 1);
    setenv("XDG_DATA_DIRS", (directory / "system").c_str(), 1);
  }
  ~BundleProxyTest() override {
    unsetenv("XDG_DATA_HOME");
    unsetenv("XDG_DATA_DIRS");
  }
  void install(const std::string& file, const std::string& keys) const {
    const std::filesystem::path path = directory / file;
    std::filesystem::create_directories(path.parent_path());
    EXPECT_TRUE(std::ofstream(path) << "[Desktop Entry]\n" << keys);
  }
  static std::optional<NSPropertyValue> entitlement(const std::string& key,
                                                    const std::string& of = "org.example.Notes") {
    const auto proxy = LSBundleProxy::bundleProxyForIdentifier(of);
    return proxy ? proxy->entitlementValuesForKeys({key}).objectForKey(key) : std::nullopt;
  }

  TemporaryDirectory directory;
};

TEST_F(BundleProxyTest, AnApplicationThatIsNotInstalledIsNil) {
  EXPECT_EQ(LSBundleProxy::bundleProxyForIdentifier("org.example.Notes"), nullptr);
  EXPECT_EQ(LSBundleProxy::bundleProxyForIdentifier(""), nullptr);
  EXPECT_EQ(LSBundleProxy::bundleProxyForIdentifier("../../etc/passwd"), nullptr);
}

TEST_F(BundleProxyTest, EntitlementsComeFromTheDesktopFile) {
  install("system/applications/org.example.Notes.desktop",
          "Name=Notes\nX-Yomber-Container=org.example.Notes\nX-Yomber-Containers=org.b;org.c\n"
          "X-Yomber-Shared-Containers=org.shared\nX-Yomber-Services=Documents;Sharing\n");
  const auto proxy = LSBundleProxy::bundleProxyForIdentifier("org.example.Notes");
  ASSERT_NE(proxy, nullptr);
  EXPECT_EQ(proxy->bundleIdentifier(), "org.example.Notes");
  EXPECT_EQ(entitlement("application-identifier"), NSPropertyValue("org.example.Notes"));
  EXPECT_EQ(entitlement("X-Yomber-Containers"),
            NSPropertyValue(Strings{"org.example.Notes", "org.b", "org.c"}));
  EXPECT_EQ(entitlement("X-Yomber-Shared-Containers"), NSPropertyValue(Strings{"org.shared"}));
  EXPECT_EQ(entitlement("X-Yomber-Services"), NSPropertyValue(Strings{"Documents", "Sharing"}));
}

TEST_F(BundleProxyTest, OnlyTheKeysAskedForAreAnswered) {
  install("user/applications/org.example.Notes.desktop", "X-Yomber-Services=Documents\n");
  const auto values = LSBundleProxy::bundleProxyForIdentifier("org.example.Notes")
                          ->entitlementValuesForKeys({"X-Yomber-Services", "X-Yomber-Containers"});
  EXPECT_TRUE(values.objectForKey("X-Yomber-Services"));
  EXPECT_FALSE(values.objectForKey("X-Yomber-Containers"));
  EXPECT_FALSE(values.objectForKey("application-identifier"));
}

TEST_F(BundleProxyTest, TheUsersFileStandsInForTheSystems) {
  install("system/applications/sub/notes.desktop", "X-Yomber-Containers=org.system\n");
  EXPECT_EQ(entitlement("X-Yomber-Containers", "sub-notes"),
            NSPropertyValue(Strings{"org.system"}));
  install("user/applications/sub-notes.desktop", "X-Yomber-Containers=org.user\n");
  EXPECT_EQ(entitlement("X-Yomber-Containers", "sub-notes"), NSPropertyValue(Strings{"org.user"}));
  install("user/applications/sub-notes.desktop", "Hidden=true\n");
  EXPECT_EQ(LSBundleProxy::bundleProxyForIdentifier("sub-notes"), nullptr);
}

TEST_F(BundleProxyTest, ContainersThatAreNotValidAreLeftOut) {
  install("user/applications/org.example.Notes.desktop",
          "X-Yomber-Containers=../etc;org.a\nX-Yomber-Shared-Containers=..\n");
  EXPECT_EQ(entitlement("X-Yomber-Containers"), NSPropertyValue(Strings{"org.a"}));
  EXPECT_FALSE(entitlement("X-Yomber-Shared-Containers"));
}

}  // namespace
}  // namespace yomber
