#include "zarn/content/document_drawer.h"

#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
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

}  // namespace

DocumentDrawer::DocumentDrawer(const Options& options)
    : pictures_(options.pictures),
      programs_(options.programs),
      ownThumbnailers_(options.thumbnailers),
      thumbnailers_(ownThumbnailers_ ? *ownThumbnailers_ : InstalledThumbnailers::system()) {}

bool DocumentDrawer::draws(const std::string& name) const {
  const std::string_view type = typeOf(name);
  return isDrawableType(type) || (programs_.isAvailable() && thumbnailers_.canDraw(type));
}

std::optional<DrawnPicture> DocumentDrawer::draw(const std::string& name, int file,
                                                 std::uint32_t side, NSErrorRef* error) {
  if (isDrawableType(typeOf(name)))
    return pictures_.draw(file, side, drawing::Form::Smallest, error);
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
