#pragma once

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/mounted_drive.h"

namespace yomber::testing {

class OpenedFile {
 public:
  OpenedFile(const std::string& path, int flags)
      : file_(open(path.c_str(), flags | O_CLOEXEC, 0644)) {}
  ~OpenedFile() {
    if (file_ >= 0) close(file_);
  }
  OpenedFile(const OpenedFile&) = delete;
  OpenedFile& operator=(const OpenedFile&) = delete;
  [[nodiscard]] int get() const { return file_; }
  [[nodiscard]] std::string read(std::size_t size, off_t offset) const {
    std::string bytes(size, '\0');
    const ssize_t count = pread(file_, bytes.data(), size, offset);
    bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(count, 0)));
    return bytes;
  }

 private:
  const int file_;
};

/// A mounted drive, and what its daemon says of its content.
class MountFixture : public ::testing::Test {
 protected:
  explicit MountFixture(std::vector<std::string> gates = {},
                        const std::vector<std::string>& failing = {},
                        const Environment& environment = {},
                        const std::vector<std::string>& turnstiles = {})
      : mounted_(std::move(gates), failing, environment, turnstiles),
        client_(mounted_.drive().home()) {}

  [[nodiscard]] std::string at(const std::string& name) const { return mounted_.at(name); }
  [[nodiscard]] std::string onDisk(const std::string& name) const { return mounted_.onDisk(name); }

  bool isConfirmed(const std::string& name) {
    using Upload = ContentClient::Upload;
    return eventually([&] { return client_.state(onDisk(name)).upload == Upload::CONFIRMED; });
  }
  bool isAway(const std::string& name) {
    return client_.state(onDisk(name)).local == ContentClient::Local::FAULT;
  }
  /// A document that the store has and this disk has not.
  void makeAway(const std::string& name, const std::string& content) {
    std::ofstream(at(name), std::ios::binary) << content;
    evict(name);
  }
  void evict(const std::string& name) {
    ASSERT_TRUE(isConfirmed(name)) << name;
    ASSERT_TRUE(eventually([&] { return client_.evict(onDisk(name)) == nullptr; })) << name;
    ASSERT_TRUE(isAway(name)) << name;
  }
  void goOffline() { std::ofstream(mounted_.drive().home() + "/store/offline").put('x'); }
  void goOnline() { std::filesystem::remove(mounted_.drive().home() + "/store/offline"); }

  MountedDrive mounted_;
  ContentClient client_;
};

}  // namespace yomber::testing
