#include "platform/drawing/drawable_types.h"

#include <algorithm>
#include <array>

namespace yomber {

bool isDrawableType(std::string_view type) {
  static constexpr std::array<std::string_view, 14> kTypes = {"application/pdf",
                                                              "image/avif",
                                                              "image/gif",
                                                              "image/heic",
                                                              "image/heif",
                                                              "image/jpeg",
                                                              "image/jpg",
                                                              "image/pjpeg",
                                                              "image/png",
                                                              "image/svg+xml",
                                                              "image/svg+xml-compressed",
                                                              "image/tiff",
                                                              "image/webp",
                                                              "image/x-png"};
  return std::ranges::find(kTypes, type) != kTypes.end();
}

}  // namespace yomber
