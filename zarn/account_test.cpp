#include "zarn/account.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

class AccountTest : public testing::Test {
 protected:
  AccountTest() {
    char directory[] = "/tmp/yomber-account-XXXXXX";
    directory_ = mkdtemp(directory);
    path_ = directory_ + "/account";
  }
  ~AccountTest() override { std::filesystem::remove_all(directory_); }

  std::unique_ptr<Account> open() {
    NSErrorRef error;
    auto account = Account::open(path_, &error);
    EXPECT_EQ(error, nullptr);
    return account;
  }

  std::string directory_;
  std::string path_;
};

TEST_F(AccountTest, NobodyIsSignedInAtFirst) { EXPECT_EQ(open()->current(), std::nullopt); }

TEST_F(AccountTest, KeepsTheAccountAndItsIdentifierOverRestarts) {
  auto account = open();
  ASSERT_EQ(account->signIn("Ada Lovelace"), nullptr);
  const auto signedIn = account->current();
  ASSERT_TRUE(signedIn);
  EXPECT_EQ(signedIn->name, "Ada Lovelace");
  EXPECT_EQ(signedIn->perAppAccountIdentifier.size(), 36U);
  EXPECT_EQ(open()->current(), signedIn);

  ASSERT_EQ(account->signOut(), nullptr);
  EXPECT_EQ(open()->current(), std::nullopt);
  ASSERT_EQ(account->signIn("Ada Lovelace"), nullptr);
  EXPECT_EQ(open()->current(), signedIn);
}

TEST_F(AccountTest, AccountsHaveIdentifiersOfTheirOwn) {
  auto account = open();
  ASSERT_EQ(account->signIn("ada"), nullptr);
  const auto ada = account->current();
  EXPECT_TRUE(account->signIn("grace")->is(QSOstrellErrorDomain, 3));
  EXPECT_EQ(account->current(), ada);
  ASSERT_EQ(account->signOut(), nullptr);
  ASSERT_EQ(account->signIn("grace"), nullptr);
  EXPECT_NE(account->current()->perAppAccountIdentifier, ada->perAppAccountIdentifier);
}

TEST_F(AccountTest, TellsOfEachChangeAndOfNothingElse) {
  auto account = open();
  int changes = 0;
  account->onChange([&] { ++changes; });
  (void)account->signOut();
  EXPECT_EQ(changes, 0);
  (void)account->signIn("ada");
  (void)account->signIn("ada");
  EXPECT_EQ(changes, 1);
  (void)account->signOut();
  EXPECT_EQ(changes, 2);
}

TEST_F(AccountTest, RefusesNamesThatAreNotText) {
  auto account = open();
  for (const std::string bad : {"", " ada", "ada ", "a\nb", "a\x7f", "\xff", "\xc3"}) {
    EXPECT_NE(account->signIn(bad), nullptr) << bad;
  }
  EXPECT_NE(account->signIn(std::string(256, 'a')), nullptr);
  EXPECT_NE(account->signIn(std::string("a\0b", 3)), nullptr);
  EXPECT_EQ(account->signIn("Zoë Ångström 漢字"), nullptr);
}

TEST_F(AccountTest, ADamagedFileIsAnErrorAndStays) {
  for (const std::string text :
       {"", "nonsense", "yomber-accounts 1\n+short\n", "yomber-accounts 1\n+0123"}) {
    std::ofstream(path_) << text;
    NSErrorRef error;
    EXPECT_EQ(Account::open(path_, &error), nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_NE(error->localizedDescription().find(path_), std::string::npos);
    EXPECT_EQ(std::filesystem::file_size(path_), text.size());
  }
}

TEST_F(AccountTest, AFailedWriteChangesNothing) {
  auto account = open();
  std::filesystem::create_directory(path_ + ".new");
  EXPECT_NE(account->signIn("ada"), nullptr);
  EXPECT_EQ(account->current(), std::nullopt);
}

TEST_F(AccountTest, TheFileIsTheUsersOwn) {
  ASSERT_EQ(open()->signIn("ada"), nullptr);
  struct stat status{};
  ASSERT_EQ(stat(path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0600U);
}

}  // namespace
}  // namespace yomber
