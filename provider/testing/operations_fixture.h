#pragma once

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/url.h"
#include "platform/ostrell/awaited.h"
#include "provider/extension/extension.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {

struct ItemAnswer {
  NSFileProviderItemRef item;
  NSErrorRef error;

  [[nodiscard]] std::string identifier() const {
    return item == nullptr ? "nil" : item->itemIdentifier();
  }
};

/// What completion handlers were given.
using ItemAnswers = std::shared_ptr<Awaited<ItemAnswer>>;
using ErrorAnswers = std::shared_ptr<Awaited<NSErrorRef>>;

/// An extension over real files in the scripted daemon's home.
class OperationsTest : public ProviderTest {
 protected:
  OperationsTest() { log.forget(); }

  /// A file of that content, and an item for it that the daemon knows. Answers its path.
  std::string addDocument(std::uint64_t rawID, const std::string& name,
                          const std::string& content = "content") {
    daemon.addItem(scriptedDocument(rawID, nameOf(name)), inRoot(name));
    return makeFile(name, content);
  }
  std::string addFolder(std::uint64_t rawID, const std::string& name) {
    daemon.addItem(scriptedFolder(rawID, nameOf(name)), inRoot(name));
    return makeFolder(name);
  }
  /// The same in the trash.
  std::string addTrashed(std::uint64_t rawID, const std::string& name) {
    const std::string path = inTrash(name);
    daemon.addItem(scriptedDocument(rawID, name), path);
    std::ofstream(path) << "trashed";
    return path;
  }
  /// Only the file.
  std::string makeFile(const std::string& name, const std::string& content = "content") const {
    const std::string path = inRoot(name);
    std::ofstream(path) << content;
    return path;
  }
  std::string makeFolder(const std::string& name) const {
    std::filesystem::create_directories(inRoot(name));
    return inRoot(name);
  }
  std::string makeLink(const std::string& name, const std::string& target) const {
    EXPECT_EQ(symlink(target.c_str(), inRoot(name).c_str()), 0);
    return inRoot(name);
  }
  /// The daemon knows an item at that place from now on, or is told of a move.
  void know(std::uint64_t rawID, const std::string& path) {
    daemon.addItem(scriptedDocument(rawID, nameOf(path)), path);
  }

  [[nodiscard]] std::string inTrash(const std::string& name) const {
    return daemon.home() + "/tree/.Trash/files/" + name;
  }
  [[nodiscard]] NSURLRef urlInRoot(const std::string& name) const {
    return NSURL::fileURLWithPath(inRoot(name));
  }
  static std::string textOf(const std::string& path) {
    return NSURL::fileURLWithPath(path)->absoluteString();
  }
  static bool exists(const std::string& path) {
    struct stat status{};
    return lstat(path.c_str(), &status) == 0;
  }
  static std::string contentOf(const std::string& path) {
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), {}};
  }

  static ItemHandler into(const ItemAnswers& answers) {
    return [answers](const NSFileProviderItemRef& item, const NSErrorRef& error) {
      answers->add({item, error});
    };
  }
  static ErrorHandler into(const ErrorAnswers& answers) {
    return [answers](const NSErrorRef& error) { answers->add(error); };
  }
  /// The one answer, once it is there.
  static ItemAnswer only(const ItemAnswers& answers) {
    const auto all = answers->wait();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? ItemAnswer{} : all.front();
  }
  static NSErrorRef only(const ErrorAnswers& answers) {
    const auto all = answers->wait();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? nullptr : all.front();
  }
  /// The identifier in a no-such-item error of the framework.
  static std::string missingIdentifier(const NSErrorRef& error) {
    if (domainAndCode(error) != "NSFileProviderErrorDomain -1005") return domainAndCode(error);
    const auto found = error->userInfo().find(NSFileProviderErrorNonExistentItemIdentifierKey);
    return found == error->userInfo().end() ? "no identifier"
                                            : std::get<std::string>(found->second);
  }

  /// Whether the section that the line of this form opened is closed.
  [[nodiscard]] bool isClosed(const std::string& openingLine) const {
    std::array<char, 32> number{};
    std::snprintf(number.data(), number.size(), "%llx",
                  static_cast<unsigned long long>(log.sectionOf(openingLine)));
    const std::string closing = std::string("[DEBUG] ┗") + number.data() + " ";
    for (const auto& line : log.lines()) {
      if (line.text == closing) return true;
    }
    return false;
  }
  /// Whether these lines are in the log, in this order.
  void expectLines(const std::vector<std::string>& expected) const {
    EXPECT_EQ(among(log.texts(), expected), expected);
  }

  /// Every later lookup of an item by its location fails so.
  void failLookupsWith(const NSErrorRef& error) {
    daemon.script([&](ScriptedDaemon::Answers& answers) {
      answers.itemAtLocation = [error](const std::string&, bool) {
        return ScriptedDaemon::Item{.item = {}, .error = error};
      };
    });
  }

  const ItemAnswers items = std::make_shared<Awaited<ItemAnswer>>();
  const ErrorAnswers errors = std::make_shared<Awaited<NSErrorRef>>();
  std::shared_ptr<QSFileProviderExtension> extension = QSFileProviderExtension::init();

 private:
  static std::string nameOf(const std::string& path) {
    return std::filesystem::path(path).filename().string();
  }
};

}  // namespace yomber
