#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <string>
#include <thread>
#include <utility>

#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/file_placement.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {

/// What an operation answered.
struct OperationAnswer {
  NSURLRef url;
  NSErrorRef error;
  std::thread::id thread;

  [[nodiscard]] bool is(std::int64_t cocoaCode) const {
    return error != nullptr && error->is(NSCocoaErrorDomain, cocoaCode);
  }
  [[nodiscard]] std::string path() const { return url != nullptr ? url->path() : "(nil)"; }
  /// The errno underneath; 0 when there is none.
  [[nodiscard]] std::int64_t number() const {
    const NSErrorRef under = error != nullptr ? error->underlyingError() : nullptr;
    return under != nullptr && under->domain() == NSPOSIXErrorDomain ? under->code() : 0;
  }
};

/// A tree and a staging folder of its own.
class FileOperationsTest : public testing::Test {
 protected:
  FileOperationsTest() {
    std::filesystem::create_directories(at("tree/folder"));
    setStagingFolder(at("staging"));
  }
  ~FileOperationsTest() override {
    setStagingFolder({});
    setPhysicalLocationResolver({});
    setFormerNameResolver({});
    FaultPoint::disarmAll();
  }

  [[nodiscard]] std::string at(const std::string& name) const { return directory_ / name; }
  [[nodiscard]] NSURLRef url(const std::string& name) const {
    return NSURL::fileURLWithPath(at(name));
  }
  void put(const std::string& name, const std::string& bytes = "x") const {
    std::ofstream(at(name), std::ios::binary) << bytes;
  }
  [[nodiscard]] std::string get(const std::string& name) const {
    std::ifstream file(at(name), std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  [[nodiscard]] bool exists(const std::string& name) const {
    struct stat status{};
    return lstat(at(name).c_str(), &status) == 0;
  }
  /// How many names are in the folder; none when it is not there.
  [[nodiscard]] std::size_t count(const std::string& folder) const {
    const auto names = NSFileManager::defaultManager().contentsOfDirectoryAtPath(at(folder));
    return names ? names->size() : 0;
  }

  /// Runs `start` with a handler and waits for its call; a second call of it throws in the pool.
  template <typename Start>
  static OperationAnswer await(Start start) {
    auto promise = std::make_shared<std::promise<OperationAnswer>>();
    auto answer = promise->get_future();
    start([promise](NSURLRef url, NSErrorRef error) {
      promise->set_value({std::move(url), std::move(error), std::this_thread::get_id()});
    });
    return answer.get();
  }
  OperationAnswer import(const NSURLRef& source, const NSURLRef& folder) const {
    return await([&](URLHandler handler) { fp_importUnderFolder(source, folder, handler); });
  }
  OperationAnswer makeFolder(const NSURLRef& folder, const std::string& name) const {
    return await([&](URLHandler handler) { fp_createSubFolder(folder, name, handler); });
  }
  OperationAnswer rename(const NSURLRef& source, const std::string& name) const {
    return await([&](URLHandler handler) { fp_renameWithNewName(source, name, handler); });
  }
  OperationAnswer move(const NSURLRef& source, const NSURLRef& folder,
                       const std::optional<std::string>& name = std::nullopt) const {
    return await(
        [&](URLHandler handler) { fp_reparentUnderFolder(source, folder, name, handler); });
  }
  OperationAnswer move(const NSURLRef& source, const NSURLRef& folder, Bouncing bouncing) const {
    return await(
        [&](URLHandler handler) { fp_reparentUnderFolder(source, folder, bouncing, handler); });
  }
  OperationAnswer remove(const NSURLRef& file) const {
    return await([&](URLHandler handler) {
      fp_deleteWithCompletionHandler(
          file, [handler](NSErrorRef error) { handler(nullptr, std::move(error)); });
    });
  }

  // The same on this thread: what a child process of a test can run, which has no pool.
  [[nodiscard]] Placed importHere(const std::string& source, const std::string& folder) const {
    const auto from = url(source);
    return importFile({from, from->path()}, {{url(folder), at(folder)}, from->lastPathComponent()});
  }
  [[nodiscard]] NSErrorRef removeHere(const std::string& file) const {
    return deleteFile({url(file), at(file)});
  }

  TemporaryDirectory directory_;
};

/// Gives up root's privileges for a scope; as anybody else it changes nothing.
class WithoutPrivileges {
 public:
  WithoutPrivileges() {
    if (geteuid() == 0) {
      EXPECT_EQ(seteuid(65534), 0);
    }
  }
  ~WithoutPrivileges() {
    if (getuid() == 0) {
      EXPECT_EQ(seteuid(0), 0);
    }
  }
  WithoutPrivileges(const WithoutPrivileges&) = delete;
  WithoutPrivileges& operator=(const WithoutPrivileges&) = delete;
};

}  // namespace yomber
