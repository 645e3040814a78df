#include "zarn/account.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unicode/utf8.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/uuid.h"
#include "platform/foundation/whole_transfer.h"
#include "platform/ipc/unix_socket.h"
#include "platform/ostrell/constants.h"

namespace yomber {

namespace {

// The file: a line that names the form, then a line an account, "+" before the one that is signed
// in and "-" before the others, its identifier, a space, and its name.
constexpr std::string_view kFirstLine = "yomber-accounts 1\n";
constexpr std::size_t kMaximumNameLength = 255;
constexpr std::size_t kIdentifierLength = 36;
constexpr std::size_t kMaximumFileSize = std::size_t{1} << 20U;

struct Known {
  AccountRecord record;
  bool isSignedIn = false;
};
using Accounts = std::vector<Known>;

std::optional<Known> parseLine(std::string_view line) {
  if (line.size() < kIdentifierLength + 3 || (line[0] != '+' && line[0] != '-'))
    return std::nullopt;
  if (line[1 + kIdentifierLength] != ' ') return std::nullopt;
  Known known;
  known.isSignedIn = line[0] == '+';
  known.record.perAppAccountIdentifier = line.substr(1, kIdentifierLength);
  known.record.name = line.substr(kIdentifierLength + 2);
  if (!isValidAccountName(known.record.name)) return std::nullopt;
  return known;
}

std::optional<Accounts> parse(std::string_view text) {
  if (!text.starts_with(kFirstLine)) return std::nullopt;
  text.remove_prefix(kFirstLine.size());
  Accounts result;
  while (!text.empty()) {
    const auto end = text.find('\n');
    if (end == std::string_view::npos) return std::nullopt;
    auto known = parseLine(text.substr(0, end));
    if (!known) return std::nullopt;
    result.push_back(std::move(*known));
    text.remove_prefix(end + 1);
  }
  return result;
}

std::string format(const Accounts& accounts) {
  std::string text(kFirstLine);
  for (const auto& [record, isSignedIn] : accounts) {
    text += isSignedIn ? '+' : '-';
    text += record.perAppAccountIdentifier + " " + record.name + "\n";
  }
  return text;
}

/// False with errno set.
bool readWhole(const std::string& path, std::string& text) {
  const ipc::UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!file) return false;
  std::array<char, 4096> buffer;
  while (text.size() < kMaximumFileSize) {
    const ssize_t length = read(file.get(), buffer.data(), buffer.size());
    if (length < 0) return false;
    if (length == 0) break;
    text.append(buffer.data(), static_cast<std::size_t>(length));
  }
  return true;
}

/// Puts a new file in the place of the old one, so that a crash leaves either.
NSErrorRef replaceFile(const std::string& path, std::string_view text) {
  const std::string aside = path + ".new";
  const ipc::UniqueFd file(open(aside.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  if (!file) return NSError::errorWithErrno(errno, aside);
  int failure = writeWhole(file.get(), text);
  if (failure == 0 && fsync(file.get()) != 0) failure = errno;
  if (failure != 0) return NSError::errorWithErrno(failure, aside);
  if (rename(aside.c_str(), path.c_str()) != 0) return NSError::errorWithErrno(errno, path);
  const std::string directory = path.substr(0, path.rfind('/'));
  const ipc::UniqueFd parent(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!parent || fsync(parent.get()) != 0) return NSError::errorWithErrno(errno, directory);
  return nullptr;
}

NSErrorRef refusal(std::string text) {
  return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
                                  {{NSLocalizedDescriptionKey, std::move(text)},
                                   {QSOstrellErrorParameterKey, std::string("name")}});
}

std::string freshIdentifier() {
  UUID uuid;
  uuid_generate(uuid);
  return uuid_unparse(uuid);
}

}  // namespace

bool isValidAccountName(std::string_view name) {
  if (name.empty() || name.size() > kMaximumNameLength) return false;
  if (name.front() == ' ' || name.back() == ' ') return false;
  const auto* const bytes = reinterpret_cast<const std::uint8_t*>(name.data());
  const auto length = static_cast<std::int32_t>(name.size());
  for (std::int32_t at = 0; at < length;) {
    UChar32 character = 0;
    U8_NEXT(bytes, at, length, character);
    const bool isControl =
        character < 0x20 || (character >= 0x7f && character < 0xa0);  // negative: not UTF-8
    if (isControl) return false;
  }
  return true;
}

class Account::State {
 public:
  State(std::string path, Accounts accounts)
      : path_(std::move(path)), accounts_(std::move(accounts)) {}

  std::optional<AccountRecord> current() const {
    LockGuard guard(mutex_);
    for (const auto& known : accounts_) {
      if (known.isSignedIn) return known.record;
    }
    return std::nullopt;
  }

  NSErrorRef signIn(const std::string& name) {
    if (!isValidAccountName(name)) {
      return refusal(
          "an account's name has 1 to 255 bytes of UTF-8, no control characters, and no "
          "space at either end");
    }
    return change([&name](Accounts& accounts) -> NSErrorRef {
      Known* account = nullptr;
      for (auto& known : accounts) {
        if (known.record.name == name) account = &known;
        if (known.isSignedIn && known.record.name != name) {
          return refusal("\"" + known.record.name + "\" is signed in: sign out first");
        }
      }
      if (account == nullptr) {
        accounts.push_back({.record = {name, freshIdentifier()}, .isSignedIn = false});
        account = &accounts.back();
      }
      account->isSignedIn = true;
      return nullptr;
    });
  }

  NSErrorRef signOut() {
    return change([](Accounts& accounts) -> NSErrorRef {
      for (auto& known : accounts) known.isSignedIn = false;
      return nullptr;
    });
  }

  void onChange(std::function<void()> handler) { onChange_ = std::move(handler); }

 private:
  NSErrorRef change(const std::function<NSErrorRef(Accounts&)>& edit) {
    LockGuard changing(changing_);
    Accounts accounts;
    std::string before;
    {
      LockGuard guard(mutex_);
      accounts = accounts_;
    }
    before = format(accounts);
    if (auto error = edit(accounts)) return error;
    const std::string after = format(accounts);
    if (after == before) return nullptr;
    if (auto error = replaceFile(path_, after)) return error;
    {
      LockGuard guard(mutex_);
      accounts_ = std::move(accounts);
    }
    if (onChange_) onChange_();
    return nullptr;
  }

  const std::string path_;
  std::function<void()> onChange_;  // constant before the first change
  Mutex changing_;                  // held while a change is made; taken before `mutex_`
  mutable Mutex mutex_;
  Accounts accounts_ GUARDED_BY(mutex_);
};

std::unique_ptr<Account> Account::open(const std::string& path, NSErrorRef* error) {
  std::string text;
  if (!readWhole(path, text)) {
    if (errno == ENOENT) {
      return std::unique_ptr<Account>(new Account(std::make_unique<State>(path, Accounts{})));
    }
    storeError(error, NSError::errorWithErrno(errno, path));
    return nullptr;
  }
  auto accounts = parse(text);
  if (!accounts) {
    storeError(error,
               NSError::errorWithDomain(NSPOSIXErrorDomain, EINVAL,
                                        {{NSFilePathErrorKey, path},
                                         {NSLocalizedDescriptionKey,
                                          path + " is damaged: move it away and sign in again"}}));
    return nullptr;
  }
  return std::unique_ptr<Account>(new Account(std::make_unique<State>(path, std::move(*accounts))));
}

Account::Account(std::unique_ptr<State> state) : state_(std::move(state)) {}
Account::~Account() = default;
std::optional<AccountRecord> Account::current() const { return state_->current(); }
NSErrorRef Account::signIn(const std::string& name) { return state_->signIn(name); }
NSErrorRef Account::signOut() { return state_->signOut(); }
void Account::onChange(std::function<void()> handler) { state_->onChange(std::move(handler)); }

}  // namespace yomber
