#include "yomber/change_printer.h"

#include <gtest/gtest.h>

#include <sstream>

namespace yomber {
namespace {

ItemFields item(const std::string& identifier, const std::string& name) {
  ItemFields fields;
  fields.identifier = identifier;
  fields.filename = name;
  return fields;
}

class ChangePrinterTest : public testing::Test {
 protected:
  ChangePrinter printer(const ChangePrinter::Options& options) { return {out, notes, options}; }
  std::ostringstream out;
  std::ostringstream notes;
};

TEST_F(ChangePrinterTest, AListingPrintsEachItemOnceAsItIsAtItsEnd) {
  ChangePrinter listing = printer({.listFirst = true, .once = true});
  EXPECT_FALSE(listing.listed({item("d:5", "draft"), item("d:6", "kept")}, false));
  EXPECT_FALSE(listing.listed({item("d:7", "gone")}, false));
  EXPECT_FALSE(listing.listed({item("d:5", "final")}, false));  // changed meanwhile
  listing.deleted({"d:7", "d:99"});
  EXPECT_EQ(out.str(), "");
  EXPECT_TRUE(listing.listed({}, true));
  EXPECT_EQ(out.str(), "present  final\npresent  kept\n");
}

TEST_F(ChangePrinterTest, AnItemThatGoesAndComesAgainWhileItIsListedIsThere) {
  ChangePrinter listing = printer({.listFirst = true, .once = true});
  EXPECT_FALSE(listing.listed({item("d:5", "x")}, false));
  listing.deleted({"d:5"});
  EXPECT_TRUE(listing.listed({item("d:5", "x")}, true));
  EXPECT_EQ(out.str(), "present  x\n");
}

TEST_F(ChangePrinterTest, AWatchSaysThatAnItemChangedWhileItWasListed) {
  ChangePrinter watch = printer({.listFirst = true});
  EXPECT_FALSE(watch.listed({item("d:5", "draft")}, false));
  EXPECT_FALSE(watch.listed({item("d:5", "final")}, true));
  watch.updated({item("d:6", "new"), item("d:5", "last")});
  watch.deleted({"d:5"});
  EXPECT_EQ(out.str(),
            "present  draft\nchanged  final\nadded    new\nchanged  last\nremoved  last\n");
}

TEST_F(ChangePrinterTest, AWatchWaitsWhileNothingCanBeSeenAndAListingDoesNot) {
  const NSErrorRef lost = NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInterrupted,
                                                   {{NSLocalizedDescriptionKey, "it is gone"}});
  EXPECT_FALSE(printer({}).paused(lost));
  EXPECT_EQ(notes.str(), "waiting: it is gone\n");
  EXPECT_TRUE(printer({.listFirst = true, .once = true}).paused(lost));
  EXPECT_EQ(notes.str(), "waiting: it is gone\n") << "the command says it";
}

TEST_F(ChangePrinterTest, AWatchThatListsNothingSaysHowManyThereAre) {
  ChangePrinter watch = printer({});
  EXPECT_FALSE(watch.listed({item("d:5", "x"), item("d:6", "y")}, false));
  EXPECT_FALSE(watch.listed({item("d:5", "z")}, true));
  EXPECT_EQ(out.str(), "");
  EXPECT_EQ(notes.str(), "watching 2 items\n");
}

}  // namespace
}  // namespace yomber
