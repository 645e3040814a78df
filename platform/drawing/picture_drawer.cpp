#include "platform/drawing/picture_drawer.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <filesystem>
#include <span>
#include <utility>

#include "platform/drawing/drawing_process.h"
#include "platform/foundation/fault_points.h"

namespace yomber {
namespace {

using drawing::Reply;
using drawing::Request;
using drawing::Status;

constexpr int kSeals = F_SEAL_WRITE | F_SEAL_SHRINK | F_SEAL_GROW;

// The request has gone to the process, and the answer is awaited.
FaultPoint drawingSent("drawing.sent");

std::string programBeside() {
  std::error_code failure;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", failure);
  return failure ? std::string("yomber-thumbnailer")
                 : (self.parent_path() / "yomber-thumbnailer").string();
}

/// The names in a folder that begin so, sorted.
std::vector<std::string> namesIn(const std::filesystem::path& folder, std::string_view prefix) {
  std::vector<std::string> names;
  std::error_code failure;
  for (std::filesystem::directory_iterator at(folder, failure), end; !failure && at != end;
       at.increment(failure)) {
    std::string name = at->path().filename();
    if (name.starts_with(prefix)) names.push_back(std::move(name));
  }
  std::ranges::sort(names);
  return names;
}

NSErrorRef errorOf(Status status) {
  if (status == Status::TooLarge) return NSError::errorWithErrno(EFBIG);
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileReadCorruptFileError,
      {{NSLocalizedDescriptionKey, "no picture that can be drawn, or a damaged one"}});
}

std::uint32_t bigEndian(const unsigned char* bytes) {
  std::uint32_t value = 0;
  for (int i = 0; i < 4; ++i) value = value << 8U | bytes[i];
  return value;
}

/// Whether the result begins as its form says: others decode it with less care.
bool hasForm(int file, const Reply& reply) {
  constexpr std::array<unsigned char, 16> kPng{0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n',
                                               0,    0,   0,   13,  'I',  'H',  'D',  'R'};
  constexpr std::array<unsigned char, 3> kJpeg{0xff, 0xd8, 0xff};
  std::array<unsigned char, kPng.size() + 8> start{};
  if (pread(file, start.data(), start.size(), 0) != static_cast<ssize_t>(start.size()))
    return false;
  if (reply.form != drawing::Form::Png)
    return std::ranges::equal(kJpeg, std::span(start).first<3>());
  return std::ranges::equal(kPng, std::span(start).first<kPng.size()>()) &&
         bigEndian(&start[kPng.size()]) == reply.width &&
         bigEndian(&start[kPng.size() + 4]) == reply.height;
}

/// The drawing process may be anybody by now: what it says of its result is not believed.
std::optional<DrawnPicture> accept(FileDescriptor output, const Reply& reply,
                                   const Request& request) {
  struct stat status{};
  const bool isSound =
      reply.bytes > 0 && reply.bytes <= request.bytes && reply.width > 0 && reply.height > 0 &&
      reply.width <= request.side && reply.height <= request.side &&
      (reply.form == drawing::Form::Png || request.form != drawing::Form::Png) &&
      fstat(output.get(), &status) == 0 && std::cmp_equal(status.st_size, reply.bytes) &&
      fcntl(output.get(), F_ADD_SEALS, kSeals) == 0 && fstat(output.get(), &status) == 0 &&
      std::cmp_equal(status.st_size, reply.bytes) && lseek(output.get(), 0, SEEK_SET) == 0 &&
      hasForm(output.get(), reply);
  if (!isSound) return std::nullopt;
  return DrawnPicture{std::move(output), reply.bytes, reply.width, reply.height,
                      reply.form == drawing::Form::Png};
}

}  // namespace

class PictureDrawer::Process : public DrawingProcess {
 public:
  using DrawingProcess::DrawingProcess;
  unsigned pictures = 0;
};

PictureDrawer::PictureDrawer(Options options) : options_(std::move(options)) {}

PictureDrawer::~PictureDrawer() = default;

std::unique_ptr<PictureDrawer::Process> PictureDrawer::takeProcess(NSErrorRef* error) {
  while (true) {
    std::unique_ptr<Process> process;
    {
      const LockGuard lock(mutex_);
      if (idle_.empty()) break;
      process = std::move(idle_.back());
      idle_.pop_back();
    }
    if (process->isAlive()) return process;
  }
  auto process = std::make_unique<Process>();
  const std::string program = options_.program.empty() ? programBeside() : options_.program;
  if (NSErrorRef failure = process->start(program)) {
    storeError(error, failure);
    return nullptr;
  }
  return process;
}

std::string PictureDrawer::libraries() {
  const std::filesystem::path folder(YOMBER_VIPS_FOLDER);
  std::string all;
  for (const std::string& name : namesIn(folder, "libvips.so.")) all += name + ";";
  for (const std::string& modules : namesIn(folder, "vips-modules-")) {
    for (const std::string& name : namesIn(folder / modules, "")) all += modules + "/" + name + ";";
  }
  return all;
}

void PictureDrawer::giveBack(std::unique_ptr<Process> process) {
  if (++process->pictures >= options_.picturesOfAProcess) return;
  const LockGuard lock(mutex_);
  if (idle_.size() < options_.idleProcesses) idle_.push_back(std::move(process));
}

std::optional<DrawnPicture> PictureDrawer::draw(int file, std::uint32_t side, drawing::Form form,
                                                NSErrorRef* error) {
  FileDescriptor output(memfd_create("yomber-thumbnail", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  if (!output) {
    storeError(error, NSError::errorWithErrno(errno));
    return std::nullopt;
  }
  const Request request{.side = side,
                        .form = form,
                        .processorSeconds = options_.processorSeconds,
                        .pixels = options_.pixels,
                        .bytes = options_.bytes};
  while (true) {
    std::unique_ptr<Process> process = takeProcess(error);
    if (!process) return std::nullopt;
    // One that had nothing to do for long may have ended at this very moment.
    if (!process->send(request, file, output.get())) {
      if (process->pictures > 0) continue;
      storeError(error, process->end());
      return std::nullopt;
    }
    if (drawingSent.hit()) {
      storeError(error, NSError::errorWithErrno(EIO));
      return std::nullopt;
    }
    Reply reply;
    const NSErrorRef failure = process->receive(reply, options_.patience);
    if (failure && process->pictures > 0 && process->hasRetired()) continue;
    if (failure) {
      storeError(error, failure);
      return std::nullopt;
    }
    if (reply.status != Status::Drawn) {
      giveBack(std::move(process));
      storeError(error, errorOf(reply.status));
      return std::nullopt;
    }
    auto picture = accept(std::move(output), reply, request);
    if (picture) {
      giveBack(std::move(process));
    } else {
      storeError(error, NSError::errorWithErrno(EPROTO));
    }
    return picture;
  }
}

}  // namespace yomber
