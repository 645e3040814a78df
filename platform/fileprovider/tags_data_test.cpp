#include "platform/fileprovider/tags_data.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

std::vector<std::string> labelsIn(const NSDataRef& data) {
  std::vector<std::string> labels;
  for (const auto& tag : FPGetTagsFromTagsData(data)) {
    labels.push_back(tag->valueForKey("label").value_or("(none)"));
  }
  return labels;
}

TEST(TagsData, KeepsLabelsInTheirOrder) {
  const std::vector<std::string> labels{"red", "blå, grøn", "red", "a b"};
  EXPECT_EQ(labelsIn(FPTagsDataFromLabels(labels)), labels);
}

TEST(TagsData, HoldsNoTagsWhenItIsEmptyOrNil) {
  EXPECT_EQ(FPTagsDataFromLabels({})->length(), 0U);
  EXPECT_TRUE(labelsIn(NSData::dataWithString("")).empty());
  EXPECT_TRUE(labelsIn(nullptr).empty());
}

TEST(TagsData, HoldsNoTagsWhenItIsNoTagData) {
  EXPECT_TRUE(labelsIn(NSData::dataWithString("red")).empty());
  EXPECT_TRUE(labelsIn(NSData::dataWithString(std::string_view("red\0\0", 5))).empty());
}

TEST(TagsData, ATagAnswersNoOtherKey) {
  EXPECT_EQ(FPTag("red").valueForKey("color"), std::nullopt);
  EXPECT_EQ(FPTag("red").label(), "red");
}

}  // namespace
}  // namespace yomber
