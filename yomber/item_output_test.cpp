#include "yomber/item_output.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

namespace yomber {
namespace {

ItemFields document(std::string name) {
  ItemFields item;
  item.identifier = "d:42";
  item.parentIdentifier = "i:7";
  item.filename = std::move(name);
  item.contentType = "text/plain";
  item.size = 1234;
  return item;
}

TEST(PrintableName, LeavesUtf8AsItIs) {
  EXPECT_EQ(printableName("Übersicht ┏ 日本"), "Übersicht ┏ 日本");
}

TEST(PrintableName, ShowsWhatATerminalWouldActOn) {
  EXPECT_EQ(printableName("two\nlines"), "two\\x0alines");
  EXPECT_EQ(printableName("\x1b[31mred"), "\\x1b[31mred");
  EXPECT_EQ(printableName("csi \xc2\x9b"), "csi \\xc2\\x9b");
}

TEST(PrintableName, ShowsBytesThatAreNoUtf8) {
  EXPECT_EQ(printableName("a\xff\xfe z"), "a\\xff\\xfe z");
}

TEST(ReadableSize, KeepsSmallNumbersExactAndLargeOnesShort) {
  EXPECT_EQ(readableSize(0), "0 B");
  EXPECT_EQ(readableSize(999), "999 B");
  EXPECT_EQ(readableSize(1000), "1.0 KB");
  EXPECT_EQ(readableSize(9960), "10 KB");
  EXPECT_EQ(readableSize(999'600), "1.0 MB");
  EXPECT_EQ(readableSize(18'446'744'073'709'551'615ULL), "18 EB");
}

TEST(ItemLine, OfAFolderEndsInASlash) {
  ItemFields folder = document("Plans");
  folder.kind = ItemKind::Folder;
  EXPECT_EQ(itemLine(folder, OutputForm::Short), "Plans/");
  EXPECT_EQ(itemLine(document("a.txt"), OutputForm::Short), "a.txt");
}

TEST(ItemLine, InLongFormCarriesIdentifierSizeAndTags) {
  ItemFields item = document("a.txt");
  item.tags = {"red", "work"};
  const std::string line = itemLine(item, OutputForm::Long);
  EXPECT_NE(line.find("d:42"), std::string::npos);
  EXPECT_NE(line.find("1.2 KB"), std::string::npos);
  EXPECT_NE(line.find("a.txt #red #work"), std::string::npos);
}

TEST(ItemLine, InJsonIsOneLineThatParsesBack) {
  const std::string line = itemLine(document("two\nlines"), OutputForm::Json);
  EXPECT_EQ(line.find('\n'), std::string::npos);
  const auto json = nlohmann::json::parse(line);
  EXPECT_EQ(json["name"], "two\nlines");
  EXPECT_EQ(json["id"], "d:42");
  EXPECT_EQ(json["size"], 1234);
}

TEST(ItemLine, InJsonLosesNoByteOfANameThatIsNoUtf8) {
  const auto json = nlohmann::json::parse(itemLine(document("a\xff"), OutputForm::Json));
  EXPECT_FALSE(json.contains("name"));
  EXPECT_EQ(json["name_base64"], "Yf8=");
}

TEST(JsonLine, ReplacesWhatIsNoUtf8) {
  const std::string line = jsonLine({{"message", "no \xff here"}});
  EXPECT_EQ(nlohmann::json::parse(line)["message"], "no \xef\xbf\xbd here");
}

TEST(ItemJson, LeavesOutWhatIsNotSet) {
  EXPECT_FALSE(itemJson(document("a")).contains("last_used"));
  ItemFields used = document("a");
  used.lastUsedDate = NSDate::fromNanoseconds(0);
  EXPECT_EQ(itemJson(used)["last_used"], "1970-01-01T00:00:00Z");
}

}  // namespace
}  // namespace yomber
