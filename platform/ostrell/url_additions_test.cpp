#include "platform/ostrell/url_additions.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/ostrell/errors.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

class URLAdditionsTest : public testing::Test {
 protected:
  NSURLRef inRoot(const std::string& name) const {
    return NSURL::fileURLWithPath(daemon.root() + "/" + name);
  }
  NSURLRef link(const std::string& name, const std::string& target) const {
    auto url = inRoot(name);
    EXPECT_EQ(symlink(target.c_str(), url->path().c_str()), 0);
    return url;
  }
  NSURLRef file(const std::string& name) const {
    auto url = inRoot(name);
    std::filesystem::create_directories(url->URLByDeletingLastPathComponent()->path());
    EXPECT_TRUE(std::ofstream(url->path()) << "content");
    return url;
  }
  static NSURLRef resolve(const NSURLRef& url, NSErrorRef* error = nullptr) {
    return qs_URLByResolvingExternalDocumentReferenceWithError(url, error);
  }

  ScriptedDaemon daemon;
};

TEST_F(URLAdditionsTest, DocumentLocationsComeFromTheDaemon) {
  daemon.addItem(scriptedDocument(5, "five.txt"), daemon.root() + "/five.txt");
  NSErrorRef error;
  const auto url =
      qs_documentURLFromFileObjectID(QSFileObjectID::fileObjectIDWithString("d:5"), &error);
  ASSERT_TRUE(url);
  EXPECT_FALSE(error);
  EXPECT_EQ(url->path(), daemon.root() + "/five.txt");
  EXPECT_EQ(daemon.calls().back(), (ScriptedDaemon::Call{"documentLocation", {"d:5"}}));
  EXPECT_FALSE(
      qs_documentURLFromFileObjectID(QSFileObjectID::fileObjectIDWithString("i:5"), &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(URLAdditionsTest, APathThatIsNoneIsNoLocation) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.documentLocation = [](const QSFileObjectID&) {
      return ScriptedDaemon::Location{"not/absolute", nullptr};
    };
  });
  NSErrorRef error;
  EXPECT_FALSE(
      qs_documentURLFromFileObjectID(QSFileObjectID::fileObjectIDWithString("d:5"), &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(URLAdditionsTest, LocalQuestionsAskNobody) {
  const auto target = file("folder/target.txt");
  const auto bookmark = link("bookmark", "folder/target.txt");
  EXPECT_TRUE(qs_isExternalDocumentReference(bookmark));
  EXPECT_EQ(resolve(bookmark)->path(), target->path());
  EXPECT_TRUE(qs_isInSyncedLocation(target));
  EXPECT_FALSE(qs_isInOstrellPrivateStorages(target));
  EXPECT_FALSE(qs_wouldBeExcludedFromSync(target));
  EXPECT_TRUE(qs_wouldBeExcludedFromSync(inRoot("a.part/b")));
  EXPECT_TRUE(qs_isInOstrellPrivateStorages(NSURL::fileURLWithPath(daemon.home() + "/private/x")));
  EXPECT_TRUE(qs_containerIDIfIsDocumentsContainerURL(inRoot("Desktop")));
  EXPECT_EQ(daemon.connectionCount(), 0U);
  EXPECT_TRUE(daemon.calls().empty());
}

TEST_F(URLAdditionsTest, BookmarksAreLinksThatLeadIntoTheDrive) {
  const auto target = file("folder/target.txt");
  EXPECT_TRUE(qs_isExternalDocumentReference(link("absolute", target->path())));
  EXPECT_TRUE(qs_isExternalDocumentReference(link("folder/up", "../folder/./target.txt")));
  EXPECT_TRUE(qs_isExternalDocumentReference(link("dangling", "nothing")));
  EXPECT_TRUE(qs_isExternalDocumentReference(link("to folder", "folder")));
  EXPECT_FALSE(qs_isExternalDocumentReference(link("outside", "/etc/passwd")));
  EXPECT_FALSE(qs_isExternalDocumentReference(
      link("climbing", "../../../../../../../../../../../../../../etc/passwd")));
  EXPECT_FALSE(qs_isExternalDocumentReference(link("to private", daemon.home() + "/private/x")));
  EXPECT_FALSE(qs_isExternalDocumentReference(target));
  EXPECT_FALSE(qs_isExternalDocumentReference(inRoot("folder")));
  EXPECT_FALSE(qs_isExternalDocumentReference(inRoot("missing")));
  const std::string elsewhere = daemon.home() + "/private/link";
  ASSERT_EQ(symlink(target->path().c_str(), elsewhere.c_str()), 0);
  EXPECT_FALSE(qs_isExternalDocumentReference(NSURL::fileURLWithPath(elsewhere)));
}

TEST_F(URLAdditionsTest, ResolvingFollowsChainsAndFolders) {
  const auto target = file("folder/target.txt");
  link("second", "folder/target.txt");
  link("alias folder", "folder");
  EXPECT_EQ(resolve(link("first", "second"))->path(), target->path());
  EXPECT_EQ(resolve(link("through", "alias folder/target.txt"))->path(), target->path());
}

TEST_F(URLAdditionsTest, ResolvingSaysWhyItCannot) {
  NSErrorRef error;
  EXPECT_FALSE(resolve(link("dangling", "nothing"), &error));
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  link("loop a", "loop b");
  EXPECT_FALSE(resolve(link("loop b", "loop a"), &error));
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ELOOP));
  link("way out", "/etc/passwd");
  EXPECT_FALSE(resolve(link("first", "way out"), &error));
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EXDEV));
  EXPECT_FALSE(resolve(inRoot("dangling")));  // no one to tell
}

TEST_F(URLAdditionsTest, ThePhysicalMarkIsSetInPlace) {
  const auto url = inRoot("a");
  qs_addPhysicalProperty(url);
  EXPECT_TRUE(url->hasMark(NSURL::Mark::Physical));
}

TEST_F(URLAdditionsTest, NilAnswersNothing) {
  NSErrorRef error;
  EXPECT_FALSE(qs_documentURLFromFileObjectID(nullptr, &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_FALSE(qs_isExternalDocumentReference(nullptr));
  EXPECT_FALSE(qs_URLByResolvingExternalDocumentReferenceWithError(nullptr, nullptr));
  EXPECT_FALSE(qs_isInOstrellPrivateStorages(nullptr));
  EXPECT_FALSE(qs_wouldBeExcludedFromSync(nullptr));
  EXPECT_FALSE(qs_isInSyncedLocation(nullptr));
  EXPECT_FALSE(qs_containerIDIfIsDocumentsContainerURL(nullptr));
  qs_addPhysicalProperty(nullptr);
  EXPECT_TRUE(daemon.calls().empty());
}

TEST(OstrellErrors, CarryWhatTheyName) {
  EXPECT_TRUE(qsc_errorLoggedOut()->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
  const auto error = qsc_errorInvalidParameter("bundleIdentifier", "org.example");
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
  EXPECT_EQ(std::get<std::string>(error->userInfo().at(QSOstrellErrorParameterKey)),
            "bundleIdentifier");
  EXPECT_EQ(std::get<std::string>(error->userInfo().at(QSOstrellErrorValueKey)), "org.example");
  EXPECT_FALSE(qsc_errorInvalidParameter("bundleIdentifier", std::nullopt)
                   ->userInfo()
                   .contains(QSOstrellErrorValueKey));
}

}  // namespace
}  // namespace yomber
