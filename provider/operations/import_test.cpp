#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/xattr.h>

#include "platform/foundation/fault_attributes.h"
#include "platform/ostrell/errors.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

class ImportTest : public OperationsTest {
 protected:
  ImportTest() {
    std::filesystem::create_directory(outside);
    addFolder(7, "folder");
    log.forget();
  }

  std::string makeSource(const std::string& name) const {
    std::ofstream(outside + "/" + name) << "from outside";
    return outside + "/" + name;
  }
  void import(const std::string& source, const std::string& parent = "i:7") {
    extension->importDocumentAtURL(NSURL::fileURLWithPath(source), parent, into(items));
  }
  static std::string importLine(const std::string& source, const std::string& parent) {
    return "[DEBUG] ┏# importing document at " + textOf(source) + " to " + parent;
  }

  const std::string outside = daemon.home() + "/outside";
};

TEST_F(ImportTest, ADocumentIsPlacedInTheFolderAndDescribedAfterAScan) {
  const std::string source = makeSource("new.txt");
  const std::string target = inRoot("folder/new.txt");
  know(5, target);
  import(source);
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "d:5");
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_EQ(contentOf(target), "from outside");
  EXPECT_TRUE(exists(source));
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {target, "true"}}));
  expectLines({"[DEBUG] ┏# asked url for i:7", importLine(source, textOf(inRoot("folder"))),
               "[DEBUG] got new URL " + textOf(target) + "; (null)"});
}

TEST_F(ImportTest, TheSectionClosesWhenTheCallReturns) {
  const std::string source = makeSource("new.txt");
  know(5, inRoot("folder/new.txt"));
  daemon.hold("itemAtLocation");
  import(source);
  EXPECT_TRUE(isClosed(importLine(source, textOf(inRoot("folder")))));
  ASSERT_TRUE(daemon.waitForCalls("itemAtLocation"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  EXPECT_EQ(only(items).identifier(), "d:5");
}

TEST_F(ImportTest, WithoutTheFolderItAnswersAtOnceWhichOneIsMissing) {
  const std::string source = makeSource("new.txt");
  import(source, "i:8");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "i:8");
  EXPECT_EQ(only(items).item, nullptr);
  expectLines({"[DEBUG] ┏# asked url for i:8", importLine(source, "(null)")});
}

TEST_F(ImportTest, AClashCarriesTheItemInTheWay) {
  addDocument(5, "folder/new.txt", "old");
  import(makeSource("new.txt"));
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  ASSERT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1001");
  const auto& object =
      std::get<NSObjectRef>(answer.error->userInfo().at(NSFileProviderErrorItemKey));
  EXPECT_EQ(std::dynamic_pointer_cast<const NSFileProviderItem>(object)->itemIdentifier(), "d:5");
  EXPECT_EQ(contentOf(inRoot("folder/new.txt")), "old");
}

TEST_F(ImportTest, AnotherFailureIsAnsweredAsItIs) {
  import(outside + "/nothing.txt");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.countContaining("[DEBUG] got new URL (null); "), 1U);
}

TEST_F(ImportTest, AFailureThatOtherOperationsTranslateIsAnsweredAsItIs) {
  const std::string source = makeSource("away.txt");
  ASSERT_EQ(setxattr(source.c_str(), kFaultAttribute, "x", 1, 0), 0);
  import(source);
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSCocoaErrorDomain 4354");
  EXPECT_FALSE(exists(inRoot("folder/away.txt")));
}

TEST_F(ImportTest, ADocumentThatCannotBeLookedUpAnswersNeitherItemNorError) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4354);
  failLookupsWith(error);
  import(makeSource("new.txt"));
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_TRUE(exists(inRoot("folder/new.txt")));
  EXPECT_EQ(log.countContaining("[DEBUG] couldn't find item after importing it: "), 1U);
}

TEST_F(ImportTest, NobodyNeedsToBeSignedInAndHandlersMayBeEmpty) {
  setAccount({});
  extension->importDocumentAtURL(NSURL::fileURLWithPath(makeSource("a")), "i:8", nullptr);
  extension->importDocumentAtURL(NSURL::fileURLWithPath(makeSource("b")), "i:7", nullptr);
  extension->importDocumentAtURL(NSURL::fileURLWithPath(outside + "/none"), "i:7", nullptr);
  extension->createDirectoryWithName("c", "i:8", nullptr);
  extension->createDirectoryWithName("d", "i:7", nullptr);
  EXPECT_TRUE(daemon.waitForCalls("itemAtLocation", 2));
  EXPECT_TRUE(log.waitFor(LogLevel::Debug,
                          "[DEBUG] got new URL " + textOf(inRoot("folder/d")) + "; (null)"));
  EXPECT_EQ(daemon.callCount("account"), 0U);
}

// ---- Folders ------------------------------------------------------------------------------------

class DirectoryCreationTest : public ImportTest {
 protected:
  void create(const std::string& name, const std::string& parent = "i:7") {
    extension->createDirectoryWithName(name, parent, into(items));
  }
};

TEST_F(DirectoryCreationTest, AFolderIsMadeAndDescribedAfterAScan) {
  const std::string target = inRoot("folder/new");
  daemon.addItem(scriptedFolder(9, "new"), target);
  create("new");
  const auto answer = only(items);
  EXPECT_EQ(answer.identifier(), "i:9");
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_TRUE(std::filesystem::is_directory(target));
  EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {target, "true"}}));
  // Unlike an import, it says what it does before it looks for the folder.
  expectLines({"[DEBUG] ┏# creating directory new under i:7", "[DEBUG] ┏# asked url for i:7",
               "[DEBUG] got new URL " + textOf(target) + "; (null)"});
}

TEST_F(DirectoryCreationTest, TheSectionClosesWhenTheCallReturns) {
  daemon.addItem(scriptedFolder(9, "new"), inRoot("folder/new"));
  daemon.hold("itemAtLocation");
  create("new");
  EXPECT_TRUE(isClosed("[DEBUG] ┏# creating directory new under i:7"));
  EXPECT_TRUE(items->values().empty());
  daemon.release("itemAtLocation");
  EXPECT_EQ(only(items).identifier(), "i:9");
}

TEST_F(DirectoryCreationTest, AFolderThatIsThereIsAnswered) {
  addFolder(9, "folder/there");
  create("there");
  EXPECT_EQ(only(items).identifier(), "i:9");
}

TEST_F(DirectoryCreationTest, WithoutTheParentItAnswersWhichOneIsMissing) {
  create("new", "i:8");
  ASSERT_EQ(items->values().size(), 1U);
  EXPECT_EQ(missingIdentifier(only(items).error), "i:8");
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# creating directory new under i:8"), 1U);
}

TEST_F(DirectoryCreationTest, AFileInTheWayIsAClashThatCarriesIt) {
  addDocument(5, "folder/taken");
  create("taken");
  EXPECT_EQ(domainAndCode(only(items).error), "NSFileProviderErrorDomain -1001");
}

TEST_F(DirectoryCreationTest, AFileInTheWayThatIsNoItemIsAPlainClash) {
  makeFile("folder/taken");
  create("taken");
  EXPECT_EQ(domainAndCode(only(items).error), "NSCocoaErrorDomain 516");
}

TEST_F(DirectoryCreationTest, ANameThatNoFileCanHaveIsAnsweredAsItIs) {
  create("a/b");
  EXPECT_EQ(domainAndCode(only(items).error), "NSCocoaErrorDomain 514");
}

TEST_F(DirectoryCreationTest, AFolderThatCannotBeLookedUpAnswersWhyAndNoLineOfAnImport) {
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  create("new");
  const auto answer = only(items);
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1003");
  EXPECT_EQ(log.countContaining("couldn't find item after importing it"), 0U);
}

}  // namespace
}  // namespace yomber
