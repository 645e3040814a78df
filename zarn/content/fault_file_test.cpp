#include "zarn/content/fault_file.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

TEST(FaultRecordTest, IsReadAsItWasWritten) {
  FaultRecord record;
  record.item = 123456;
  record.content.size = 99;
  record.content.hash[3] = 7;
  record.mtime = -5;
  record.head = 17;
  record.tag = std::string("a b\0c", 5);
  EXPECT_EQ(FaultRecord::decode(record.encoded()), record);
  record.account = "ann";
  EXPECT_EQ(FaultRecord::decode(record.encoded()), record);
}

TEST(FaultRecordTest, TextsThatMakeNoSenseAreNoRecords) {
  FaultRecord record;
  const std::string good = record.encoded();
  EXPECT_TRUE(FaultRecord::decode(good));
  EXPECT_FALSE(FaultRecord::decode(""));
  EXPECT_FALSE(FaultRecord::decode("2" + good.substr(1)));
  EXPECT_FALSE(FaultRecord::decode(good + " x"));
  EXPECT_FALSE(FaultRecord::decode(good.substr(0, good.size() - 4)));
  EXPECT_FALSE(FaultRecord::decode("1 x" + good.substr(3)));
}

}  // namespace
}  // namespace yomber
