#include "zarn/content/document_drawer.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <string_view>

#include "platform/drawing/drawable_types.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/glimmet/content_types.h"
#include "platform/glimmet/installed_thumbnailers.h"

namespace yomber {
namespace {

std::string_view typeOf(const std::string& name) {
  return ContentTypes::system().typeForName(name);
}

bool isOfPicture(std::string_view type) {
  return isDrawableType(type) || type == ContentTypes::kUnknown;
}

}  // namespace

DocumentDrawer::DocumentDrawer(const Options& options)
    : pictures_(options.pictures),
      programs_(options.programs),
      ownThumbnailers_(options.thumbnailers),
      thumbnailers_(ownThumbnailers_ ? *ownThumbnailers_ : InstalledThumbnailers::system()) {}

bool DocumentDrawer::mayDraw(const std::string& name) const {
  const std::string_view type = typeOf(name);
  return isOfPicture(type) || (programs_.isAvailable() && thumbnailers_.canDraw(type));
}

bool DocumentDrawer::mayDraw(const std::string& name, int file) const {
  if (typeOf(name) != ContentTypes::kUnknown) return mayDraw(name);
  std::array<char, kDrawableStart> start{};
  const ssize_t length = pread(file, start.data(), start.size(), 0);
  return length > 0 && isDrawableStart({start.data(), static_cast<std::size_t>(length)});
}

std::int64_t DocumentDrawer::abilities() const {
  std::string all = "unknown names, " + PictureDrawer::libraries();
  if (programs_.isAvailable()) {
    for (const std::string& type : thumbnailers_.types()) all += type + ";";
    all += thumbnailers_.versions();
  }
  // Another standard library's numbers would cost another look at each document, no more.
  return static_cast<std::int64_t>(std::hash<std::string>()(all));
}

std::optional<DrawnPicture> DocumentDrawer::draw(const std::string& name, int file,
                                                 std::uint32_t side, NSErrorRef* error) {
  if (isOfPicture(typeOf(name))) return pictures_.draw(file, side, drawing::Form::Smallest, error);
  const FileDescriptor drawn = drawnByProgram(name, file, side, error);
  if (!drawn) return std::nullopt;
  return pictures_.draw(drawn.get(), side, drawing::Form::Smallest, error);
}

FileDescriptor DocumentDrawer::drawnByProgram(const std::string& name, int file, std::uint32_t side,
                                              NSErrorRef* error) const {
  struct stat status{};
  // Dropped by the store meanwhile.
  if (fstat(file, &status) == 0 && status.st_nlink == 0) {
    storeError(error, NSError::errorWithErrno(EIO));
    return {};
  }
  // Another process cannot open our descriptors by number.
  std::error_code failure;
  const auto path = std::filesystem::read_symlink(pathOfDescriptor(file), failure);
  if (failure) {
    storeError(error, NSError::errorWithErrno(failure.value()));
    return {};
  }
  return programs_.draw(thumbnailers_.commandFor(typeOf(name)), path, name, side, error);
}

}  // namespace yomber
