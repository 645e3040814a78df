#include "platform/ostrell/file_object_id.h"

#include <gtest/gtest.h>

#include <string>
#include <string_view>
#include <unordered_map>

namespace yomber {
namespace {

QSFileObjectIDRef parse(std::string_view string) {
  return QSFileObjectID::fileObjectIDWithString(string);
}

TEST(FileObjectID, ParsesWhatItPrints) {
  for (const std::string text : {"d:1", "i:42", "a:7", "d:9223372036854775807"}) {
    const auto object = parse(text);
    ASSERT_TRUE(object) << text;
    EXPECT_EQ(object->asString(), text);
    EXPECT_EQ(object->description(), text);
  }
}

TEST(FileObjectID, TellsItsKind) {
  EXPECT_TRUE(parse("d:5")->isDocumentID());
  EXPECT_FALSE(parse("d:5")->isFolderOrAliasID());
  EXPECT_EQ(parse("i:5")->kind(), QSFileObjectID::Kind::Folder);
  EXPECT_TRUE(parse("i:5")->isFolderOrAliasID());
  EXPECT_EQ(parse("a:5")->kind(), QSFileObjectID::Kind::Alias);
  EXPECT_TRUE(parse("a:5")->isFolderOrAliasID());
  EXPECT_EQ(parse("a:5")->rawID(), 5U);
}

TEST(FileObjectID, RefusesWhatItNeverPrints) {
  using namespace std::string_view_literals;
  for (const auto text : {""sv,
                          "d"sv,
                          "d:"sv,
                          ":5"sv,
                          "5"sv,
                          "x:5"sv,
                          "D:5"sv,
                          "d5"sv,
                          "d:0"sv,
                          "d:05"sv,
                          "d:+5"sv,
                          "d:-5"sv,
                          "d: 5"sv,
                          " d:5"sv,
                          "d:5 "sv,
                          "d:5\n"sv,
                          "d:5\0"sv,
                          "d:0x5"sv,
                          "d:5.0"sv,
                          "dd:5"sv,
                          "d::5"sv,
                          "d:9223372036854775808"sv,
                          "d:18446744073709551616"sv,
                          "d:99999999999999999999999"sv,
                          "NSFileProviderRootContainerItemIdentifier"sv}) {
    EXPECT_FALSE(parse(text)) << text;
  }
}

// Every string of up to four bytes of a small alphabet: parsing and printing are inverse.
TEST(FileObjectID, AcceptsExactlyItsOwnForms) {
  constexpr std::string_view kAlphabet("dia:019-x\0", 10);
  int accepted = 0;
  for (int length = 0; length <= 4; ++length) {
    int count = 1;
    for (int i = 0; i < length; ++i) count *= static_cast<int>(kAlphabet.size());
    for (int n = 0; n < count; ++n) {
      std::string text;
      for (int i = 0, rest = n; i < length; ++i, rest /= static_cast<int>(kAlphabet.size())) {
        text += kAlphabet[static_cast<std::size_t>(rest) % kAlphabet.size()];
      }
      if (const auto object = parse(text)) {
        ++accepted;
        EXPECT_EQ(object->asString(), text);
      }
    }
  }
  EXPECT_EQ(accepted, 3 * 2 + 3 * 2 * 3);  // one digit of two, or followed by one of three
}

TEST(FileObjectID, IsAKeyByValue) {
  std::unordered_map<QSFileObjectIDRef, int, QSFileObjectIDHash, QSFileObjectIDEqual> map;
  map[parse("d:5")] = 1;
  map[parse("i:5")] = 2;
  EXPECT_EQ(map.at(parse("d:5")), 1);
  EXPECT_EQ(map.at(parse("i:5")), 2);
  EXPECT_FALSE(map.contains(parse("a:5")));
}

}  // namespace
}  // namespace yomber
