#include "mount/places.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

class PlacesTest : public ::testing::Test {
 protected:
  PlacesTest() {
    for (const std::string& folder : {root(), trash(), container()}) mkdir(folder.c_str(), 0700);
    places_ = Places::open(root(), trash(), &error_);
  }
  [[nodiscard]] std::string root() const { return directory_.path() + "/root"; }
  [[nodiscard]] std::string trash() const { return directory_.path() + "/trash"; }
  [[nodiscard]] std::string container() const { return directory_.path() + "/container"; }

  TemporaryDirectory directory_;
  NSErrorRef error_;
  std::unique_ptr<Places> places_;
};

TEST_F(PlacesTest, TheRootShowsTheTrash) {
  ASSERT_NE(places_, nullptr);
  const auto shown = places_->shownBases();
  ASSERT_EQ(shown.size(), 1U);
  EXPECT_EQ(shown[0].base, Places::kTrash);
  EXPECT_EQ(places_->base(shown[0].base).path, trash());
}

TEST_F(PlacesTest, AContainerIsShownUnderItsNameUntilItIsNot) {
  places_->showContainer(container(), "Notes");
  const auto base = places_->shownBase("Notes");
  ASSERT_TRUE(base.has_value());
  EXPECT_EQ(places_->base(*base).path, container());
  EXPECT_EQ(places_->shownNameOfBase(*base), "Notes");
  places_->showContainer(container(), "Pages");
  EXPECT_FALSE(places_->shownBase("Notes").has_value());
  EXPECT_EQ(places_->shownBase("Pages"), base);
  places_->showContainer(container(), "");
  EXPECT_FALSE(places_->shownBase("Pages").has_value());
}

TEST_F(PlacesTest, ALocationThatIsNotThereIsNotShown) {
  places_->showContainer(directory_.path() + "/none", "None");
  EXPECT_FALSE(places_->shownBase("None").has_value());
}

TEST_F(PlacesTest, NeitherTheRootNorTheTrashCanBeShownAsAContainer) {
  places_->showContainer(root(), "Again");
  places_->showContainer(trash(), "Rubbish");
  EXPECT_FALSE(places_->shownBase("Again").has_value());
  EXPECT_FALSE(places_->shownBase("Rubbish").has_value());
  EXPECT_EQ(places_->shownBases().size(), 1U);
}

TEST_F(PlacesTest, ANameIsShownOtherwiseThanItIsOnDisk) {
  places_->showName(7, "name", "name 2");
  EXPECT_EQ(places_->shownName(7, "name"), "name 2");
  EXPECT_EQ(places_->nameOnDisk(7, "name 2"), "name");
  EXPECT_EQ(places_->shownName(8, "name"), "name") << "of another folder";
  places_->showName(7, "name", "name 3");
  EXPECT_EQ(places_->nameOnDisk(7, "name 2"), "name 2");
  places_->showName(7, "name", "");
  EXPECT_EQ(places_->shownName(7, "name"), "name");
  EXPECT_EQ(places_->nameOnDisk(7, "name 3"), "name 3");
}

TEST_F(PlacesTest, NamesThatAreSwappedAreBothFound) {
  places_->showName(7, "one", "first");
  places_->showName(7, "two", "second");
  places_->showName(7, "one", "second");
  places_->showName(7, "two", "first");
  EXPECT_EQ(places_->nameOnDisk(7, "second"), "one");
  EXPECT_EQ(places_->nameOnDisk(7, "first"), "two");
}

TEST_F(PlacesTest, AFolderThatWasMadeAgainIsAnotherOne) {
  places_->showContainer(container(), "Notes");
  const auto before = places_->shownBase("Notes");
  const std::string aside = directory_.path() + "/aside";
  ASSERT_EQ(rename(container().c_str(), aside.c_str()), 0);
  ASSERT_EQ(mkdir(container().c_str(), 0700), 0);
  places_->showContainer(container(), "Notes");
  ASSERT_TRUE(places_->shownBase("Notes").has_value());
  EXPECT_NE(places_->shownBase("Notes"), before);
}

TEST_F(PlacesTest, WithoutADriveThereIsAnError) {
  NSErrorRef error;
  EXPECT_EQ(Places::open(directory_.path() + "/none", trash(), &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENOENT));
}

}  // namespace
}  // namespace yomber
