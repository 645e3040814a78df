#include "zarn/containers.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <map>
#include <string_view>
#include <thread>
#include <utility>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/log.h"
#include "platform/ipc/unix_socket.h"
#include "platform/launchservices/bundle_proxy.h"
#include "platform/launchservices/desktop_entry.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/entitlements.h"

namespace yomber {

namespace {

/// An installation writes many files: the list is read once it has gone quiet.
constexpr int kQuietMilliseconds = 100;
/// Directories that do not exist yet are looked for again, and what failed is tried again.
constexpr int kRetryMilliseconds = 30'000;

std::vector<ContainerRecord> ownContainers(const TreeLayout& layout) {
  return {{.containerID = QSUbiquitousDefaultContainerID,
           .displayName = "Yomber Drive",
           .documents = layout.root(),
           .applicationID = {},
           .iconName = "folder-remote"},
          {.containerID = QSUbiquitousDocumentsContainerID,
           .displayName = QSUbiquitousDocumentsFolderName,
           .documents = layout.root() + "/" + QSUbiquitousDocumentsFolderName,
           .applicationID = {},
           .iconName = "folder-documents"},
          {.containerID = QSUbiquitousDesktopContainerID,
           .displayName = QSUbiquitousDesktopFolderName,
           .documents = layout.root() + "/" + QSUbiquitousDesktopFolderName,
           .applicationID = {},
           .iconName = "user-desktop"}};
}

/// The name that a person reads; control characters and slashes cannot be part of a folder's name.
std::string displayName(const DesktopEntry& entry, const std::string& containerID) {
  constexpr std::size_t kMaximumLength = 200;
  std::string name = entry.containerName.empty() ? entry.name : entry.containerName;
  for (char& c : name) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) c = ' ';
    if (c == '/') c = '-';
  }
  if (name.size() > kMaximumLength) {
    std::size_t length = kMaximumLength;
    while (length > 0 && (static_cast<unsigned char>(name[length]) & 0xc0U) == 0x80U) --length;
    name.resize(length);
  }
  const bool isBlank = name.find_first_not_of(' ') == std::string::npos;
  return isBlank || name == "." || name == ".." ? containerID : name;
}

void claim(const std::string& applicationID, const DesktopEntry& entry, const TreeLayout& layout,
           std::map<std::string, ContainerRecord>& containers) {
  const LSBundleProxy application(applicationID, entry);
  for (const auto& id : QSEntitledContainerIdentifiers(application.entitlements())) {
    if (!isValidContainerID(id)) continue;
    containers.try_emplace(id, ContainerRecord{.containerID = id,
                                               .displayName = displayName(entry, id),
                                               .documents = layout.documents(id),
                                               .applicationID = applicationID,
                                               .iconName = entry.iconName});
  }
}

}  // namespace

std::vector<ContainerRecord> readContainers(const std::vector<std::string>& directories,
                                            const TreeLayout& layout) {
  std::vector<ContainerRecord> result = ownContainers(layout);
  std::map<std::string, ContainerRecord> claimed;
  for (const auto& [id, path] : desktopFiles(directories)) {
    std::vector<std::string> invalid;
    const auto entry = parseDesktopEntry(desktopFileText(path), &invalid);
    for (const auto& bad : invalid) {
      log_default(defaultLog(), "[NOTICE] %@ names a container that is not valid: %@", path, bad);
    }
    if (entry && !entry->isHidden) claim(id, *entry, layout, claimed);
  }
  for (const auto& own : result) claimed.erase(own.containerID);
  for (auto& [id, container] : claimed) result.push_back(std::move(container));
  return result;
}

class Containers::State {
 public:
  State(std::vector<std::string> directories, TreeLayout layout)
      : directories_(std::move(directories)),
        layout_(std::move(layout)),
        wake_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    auto list = std::make_shared<ContainerList>();
    list->containers = ownContainers(layout_);
    list_.store(std::move(list));
  }

  NSErrorRef start(Hooks hooks) {
    hooks_ = std::move(hooks);
    watchDirectories();
    NSErrorRef error = refresh();
    thread_ = std::thread([this] { follow(); });
    return error;
  }

  void stop() {
    const std::uint64_t one = 1;
    (void)!write(wake_.get(), &one, sizeof one);
    if (thread_.joinable()) thread_.join();
  }

  ContainerListRef list() const { return list_.load(); }

 private:
  /// Watches afresh, so that directories that have come or gone are taken note of. Answers whether
  /// every one is watched.
  bool watchDirectories() {
    queue_ = ipc::UniqueFd(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (!queue_) return false;
    bool areAllWatched = true;
    for (const auto& directory : directories_) areAllWatched &= watch(directory, 0);
    return areAllWatched;
  }

  bool watch(const std::string& directory, int depth) {
    constexpr std::uint32_t kMask = IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                    IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
    constexpr int kMaximumDepth = 4;
    if (inotify_add_watch(queue_.get(), directory.c_str(), kMask) < 0) return false;
    DIR* const stream = opendir(directory.c_str());
    if (stream == nullptr) return false;
    while (const dirent* const entry = readdir(stream)) {
      const std::string_view name = entry->d_name;
      if (entry->d_type == DT_DIR && name != "." && name != ".." && depth < kMaximumDepth) {
        watch(directory + "/" + entry->d_name, depth + 1);
      }
    }
    closedir(stream);
    return true;
  }

  void follow() {
    bool isSettled = false;
    while (true) {
      std::array<pollfd, 2> descriptors{pollfd{.fd = wake_.get(), .events = POLLIN, .revents = 0},
                                        pollfd{.fd = queue_.get(), .events = POLLIN, .revents = 0}};
      const int timeout = isSettled ? -1 : kRetryMilliseconds;
      const int ready = poll(descriptors.data(), descriptors.size(), timeout);
      if (descriptors[0].revents != 0) return;
      if (ready < 0) continue;
      if (ready > 0 && !waitForQuiet()) return;
      const bool areAllWatched = watchDirectories();
      isSettled = refresh() == nullptr && areAllWatched;
    }
  }

  /// False when it is time to stop.
  bool waitForQuiet() {
    while (true) {
      std::array<char, 8192> events;
      while (read(queue_.get(), events.data(), events.size()) > 0) {
      }
      std::array<pollfd, 2> descriptors{pollfd{.fd = wake_.get(), .events = POLLIN, .revents = 0},
                                        pollfd{.fd = queue_.get(), .events = POLLIN, .revents = 0}};
      const int ready = poll(descriptors.data(), descriptors.size(), kQuietMilliseconds);
      if (descriptors[0].revents != 0) return false;
      if (ready == 0) return true;
    }
  }

  NSErrorRef refresh() {
    auto next = std::make_shared<ContainerList>();
    next->containers = readContainers(directories_, layout_);
    const auto current = list_.load();
    const bool isChanged = next->containers != current->containers;
    if (!isChanged && isApplied_) return nullptr;
    std::vector<ContainerFolder> folders;
    for (const auto& container : next->containers) {
      if (container.applicationID.empty()) continue;
      folders.push_back({container.containerID, container.displayName});
    }
    NSErrorRef error = hooks_.apply ? hooks_.apply(folders) : nullptr;
    isApplied_ = error == nullptr;
    if (error) {
      log_error(defaultLog(), "[ERROR] the list of containers could not be stored: %@", error);
      return error;
    }
    next->generation = current->generation + 1;
    list_.store(std::move(next));
    if (isChanged && hooks_.didChange) hooks_.didChange();
    return nullptr;
  }

  const std::vector<std::string> directories_;
  const TreeLayout layout_;
  const ipc::UniqueFd wake_;
  AtomicCell<ContainerListRef> list_;
  Hooks hooks_;             // constant once started
  ipc::UniqueFd queue_;     // `start`, then the thread
  bool isApplied_ = false;  // `start`, then the thread
  std::thread thread_;
};

Containers::Containers(std::vector<std::string> directories, TreeLayout layout)
    : state_(std::make_unique<State>(std::move(directories), std::move(layout))) {}
Containers::~Containers() { stop(); }
NSErrorRef Containers::start(Hooks hooks) { return state_->start(std::move(hooks)); }
void Containers::stop() { state_->stop(); }
ContainerListRef Containers::list() const { return state_->list(); }

}  // namespace yomber
